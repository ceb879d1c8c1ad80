#pragma once

#include "Zembra/ZBManifest.h"
#include "bench/Process.h"
#include "platform/PropertyList.h"

#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>

/// Applications and plug-ins on a scratch root. The attributes make a plug-in's form about as long as real ones are.
namespace bench {

using platform::Dictionary;
using platform::MutableDictionary;
using platform::Value;

inline constexpr std::string_view extensionPoint = "org.example.bench-service";

inline void writeManifest(const std::string& bundle, const Dictionary& manifest) {
    std::filesystem::create_directories(bundle);
    const auto text = platform::encodeXML(manifest);
    if (!text) fail(text.error().text());
    std::ofstream file(bundle + "/Info.vlist");
    file << *text;
    if (!file.flush()) fail("cannot write " + bundle);
}

/// Writes an application and answers its path.
inline std::string writeApplication(const std::string& root, const std::string& name) {
    namespace manifest = zembra::manifest;
    std::string path = root + "/Applications/" + name + ".app";
    writeManifest(path, {{manifest::bundleIdentifier, "org.example." + name}, {manifest::bundleName, name}});
    return path;
}

inline std::string plugInIdentifier(const std::string& name) { return "org.example." + name + ".plug-in"; }

/// What one plug-in has beside what all have, or in its place.
struct OwnEntries {
    Dictionary attributes = {};
    Dictionary extension = {}; // the plug-in dictionary
    Dictionary manifest = {};
};

/// Writes a plug-in of an application and answers its path.
inline std::string writePlugIn(const std::string& application, const std::string& name, const OwnEntries& own = {}) {
    namespace manifest = zembra::manifest;
    MutableDictionary attributes{{manifest::version, "1.0"}, {manifest::pointName, extensionPoint}};
    for (int key = 0; key < 5; ++key) {
        attributes.set("SampleAttribute" + std::to_string(key), "a value of the length that values in manifests have");
    }
    attributes.merge(own.attributes);
    MutableDictionary extension{{manifest::pointIdentifier, extensionPoint}, {manifest::attributes, attributes}};
    extension.merge(own.extension);
    MutableDictionary info{{manifest::bundleIdentifier, plugInIdentifier(name)},
                           {manifest::bundleName, name},
                           {manifest::bundleDisplayName, "Plug-in " + name},
                           {manifest::bundleVersion, "1.0"},
                           {manifest::extension, extension}};
    info.merge(own.manifest);
    std::string path = application + "/PlugIns/" + name + std::string(manifest::appExtensionSuffix);
    writeManifest(path, info);
    return path;
}

} // namespace bench
