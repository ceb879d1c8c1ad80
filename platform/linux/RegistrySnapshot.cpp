#include "platform/linux/RegistrySnapshot.h"

#include "platform/linux/DirectoryFiles.h"

#include <algorithm>
#include <iterator>
#include <utility>

namespace platform::linux_ {

namespace {

/// Hosts choose the keys; an index costs eight bytes for each plug-in that has a value.
constexpr std::size_t maximumIndexes = 16;

} // namespace

RegistrySnapshot::RegistrySnapshot(Installed installed, Knowledge knowledge)
    : _knowledge(knowledge), _applications(std::move(installed.applications)) {
    struct Place {
        UUID uuid;
        std::uint32_t byPath; // the number of the plug-in in the order of the paths
    };
    std::vector<Place> places;
    places.reserve(installed.plugIns.size());
    for (const auto& plugIn : installed.plugIns)
        places.push_back({plugIn->uuid, static_cast<std::uint32_t>(places.size())});
    std::ranges::sort(places, {}, &Place::uuid);
    _plugIns.reserve(places.size());
    _byPath.resize(places.size());
    for (const auto& [uuid, byPath] : places) {
        _byPath[byPath] = static_cast<std::uint32_t>(_plugIns.size());
        _plugIns.push_back(std::move(installed.plugIns[byPath]));
    }
}

InstalledPlugInRef RegistrySnapshot::plugIn(const UUID& uuid) const {
    const auto found = std::ranges::lower_bound(_plugIns, uuid, {}, [](const auto& plugIn) { return plugIn->uuid; });
    return found != _plugIns.end() && (*found)->uuid == uuid ? *found : nullptr;
}

InstalledPlugInRef RegistrySnapshot::plugInAt(std::string_view path) const {
    const auto found = std::ranges::lower_bound(
        _byPath, path, {}, [&](std::uint32_t position) { return std::string_view(_plugIns[position]->path); });
    return found != _byPath.end() && _plugIns[*found]->path == path ? _plugIns[*found] : nullptr;
}

InstalledApplicationRef RegistrySnapshot::applicationAt(std::string_view path) const {
    const auto found = std::ranges::lower_bound(
        _applications, path, {}, [](const auto& application) { return std::string_view(application->path); });
    return found != _applications.end() && (*found)->path == path ? *found : nullptr;
}

std::vector<InstalledPlugInRef> RegistrySnapshot::plugInsOf(std::string_view applicationPath) const {
    std::vector<InstalledPlugInRef> answer;
    // A plug-in lies below its application.
    const std::string below = std::string(applicationPath) + "/";
    auto position = std::ranges::lower_bound(
        _byPath, below, {}, [&](std::uint32_t candidate) { return std::string_view(_plugIns[candidate]->path); });
    for (; position != _byPath.end() && _plugIns[*position]->path.starts_with(below); ++position) {
        const auto& plugIn = _plugIns[*position];
        if (plugIn->application && plugIn->application->path == applicationPath) answer.push_back(plugIn);
    }
    return answer;
}

std::shared_ptr<const RegistrySnapshot::Index> RegistrySnapshot::knownIndex(const std::string& key) const {
    const auto found = std::ranges::find(_indexes, key, &KeyIndex::first);
    if (found == _indexes.end()) return nullptr;
    _indexes.splice(_indexes.begin(), _indexes, found);
    return found->second;
}

/// The index of the key of each test.
std::vector<std::shared_ptr<const RegistrySnapshot::Index>>
RegistrySnapshot::indexesFor(const std::vector<EqualityTest>& tests) const {
    /// An index that nobody has made yet.
    struct Missing {
        const std::string* key;
        std::shared_ptr<Index> index;
        std::vector<std::uint64_t> pairs; // a hash, and in the lower half a position
    };
    const std::lock_guard lock(_mutex); // held on: who asks for the same key meanwhile waits instead of making it too
    std::vector<std::shared_ptr<const Index>> indexes;
    std::vector<Missing> missing;
    for (const auto& test : tests) {
        indexes.push_back(knownIndex(test.key));
        if (indexes.back()) continue;
        auto& made = missing.emplace_back(&test.key, std::make_shared<Index>());
        made.pairs.reserve(_plugIns.size());
        indexes.back() = made.index;
    }
    if (missing.empty()) return indexes;
    // All on one walk, and by the paths, for so the manifests lie in memory after a start.
    for (const std::uint32_t position : _byPath) {
        for (auto& [key, index, pairs] : missing) {
            visitForEquality(*_plugIns[position], *key, [&](std::string_view text) {
                pairs.push_back(std::uint64_t{hashForEquality(text)} << 32U | position);
            });
        }
    }
    for (auto& [key, index, pairs] : missing) {
        std::ranges::sort(pairs);
        const auto doubles = std::ranges::unique(pairs);
        pairs.erase(doubles.begin(), doubles.end());
        index->hashes.reserve(pairs.size());
        index->positions.reserve(pairs.size());
        for (const auto pair : pairs) {
            index->hashes.push_back(static_cast<std::uint32_t>(pair >> 32U));
            index->positions.push_back(static_cast<std::uint32_t>(pair));
        }
        _indexes.emplace_front(*key, index);
        if (_indexes.size() > maximumIndexes) _indexes.pop_back();
    }
    return indexes;
}

RegistrySnapshot::Run RegistrySnapshot::Index::run(std::uint32_t hash) const {
    const auto found = std::ranges::equal_range(hashes, hash);
    return Run(positions).subspan(static_cast<std::size_t>(found.begin() - hashes.begin()), found.size());
}

RegistrySnapshot::Positions RegistrySnapshot::positionsMatching(const std::vector<EqualityTest>& tests) const {
    /// What passes one test: a run for each of its values.
    struct Answer {
        std::shared_ptr<const Index> index;
        std::vector<Run> runs;
        std::size_t size = 0;
    };
    std::vector<Answer> answers;
    const auto indexes = indexesFor(tests);
    for (std::size_t i = 0; i < tests.size(); ++i) {
        Answer answer{indexes[i], {}, 0};
        for (const auto& value : tests[i].values) {
            const Run run = answer.index->run(hashForEquality(value));
            answer.size += run.size();
            if (!run.empty()) answer.runs.push_back(run);
        }
        if (answer.runs.empty()) return {};
        answers.push_back(std::move(answer));
    }
    std::ranges::sort(answers, {}, &Answer::size);
    const Answer& smallest = answers.front();
    Positions positions;
    Run left = smallest.runs.front(); // of what passes all tests so far
    if (smallest.runs.size() > 1 || answers.size() == 1) left = positions = positionsOf(smallest.runs, smallest.size);
    for (const auto& other : std::span(answers).subspan(1)) {
        Positions both;
        if (other.runs.size() == 1) {
            Run rest = other.runs.front();
            for (const auto position : left) {
                if (skipTo(rest, position)) both.push_back(position);
            }
        } else if (left.size() * other.runs.size() <= other.size) {
            // Few are looked for in each run. Many would be walked for each run again.
            std::vector<char> isIn(left.size());
            for (Run rest : other.runs) {
                for (std::size_t i = 0; i < left.size(); ++i) {
                    if (skipTo(rest, left[i])) isIn[i] = 1;
                }
            }
            for (std::size_t i = 0; i < left.size(); ++i) {
                if (isIn[i] != 0) both.push_back(left[i]);
            }
        } else {
            std::ranges::set_intersection(left, positionsOf(other.runs, other.size), std::back_inserter(both));
        }
        left = positions = std::move(both);
    }
    return positions;
}

/// Rising, each once: several values, or several elements of one, may name the same plug-in. `size` is that of all
/// runs.
RegistrySnapshot::Positions RegistrySnapshot::positionsOf(const std::vector<Run>& runs, std::size_t size) {
    Positions positions;
    positions.reserve(size);
    for (const Run run : runs) positions.insert(positions.end(), run.begin(), run.end());
    if (!std::ranges::is_sorted(positions)) std::ranges::sort(positions);
    const auto doubles = std::ranges::unique(positions);
    positions.erase(doubles.begin(), doubles.end());
    return positions;
}

/// Leaves out what lies before `position`, in steps that double: answers of like sizes are walked side by side, and of
/// a long one most is never looked at. True when `position` comes next.
bool RegistrySnapshot::skipTo(Run& rest, std::uint32_t position) {
    std::size_t step = 1;
    while (step < rest.size() && rest[step] < position) step *= 2;
    const auto end = rest.begin() + static_cast<std::ptrdiff_t>(std::min(step + 1, rest.size()));
    const auto begin = rest.begin() + static_cast<std::ptrdiff_t>(std::min(step / 2, rest.size()));
    rest = {std::lower_bound(begin, end, position), rest.end()};
    return !rest.empty() && rest.front() == position;
}

std::vector<InstalledPlugInRef> RegistrySnapshot::matching(const std::vector<EqualityTest>& tests) const {
    if (tests.empty()) return _plugIns;
    const Positions positions = positionsMatching(tests);
    std::vector<InstalledPlugInRef> plugIns;
    plugIns.reserve(positions.size());
    for (const auto position : positions) plugIns.push_back(_plugIns[position]);
    return plugIns;
}

} // namespace platform::linux_
