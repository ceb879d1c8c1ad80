#include "zbd/SameIdentifierReduction.h"

#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

#include <utility>

namespace zbd {

using zembra::comparableVersion;

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
    const bool onlyEqualVersions = (_flags & zembra::ZBDiscoverAllVersions) != 0 && candidate.version;
    if (!group.several) {
        if (!group.only || !onlyEqualVersions) return group.only;
        const bool isEqual = zembra::compareVersionString(*candidate.version, _slots[*group.only].version) == 0;
        return isEqual ? group.only : std::nullopt;
    }
    const Several& several = *group.several;
    if (onlyEqualVersions) {
        const std::string version = comparableVersion(*candidate.version);
        const auto found = several.slotsByVersion.lower_bound({version, 0});
        if (found == several.slotsByVersion.end() || found->first != version) return std::nullopt;
        return found->second;
    }
    return several.slots.empty() ? std::nullopt : std::optional(*several.slots.begin());
}

bool SameIdentifierReduction::winsTie(const Facts& candidate, const Slot& slot) const {
    if (candidate.onSystemVolume != slot.onSystemVolume) return candidate.onSystemVolume;
    return candidate.lastModified > slot.lastModified;
}

void SameIdentifierReduction::remove(Group& group, std::size_t index) {
    Slot& slot = _slots[index];
    slot.present = false;
    _encodedSize -= slot.encodedSize;
    if (!group.several) return group.only.reset();
    group.several->slots.erase(index);
    group.several->slotsByVersion.erase({comparableVersion(slot.version), index});
}

void SameIdentifierReduction::put(Several& several, std::size_t index) const {
    several.slots.insert(index);
    several.slotsByVersion.emplace(comparableVersion(_slots[index].version), index);
}

void SameIdentifierReduction::add(const Facts& facts, AnswerForm form) {
    const std::size_t index = _slots.size();
    const std::size_t encodedSize = platform::compactSize(form.form());
    _encodedSize += encodedSize;
    _slots.push_back(
        {std::move(form), facts.version.value_or(noVersion), facts.onSystemVolume, facts.lastModified, encodedSize});
    Group& group = _groups[facts.identifier];
    if (!group.several && !group.only) {
        group.only = index;
        return;
    }
    if (!group.several) {
        group.several = std::make_unique<Several>();
        put(*group.several, *std::exchange(group.only, std::nullopt));
    }
    put(*group.several, index);
}

std::vector<AnswerForm> SameIdentifierReduction::takeForms() {
    std::vector<AnswerForm> forms;
    forms.reserve(_slots.size());
    for (Slot& slot : _slots) {
        if (slot.present) forms.push_back(std::move(slot.form));
    }
    return forms;
}

} // namespace zbd
