#pragma once

#include "platform/ActivationRules.h"

namespace platform::linux_ {

/// No rule language is installed on this platform, so no rule accepts anything: a host that asks by items gets no
/// plug-in rather than any. Any thread.
class ActivationRules final : public platform::ActivationRules {
public:
    bool evaluate(const Value& activationRule, const Dictionary& extensionItems) override;
};

} // namespace platform::linux_
