#pragma once

#include "platform/Processes.h"

namespace platform::linux_ {

/// What /proc says of processes. A path is answered only when it names, as this process sees the file tree, the very
/// file that runs: a program that was deleted or replaced, or that is seen under that path in a mount namespace of
/// its own only, has none (ENOENT). So nobody gets the path, and with it the bundle, of another program.
class Processes final : public platform::Processes {
public:
    Result<std::string> executablePath(std::int32_t pid, std::size_t bufferSize) override;
    Result<std::string> executablePath(const AuditToken& peer, std::size_t bufferSize) override;
    std::optional<std::string> environmentVariable(const std::string& name) override;
};

} // namespace platform::linux_
