#include "platform/linux/ActivationRules.h"

namespace platform::linux_ {

bool ActivationRules::evaluate(const Value& /*activationRule*/, const Dictionary& /*extensionItems*/) { return false; }

} // namespace platform::linux_
