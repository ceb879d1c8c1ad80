#include "platform/linux/StringTables.h"

#include "platform/linux/BundleScanner.h"
#include "platform/linux/DirectoryFiles.h"

#include <algorithm>

namespace platform::linux_ {

std::vector<std::string> searchOrder(const std::vector<std::string>& languages) {
    std::vector<std::string> order;
    for (std::string language : languages) {
        while (isFileName(language) && std::ranges::find(order, language) == order.end()) {
            order.push_back(language);
            const std::size_t special = language.rfind('-');
            if (special == std::string::npos) break;
            language.resize(special);
        }
    }
    return order;
}

StringTables::StringTables(const std::string& bundlePath, const std::string& table,
                           const std::vector<std::string>& searchOrder) {
    const std::string file = table + std::string(tableSuffix);
    if (searchOrder.empty() || !isFileName(file)) return;
    const Descriptor bundle = openDirectory(bundlePath);
    const Descriptor resources = bundle ? openDirectory(bundle.get(), resourcesName) : Descriptor();
    if (!resources) return;
    for (const auto& language : searchOrder) {
        const Descriptor folder = openDirectory(resources.get(), language);
        if (!folder) continue;
        const auto bytes = readFile(folder.get(), file, maximumManifestSize);
        if (!bytes || !*bytes) continue;
        const auto value = decodePropertyList(**bytes);
        if (auto strings = value ? value->dictionary() : std::nullopt) _tables.push_back(*std::move(strings));
    }
}

std::optional<std::string> StringTables::string(std::string_view key) const {
    for (const auto& table : _tables) {
        if (const auto string = table.string(key)) return std::string(*string);
    }
    return std::nullopt;
}

} // namespace platform::linux_
