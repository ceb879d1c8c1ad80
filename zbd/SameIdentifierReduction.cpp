#include "zbd/SameIdentifierReduction.h"

#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

#include <utility>

namespace zbd {

using zembra::comparableVersion;

namespace {

/// What a form states for a plug-in without a version.
constexpr std::string_view noVersion = "<none>";

} // namespace

bool SameIdentifierReduction::admit(const Facts& candidate) {
    const bool allVersions = (_flags & zembra::ZBDiscoverAllVersions) != 0;
    if (allVersions && (_flags & zembra::ZBDiscoverDuplicates) != 0) return true;
    const auto found = _groups.find(candidate.identifier);
    if (found == _groups.end()) return true;
    Group& group = found->second;
    const auto index = rival(group, candidate);
    if (!index) return true;
    const Slot& slot = _slots[*index];
    const auto order = candidate.version ? zembra::compareVersionString(*candidate.version, slot.version)
                                         : std::weak_ordering::equivalent;
    const bool wins = order == 0 ? winsTie(candidate, slot) : order > 0;
    if (wins) remove(group, *index);
    return wins;
}

/// The first form in order that the candidate has to be compared with to the end.
std::optional<std::size_t> SameIdentifierReduction::rival(const Group& group, const Facts& candidate) const {
    const bool onlyEqualVersions = (_flags & zembra::ZBDiscoverAllVersions) != 0;
    if (onlyEqualVersions && candidate.version) {
        const std::string version = comparableVersion(*candidate.version);
        const auto found = group.slotsByVersion.lower_bound({version, 0});
        if (found == group.slotsByVersion.end() || found->first != version) return std::nullopt;
        return found->second;
    }
    return group.slots.empty() ? std::nullopt : std::optional(*group.slots.begin());
}

bool SameIdentifierReduction::winsTie(const Facts& candidate, const Slot& slot) const {
    if (candidate.onSystemVolume != slot.onSystemVolume) return candidate.onSystemVolume;
    return candidate.lastModified > slot.lastModified;
}

void SameIdentifierReduction::remove(Group& group, std::size_t index) {
    _slots[index].present = false;
    group.slots.erase(index);
    group.slotsByVersion.erase({comparableVersion(_slots[index].version), index});
}

void SameIdentifierReduction::add(const Facts& facts, platform::MutableDictionary form) {
    const std::string version = facts.version.value_or(std::string(noVersion));
    Group& group = _groups[facts.identifier];
    group.slots.insert(_slots.size());
    group.slotsByVersion.emplace(comparableVersion(version), _slots.size());
    _slots.push_back({std::move(form), version, facts.onSystemVolume, facts.lastModified});
}

std::vector<platform::MutableDictionary> SameIdentifierReduction::takeForms() {
    std::vector<platform::MutableDictionary> forms;
    for (Slot& slot : _slots) {
        if (slot.present) forms.push_back(std::move(slot.form));
    }
    return forms;
}

} // namespace zbd
