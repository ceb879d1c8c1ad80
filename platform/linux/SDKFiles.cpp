#include "platform/linux/SDKFiles.h"

#include "platform/linux/BundleScanner.h"
#include "platform/linux/DirectoryFiles.h"

namespace platform::linux_ {

std::optional<Dictionary> readSDKFile(const Root& root, const std::string& extensionPoint) {
    const std::string name = extensionPoint + std::string(tableSuffix);
    if (!isFileName(name)) return std::nullopt;
    const Descriptor folder = openDirectory(root.system() + "/Library/SDKs");
    if (!folder) return std::nullopt;
    const auto bytes = readFile(folder.get(), name, maximumManifestSize);
    if (!bytes || !*bytes) return std::nullopt;
    const auto value = decodePropertyList(**bytes, maximumManifestNesting);
    return value ? value->dictionary() : std::nullopt;
}

} // namespace platform::linux_
