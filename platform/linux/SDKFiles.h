#pragma once

#include "platform/PropertyList.h"
#include "platform/linux/Root.h"

#include <optional>
#include <string>

namespace platform::linux_ {

/// The SDK dictionary of the extension point, read anew from the system volume; none when there is none that can be
/// used.
std::optional<Dictionary> readSDKFile(const Root& root, const std::string& extensionPoint);

} // namespace platform::linux_
