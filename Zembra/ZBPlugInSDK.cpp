#include "Zembra/ZBPlugInCore.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Registry.h"

#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

namespace zembra {

using platform::Array;
using platform::Dictionary;
using platform::MutableDictionary;
using platform::Value;

std::optional<Dictionary> ZBPlugInCore::readSDKDictionary(platform::Registry& registry,
                                                          std::string_view extensionPoint) {
    auto sdk = registry.sdkDictionary(std::string(extensionPoint));
    if (!sdk) log::ops().notice("plug-in sdk \"%{public}@\" not registered", extensionPoint);
    return sdk;
}

void ZBPlugInCore::resolveSDK(platform::Registry& registry) {
    const auto bundleInfo = bundleInfoDictionary();
    if (!bundleInfo) fatalInternalError("cannot resolve SDK without materialized Info.vlist");

    if (const Value extensionPointValue = sdkSpec()) {
        const auto extensionPoint = extensionPointValue.string();
        if (!extensionPoint) {
            log::ops().error("invalid SDK key:%{public}@", extensionPointValue);
            return;
        }
        if (const auto sdk = readSDKDictionary(registry, *extensionPoint)) {
            const MutableDictionary merged = mergeDictionary(*sdk, *bundleInfo);
            setDictionaries(merged); // without a plug-in dictionary in it, the old one stays
            log::cx().debug("%s %@ merged with SDK", __func__, merged[manifest::bundleDisplayName]);
        }
    }
    canonicalize();
}

MutableDictionary ZBPlugInCore::mergeDictionary(const Dictionary& sdk, const Dictionary& plugIn) {
    MutableDictionary merged = MutableDictionary::copyOf(plugIn);
    for (const auto& entry : sdk) {
        const std::string_view key = entry.name();
        const Value own = merged[key];
        if (!own || sdkOverridesKey(key)) {
            merged.set(key, entry.value);
        } else if (key == manifest::shared) {
            const auto sdkResources = entry.value.array();
            const auto ownResources = own.array();
            // Where either is no array there is no union to make, and the plug-in's own value stands.
            if (sdkResources && ownResources) merged.set(key, mergeSharedResources(*sdkResources, *ownResources));
        } else if (const auto sdkDictionary = entry.value.dictionary()) {
            if (const auto ownDictionary = own.dictionary()) {
                merged.set(key, mergeDictionary(*sdkDictionary, *ownDictionary));
            }
        }
    }
    return merged;
}

bool ZBPlugInCore::sdkOverridesKey(std::string_view key) { return key == manifest::cleanTimeout; }

Array ZBPlugInCore::mergeSharedResources(const Array& sdk, const Array& plugIn) {
    std::vector<Value> united;
    // Told apart by their encodings: a manifest holds tens of thousands of elements, too many to compare with each
    // other.
    std::unordered_set<std::string> known;
    for (const Array& side : {plugIn, sdk}) {
        for (const Value& resource : side) {
            std::string encoding;
            platform::appendCompact(encoding, resource);
            if (known.insert(std::move(encoding)).second) united.push_back(resource);
        }
    }
    return Array(std::move(united));
}

} // namespace zembra
