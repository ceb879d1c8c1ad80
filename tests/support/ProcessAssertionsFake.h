#pragma once

#include "platform/ProcessAssertions.h"

#include <map>

namespace support {

/// Busy instances in a table. None until they are added.
class FakeProcessAssertions final : public platform::ProcessAssertions {
public:
    void addBusy(const std::string& identifier) {
        _busy.emplace(identifier, platform::Dictionary{{platform::instanceBundleIdentifierKey, identifier}});
    }
    /// An instance that is reported for the identifier but does not name it.
    void addIncomplete(const std::string& identifier) { _busy.emplace(identifier, platform::Dictionary()); }

    std::vector<platform::Dictionary> busyExtensionInstances(const std::set<std::string>& identifiers) override {
        std::vector<platform::Dictionary> instances;
        for (const auto& [identifier, instance] : _busy)
            if (identifiers.contains(identifier)) instances.push_back(instance);
        return instances;
    }

private:
    std::multimap<std::string, platform::Dictionary> _busy; // those of one identifier in the order they were added
};

} // namespace support
