#pragma once

#include "platform/Containers.h"

#include <cerrno>
#include <map>

namespace support {

/// Containers in memory. Refuses with EACCES what was not allowed.
class FakeContainers final : public platform::Containers {
public:
    /// When not zero, every request fails with this number.
    int failure = 0;

    void allow(const std::string& identifier, const std::string& path) { _paths[identifier] = path; }

    platform::Result<std::string> userContainer(const std::string& identifier) override {
        const auto found = _paths.find(identifier);
        if (failure == 0 && found != _paths.end()) return found->second;
        return platform::Error{platform::posixErrorDomain, failure != 0 ? failure : EACCES, "container refused"};
    }
    void discardEmpty(const std::string& /*identifier*/) override {}

private:
    std::map<std::string, std::string> _paths;
};

} // namespace support
