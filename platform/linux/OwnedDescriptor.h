#pragma once

#include "platform/linux/Descriptor.h"
#include "platform/linux/SystemError.h"

namespace platform::linux_ {

using OwnedDescriptor = Descriptor;

} // namespace platform::linux_
