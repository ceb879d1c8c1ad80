#pragma once

#include "platform/PropertyList.h"

#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

namespace zbd {

/// The answer of a discovery while it grows: plug-in forms in the order they were added, reduced to one for each
/// identifier unless the flags ask otherwise. A plug-in is only compared with those that share its identifier, so the
/// cost grows in proportion to the answer.
class SameIdentifierReduction {
public:
    explicit SameIdentifierReduction(std::uint64_t discoveryFlags) : _flags(discoveryFlags) {}

    /// What decides between two plug-ins of one identifier.
    struct Facts {
        std::string identifier;
        std::optional<std::string> version;
        bool onSystemVolume = false;
        std::int64_t lastModified = 0;
    };

    /// True when the plug-in belongs into the answer: `add` is to follow. A form that it replaces has left the answer
    /// by then.
    bool admit(const Facts& candidate);
    void add(const Facts& facts, platform::MutableDictionary form);

    /// The forms that stayed, in order.
    std::vector<platform::MutableDictionary> takeForms();

private:
    struct Slot {
        platform::MutableDictionary form;
        std::string version; // as the form states it
        bool onSystemVolume;
        std::int64_t lastModified;
        bool present = true;
    };
    /// The forms of one identifier that are still in the answer.
    struct Group {
        std::set<std::size_t> slots;                                  // in order
        std::set<std::pair<std::string, std::size_t>> slotsByVersion; // by comparable version, then in order
    };
    std::optional<std::size_t> rival(const Group& group, const Facts& candidate) const;
    bool winsTie(const Facts& candidate, const Slot& slot) const;
    void remove(Group& group, std::size_t index);

    std::uint64_t _flags;
    std::vector<Slot> _slots;
    std::unordered_map<std::string, Group> _groups;
};

} // namespace zbd
