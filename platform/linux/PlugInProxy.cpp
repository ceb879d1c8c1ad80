#include "platform/Registry.h"

namespace platform {

std::string PlugInProxy::description() const {
    std::string text = "<plug-in " + plugInIdentifier.value_or("(no identifier)");
    if (bundleVersion) text += "(" + *bundleVersion + ")";
    if (uuid) text += " " + uuid->text();
    if (bundleURL) text += " " + bundleURL->path();
    return text + ">";
}

} // namespace platform
