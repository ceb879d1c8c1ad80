#pragma once

#include "platform/Processes.h"

#include <cerrno>
#include <map>

namespace support {

/// A process table in memory. It is empty, so every process is gone, until told otherwise; peers go by their pid.
class FakeProcesses final : public platform::Processes {
public:
    std::map<std::int32_t, std::string> paths;
    std::map<std::string, std::string> environment;

    platform::Result<std::string> executablePath(std::int32_t pid, std::size_t bufferSize) override {
        const auto path = paths.find(pid);
        if (path == paths.end()) return platform::Error{platform::posixErrorDomain, ESRCH, "No such process"};
        if (path->second.size() < bufferSize) return path->second;
        return platform::Error{platform::posixErrorDomain, ENAMETOOLONG, "File name too long"};
    }
    platform::Result<std::string> executablePath(const platform::AuditToken& peer, std::size_t bufferSize) override {
        return executablePath(peer.pid, bufferSize);
    }
    std::optional<std::string> environmentVariable(const std::string& name) override {
        const auto variable = environment.find(name);
        return variable == environment.end() ? std::nullopt : std::optional(variable->second);
    }
};

} // namespace support
