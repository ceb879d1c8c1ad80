#pragma once

#include "platform/WorkQueue.h"

#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace platform {

/// Ends when destroyed.
class LocaleObservation {
public:
    virtual ~LocaleObservation() = default;
};

/// The user's languages, and the notice that they changed.
class Locale {
public:
    virtual ~Locale() = default;
    /// Most preferred first, as in "de", "pt-BR". Never empty: "en" stands last, unless it is preferred to others.
    virtual std::vector<std::string> languages() = 0;
    /// Calls `handler` on `queue` after each change.
    virtual std::unique_ptr<LocaleObservation> observeChanges(std::shared_ptr<WorkQueue> queue,
                                                              std::function<void()> handler) = 0;
};

} // namespace platform
