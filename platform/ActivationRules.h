#pragma once

#include "platform/PropertyList.h"

namespace platform {

/// Judges whether a plug-in's activation rule accepts the items that a host has at hand.
class ActivationRules {
public:
    virtual ~ActivationRules() = default;
    virtual bool evaluate(const Value& activationRule, const Dictionary& extensionItems) = 0;
};

} // namespace platform
