#pragma once

#include "platform/linux/RegistryQuery.h"
#include "platform/linux/RegistryRecord.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <list>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace platform::linux_ {

/// Everything the registry knew at one moment, for any number of readers on any threads.
class RegistrySnapshot {
public:
    /// Without the plug-ins at the paths in `hidden`.
    RegistrySnapshot(const PlugIns& plugIns, const Applications& applications, Knowledge knowledge,
                     const PlugIns& hidden = {});

    const Knowledge& knowledge() const { return _knowledge; }
    /// Ordered by UUID.
    const std::vector<InstalledPlugInRef>& plugIns() const { return _plugIns; }
    InstalledPlugInRef plugIn(const UUID& uuid) const;
    InstalledPlugInRef plugInAt(std::string_view path) const;
    InstalledApplicationRef applicationAt(std::string_view path) const;
    /// In the order of their paths.
    std::vector<InstalledPlugInRef> plugInsOf(std::string_view applicationPath) const;

    /// The plug-ins that pass every one of the tests, ordered by UUID; all of them when there are no tests. Costs the
    /// size of the smallest answer to one of the tests, once a key was asked for.
    std::vector<InstalledPlugInRef> matching(const std::vector<EqualityTest>& tests) const;

private:
    using Positions = std::vector<std::uint32_t>; // in `_plugIns`, rising
    struct Hash {
        using is_transparent = void;
        std::size_t operator()(std::string_view text) const { return std::hash<std::string_view>()(text); }
    };
    using Index = std::unordered_map<std::string, Positions, Hash, std::equal_to<>>; // by normalized value

    std::shared_ptr<const Index> indexFor(const std::string& key) const;

    const Knowledge _knowledge;
    std::vector<InstalledPlugInRef> _plugIns;
    Positions _byPath;
    std::vector<InstalledApplicationRef> _applications; // ordered by path

    mutable std::mutex _mutex;
    mutable std::list<std::pair<std::string, std::shared_ptr<const Index>>> _indexes; // the last used one first
};

} // namespace platform::linux_
