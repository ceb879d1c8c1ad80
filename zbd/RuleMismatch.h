#pragma once

#include "platform/PropertyList.h"

#include <string>

namespace zbd {

/// The rule that a plug-in does not fulfil, and what it compared.
struct RuleMismatch {
    std::string key;
    platform::Value pattern;
    platform::Value value; // the plug-in's; absent when it has none
};

} // namespace zbd
