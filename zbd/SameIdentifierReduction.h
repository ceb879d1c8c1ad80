#pragma once

#include "platform/PropertyList.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <memory_resource>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

namespace zbd {

/// A form in an answer: one of the answer's own, or one that others have too.
class AnswerForm {
public:
    AnswerForm(platform::MutableDictionary own) : _form(std::move(own)) {} // NOLINT(google-explicit-constructor)
    /// `kept` keeps its encoding.
    static AnswerForm shared(const platform::Dictionary& kept) { return AnswerForm(kept); }

    const platform::Dictionary& form() const {
        const auto* const own = std::get_if<platform::MutableDictionary>(&_form);
        return own ? *own : std::get<platform::Dictionary>(_form);
    }
    /// To be changed; the answer's own from now on.
    platform::MutableDictionary& ownForm() {
        if (const auto* const kept = std::get_if<platform::Dictionary>(&_form))
            _form = platform::MutableDictionary::extending(platform::Dictionary(*kept));
        return std::get<platform::MutableDictionary>(_form);
    }

private:
    explicit AnswerForm(const platform::Dictionary& kept) : _form(kept) {}
    std::variant<platform::Dictionary, platform::MutableDictionary> _form;
};

/// What decides between two plug-ins of one identifier; the version is the one that the form states. The texts have to
/// stay good elsewhere.
struct ReductionFacts {
    /// With its hash: an answer of thousands does not have to look at the texts.
    struct Identifier {
        Identifier(std::string_view identifier) // NOLINT(google-explicit-constructor)
            : text(identifier), hash(std::hash<std::string_view>()(identifier)) {}
        std::string_view text;
        std::size_t hash;
        friend bool operator==(const Identifier& left, const Identifier& right) {
            return left.hash == right.hash && left.text == right.text;
        }
    };
    Identifier identifier;
    std::optional<std::string_view> version;
    bool onSystemVolume = false;
    std::int64_t lastModified = 0;
};

/// The answer of a discovery while it grows: plug-in forms in the order they were added, reduced to one for each
/// identifier unless the flags ask otherwise. A plug-in is only compared with those that share its identifier, so the
/// cost grows in proportion to the answer.
class SameIdentifierReduction {
public:
    explicit SameIdentifierReduction(std::uint64_t discoveryFlags) : _flags(discoveryFlags) {}

    /// What a form states for a plug-in without a version.
    static constexpr std::string_view noVersion = "<none>";

    /// The texts of those that were added have to stay good as long as the reduction is used.
    using Facts = ReductionFacts;

    /// True when the plug-in belongs into the answer: `add` is to follow. A form that it replaces has left the answer
    /// by then.
    bool admit(const Facts& candidate);
    void add(const Facts& facts, AnswerForm form);

    /// What the forms take in an encoded array, so far.
    std::size_t encodedSize() const { return _encodedSize; }

    /// The forms that stayed, in order.
    std::vector<AnswerForm> takeForms();

private:
    struct Slot {
        AnswerForm form;
        std::string_view version; // as the form states it
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
    struct Hash {
        std::size_t operator()(const Facts::Identifier& identifier) const { return identifier.hash; }
    };
    std::pmr::monotonic_buffer_resource _memory; // of the groups, which go together
    std::pmr::unordered_map<Facts::Identifier, Group, Hash> _groups{&_memory};
};

} // namespace zbd
