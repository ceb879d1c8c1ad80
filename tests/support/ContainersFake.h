#pragma once

#include "platform/Containers.h"

#include <cerrno>
#include <map>
#include <string>
#include <vector>

namespace support {

/// Containers in memory. Refuses with EACCES what was not allowed.
class FakeContainers final : public platform::Containers {
public:
    /// When not zero, every request fails with this number.
    int failure = 0;
    /// Every identifier asked for.
    std::vector<std::string> asked;
    /// Every identifier whose container was not wanted any longer.
    std::vector<std::string> discarded;

    void allow(const std::string& identifier, const std::string& path) { _paths[identifier] = path; }

    platform::Result<std::string> userContainer(const std::string& identifier) override {
        asked.push_back(identifier);
        const auto found = _paths.find(identifier);
        if (failure == 0 && found != _paths.end()) return found->second;
        return platform::Error{platform::posixErrorDomain, failure != 0 ? failure : EACCES, "container refused"};
    }
    void discardEmpty(const std::string& identifier) override { discarded.push_back(identifier); }

private:
    std::map<std::string, std::string> _paths;
};

} // namespace support
