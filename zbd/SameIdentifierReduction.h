#pragma once

#include "platform/PropertyList.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
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

    /// What a form states for a plug-in without a version.
    static constexpr std::string_view noVersion = "<none>";

    /// What decides between two plug-ins of one identifier; the version is the one that the form states.
    struct Facts {
        std::string identifier;
        std::optional<std::string> version;
        bool onSystemVolume = false;
        std::int64_t lastModified = 0;
    };

    /// True when the plug-in belongs into the answer: `add` is to follow. A form that it replaces has left the answer
    /// by then.
    bool admit(const Facts& candidate);
    void add(Facts facts, platform::MutableDictionary form);

    /// What the forms take in an encoded array, so far.
    std::size_t encodedSize() const { return _encodedSize; }

    /// The forms that stayed, in order.
    std::vector<platform::MutableDictionary> takeForms();

private:
    struct Slot {
        platform::MutableDictionary form;
        std::string version; // as the form states it
        bool onSystemVolume;
        std::int64_t lastModified;
        std::size_t encodedSize;
        bool present = true;
    };
    /// Several forms of one identifier that are still in the answer.
    struct Several {
        std::set<std::size_t> slots;                                  // in order
        std::set<std::pair<std::string, std::size_t>> slotsByVersion; // by comparable version, then in order
    };
    /// Most identifiers occur once, and need no sets.
    struct Group {
        std::optional<std::size_t> only;
        std::unique_ptr<Several> several; // once there was a second one
    };
    void put(Several& several, std::size_t index) const;
    std::optional<std::size_t> rival(const Group& group, const Facts& candidate) const;
    bool winsTie(const Facts& candidate, const Slot& slot) const;
    void remove(Group& group, std::size_t index);

    std::uint64_t _flags;
    std::size_t _encodedSize = 0;
    std::vector<Slot> _slots;
    std::unordered_map<std::string, Group> _groups;
};

} // namespace zbd
