#pragma once

#include "platform/PropertyList.h"
#include "zbd/SameIdentifierReduction.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

namespace zbd {

/// What the tokens of a form are for.
struct TokenNeeds {
    platform::Value resources;                      // to read; absent when nothing is shared
    std::optional<platform::Value> serviceOfBundle; // identifier of the bundle whose service is looked up
};

/// What annotations and tokens were set with.
struct FormCompletion {
    std::uint64_t annotationsVersion = 0; // as the annotation store counts, from 1
    std::chrono::steady_clock::time_point time;
};

/// When a kept form was completed last. Any thread.
class LastCompletion {
public:
    LastCompletion() = default;
    explicit LastCompletion(const FormCompletion& completion) { set(completion); }
    LastCompletion(const LastCompletion& other) : LastCompletion(other.get()) {}
    LastCompletion& operator=(const LastCompletion&) = delete;

    void set(const FormCompletion& completion) const {
        _time.store(completion.time, std::memory_order_relaxed);
        _annotationsVersion.store(completion.annotationsVersion, std::memory_order_relaxed);
    }
    FormCompletion get() const {
        return {_annotationsVersion.load(std::memory_order_relaxed), _time.load(std::memory_order_relaxed)};
    }

private:
    mutable std::atomic<std::uint64_t> _annotationsVersion = 0;
    mutable std::atomic<std::chrono::steady_clock::time_point> _time;
};

/// What of a plug-in does not change from answer to answer while its manifest stays the same, in one place: answers of
/// a thousand plug-ins have no time to look for it.
struct KeptForm {
    platform::Dictionary manifest; // the one it was made from
    platform::Dictionary form;     // with its encoding, and with the annotations and tokens of the last answer
    TokenNeeds tokens;
    ReductionFacts facts; // its texts are those of the record and of the form
    std::string listing;  // what lists of candidates in the log show
    bool isContained = false;
    bool isDedicated = false;
    bool requiresEntitlement = false; // of its hosts
    bool replacesOthers = false;
    LastCompletion lastCompletion;
};
using KeptFormRef = std::shared_ptr<const KeptForm>;

} // namespace zbd
