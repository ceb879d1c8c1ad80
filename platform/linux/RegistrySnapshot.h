#pragma once

#include "platform/linux/RegistryQuery.h"
#include "platform/linux/RegistryRecord.h"

#include <compare>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace platform::linux_ {

/// Everything the registry knew at one moment, for any number of readers on any threads.
class RegistrySnapshot {
public:
    RegistrySnapshot(Installed installed, Knowledge knowledge);

    const Knowledge& knowledge() const { return _knowledge; }
    /// Ordered by UUID.
    const std::vector<InstalledPlugInRef>& plugIns() const { return _plugIns; }
    InstalledPlugInRef plugIn(const UUID& uuid) const;
    InstalledPlugInRef plugInAt(std::string_view path) const;
    InstalledApplicationRef applicationAt(std::string_view path) const;
    /// In the order of their paths.
    std::vector<InstalledPlugInRef> plugInsOf(std::string_view applicationPath) const;

    /// The plug-ins that pass every one of the tests, and perhaps a few others, ordered by UUID; all of them when there
    /// are no tests. Costs about the size of the smallest answer to one of the tests, once a key was asked for, and
    /// never more than the sizes of all together.
    std::vector<InstalledPlugInRef> matching(const std::vector<EqualityTest>& tests) const;

private:
    using Positions = std::vector<std::uint32_t>; // in `_plugIns`
    using Run = std::span<const std::uint32_t>;   // positions, rising
    /// The plug-ins under each of their values for a key. The values by their hashes alone: these take a tenth of the
    /// memory, and two values with one hash make an answer larger, never smaller. Two arrays side by side, each pair of
    /// elements once and rising: the positions of one value lie close together.
    struct Index {
        std::vector<std::uint32_t> hashes;
        Positions positions;

        Run run(std::uint32_t hash) const;
    };

    using KeyIndex = std::pair<std::string, std::shared_ptr<const Index>>;

    std::shared_ptr<const Index> knownIndex(const std::string& key) const;
    std::vector<std::shared_ptr<const Index>> indexesFor(const std::vector<EqualityTest>& tests) const;
    Positions positionsMatching(const std::vector<EqualityTest>& tests) const;
    static Positions positionsOf(const std::vector<Run>& runs, std::size_t size);
    static bool skipTo(Run& rest, std::uint32_t position);

    const Knowledge _knowledge;
    std::vector<InstalledPlugInRef> _plugIns;
    Positions _byPath;
    std::vector<InstalledApplicationRef> _applications; // ordered by path

    mutable std::mutex _mutex;
    mutable std::list<KeyIndex> _indexes; // the last used one first
};

} // namespace platform::linux_
