#pragma once

#include "platform/Error.h"
#include "platform/Transport.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace platform {

class Processes {
public:
    virtual ~Processes() = default;
    /// The executable's path of the process now running under `pid`. The error carries errno: ESRCH when the process
    /// is gone, ENOENT when its program was deleted or replaced since it started, ENAMETOOLONG when the path does not
    /// fit `bufferSize` bytes with its NUL.
    virtual Result<std::string> executablePath(std::int32_t pid, std::size_t bufferSize) = 0;
    /// The same for a connected peer: ESRCH also when the pid belongs to another process by now, or the peer runs
    /// another program than when it connected.
    virtual Result<std::string> executablePath(const AuditToken& peer, std::size_t bufferSize) = 0;
    /// This process's own environment variable; none when it is not set.
    virtual std::optional<std::string> environmentVariable(const std::string& name) = 0;
};

} // namespace platform
