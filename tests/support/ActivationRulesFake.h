#pragma once

#include "platform/ActivationRules.h"

#include <utility>
#include <vector>

namespace support {

/// Accepts nothing until it is told to.
class FakeActivationRules final : public platform::ActivationRules {
public:
    bool verdict = false;
    /// Every rule and items that were asked about.
    std::vector<std::pair<platform::Value, platform::Dictionary>> asked;

    bool evaluate(const platform::Value& activationRule, const platform::Dictionary& extensionItems) override {
        asked.emplace_back(activationRule, extensionItems);
        return verdict;
    }
};

} // namespace support
