#pragma once

#include "platform/PropertyList.h"

#include <filesystem>
#include <fstream>

namespace support {

inline void writeFile(const std::string& path, std::string_view bytes) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path, std::ios::binary) << bytes;
}

inline void writeManifest(const std::string& bundle, const platform::Value& value) {
    writeFile(bundle + "/Info.vlist", *platform::encodeXML(value));
}

/// The manifest of a data-only plug-in; `entries` are added to the top level.
inline platform::Dictionary plugInInfo(const std::string& identifier, platform::Dictionary attributes = {},
                                       const platform::Dictionary& entries = {}) {
    platform::MutableDictionary info{
        {"VBBundleIdentifier", identifier},
        {"VKExtension",
         platform::Dictionary{{"VKExtensionProtocol", "#Data"}, {"VKExtensionAttributes", std::move(attributes)}}}};
    info.merge(entries);
    return info;
}

/// Writes `<path>` with a manifest and one plug-in per identifier, named after it.
inline void writeApplication(const std::string& path, std::initializer_list<std::string> plugIns = {},
                             const platform::Dictionary& entries = {}) {
    platform::MutableDictionary info{{"VBBundleIdentifier", "com.nordane." + path.substr(path.rfind('/') + 1)}};
    info.merge(entries);
    writeManifest(path, info);
    for (const auto& identifier : plugIns)
        writeManifest(path + "/PlugIns/" + identifier + ".appex", plugInInfo(identifier));
}

} // namespace support
