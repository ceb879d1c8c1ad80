#include "platform/linux/RegistrySnapshot.h"

#include "platform/linux/DirectoryFiles.h"

#include <algorithm>
#include <numeric>

namespace platform::linux_ {

namespace {

/// Hosts choose the keys they ask for; more of them than this take turns.
constexpr std::size_t maximumIndexes = 16;

} // namespace

RegistrySnapshot::RegistrySnapshot(const PlugIns& plugIns, const Applications& applications, Knowledge knowledge,
                                   const PlugIns& hidden)
    : _knowledge(knowledge) {
    _plugIns.reserve(plugIns.size());
    for (const auto& [path, plugIn] : plugIns) {
        if (!hidden.contains(path)) _plugIns.push_back(plugIn);
    }
    std::ranges::sort(_plugIns, {}, [](const auto& plugIn) { return plugIn->uuid; });
    _byPath.resize(_plugIns.size());
    std::iota(_byPath.begin(), _byPath.end(), 0U);
    std::ranges::sort(_byPath, {}, [&](std::uint32_t position) { return std::string_view(_plugIns[position]->path); });
    _applications.reserve(applications.size());
    for (const auto& [path, application] : applications) _applications.push_back(application);
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

std::shared_ptr<const RegistrySnapshot::Index> RegistrySnapshot::indexFor(const std::string& key) const {
    const std::lock_guard lock(_mutex);
    const auto known = std::ranges::find(_indexes, key, [](const auto& entry) { return entry.first; });
    if (known != _indexes.end()) {
        _indexes.splice(_indexes.begin(), _indexes, known);
        return known->second;
    }
    auto index = std::make_shared<Index>();
    for (std::uint32_t position = 0; position < _plugIns.size(); ++position) {
        for (auto& value : valuesForEquality(*_plugIns[position], key)) (*index)[std::move(value)].push_back(position);
    }
    _indexes.emplace_front(key, index);
    if (_indexes.size() > maximumIndexes) _indexes.pop_back();
    return index;
}

std::vector<InstalledPlugInRef> RegistrySnapshot::matching(const std::vector<EqualityTest>& tests) const {
    if (tests.empty()) return _plugIns;
    std::vector<Positions> answers;
    for (const auto& test : tests) {
        const auto index = indexFor(test.key);
        Positions answer;
        for (const auto& value : test.values) {
            const auto found = index->find(value);
            if (found != index->end()) answer.insert(answer.end(), found->second.begin(), found->second.end());
        }
        // Several values, or several elements of one, may name the same plug-in.
        std::ranges::sort(answer);
        const auto doubles = std::ranges::unique(answer);
        answer.erase(doubles.begin(), doubles.end());
        if (answer.empty()) return {};
        answers.push_back(std::move(answer));
    }
    const auto smallest = std::ranges::min_element(answers, {}, &Positions::size);
    std::vector<InstalledPlugInRef> plugIns;
    for (const auto position : *smallest) {
        const bool passes = std::ranges::all_of(
            answers, [&](const Positions& answer) { return std::ranges::binary_search(answer, position); });
        if (passes) plugIns.push_back(_plugIns[position]);
    }
    return plugIns;
}

} // namespace platform::linux_
