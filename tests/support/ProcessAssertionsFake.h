#pragma once

#include "platform/ProcessAssertions.h"

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace support {

/// Busy instances in a table. None until they are added.
class FakeProcessAssertions final : public platform::ProcessAssertions {
public:
    /// Every set of identifiers asked about.
    std::vector<std::set<std::string>> asked;

    void addBusy(const std::string& bundleIdentifier) {
        _busy.emplace(bundleIdentifier,
                      platform::Dictionary{{platform::instanceBundleIdentifierKey, bundleIdentifier}});
    }
    /// An instance that is reported for the identifier but does not name it.
    void addIncomplete(const std::string& bundleIdentifier) { _busy.emplace(bundleIdentifier, platform::Dictionary()); }
    /// Its instances are idle again.
    void endBusy(const std::string& bundleIdentifier) { _busy.erase(bundleIdentifier); }

    std::vector<platform::Dictionary> busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) override {
        asked.push_back(bundleIdentifiers);
        std::vector<platform::Dictionary> instances;
        for (const auto& [identifier, instance] : _busy) {
            if (bundleIdentifiers.contains(identifier)) instances.push_back(instance);
        }
        return instances;
    }

private:
    std::multimap<std::string, platform::Dictionary> _busy; // those of one identifier in the order they were added
};

} // namespace support
