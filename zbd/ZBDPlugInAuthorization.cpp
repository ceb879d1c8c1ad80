#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "platform/Format.h"
#include "zbd/ZBDPlugIn.h"
#include "zbd/ZBDQmxClient.h"

namespace zbd {

namespace log = zembra::log;
using platform::Value;

std::optional<std::string> ZBDPlugIn::allowForClient(const ZBDQmxClient& host) const {
    if (const Value restriction = host.entitlementValueForKey(zembra::entitlement::allowedPlugIns)) {
        const auto pattern = restriction.dictionary();
        if (!pattern) return "invalid host restriction entitlement";
        if (!match(pattern)) return "the host's plug-in entitlement does not allow this plug-in";
    }
    if (const Value required = pluginKey(zembra::manifest::hostEntitlement)) {
        // A name that is no text is one that no host can hold.
        const auto name = required.string();
        if (!name || !host.hasEntitlement(*name)) {
            return platform::format("the host does not have the \"%@\" entitlement",
                                    name ? std::string(*name) : required.description());
        }
    }
    return std::nullopt;
}

std::set<std::string> ZBDPlugIn::allowedPVCServices() const {
    std::set<std::string> services;
    const auto container = containingUrl();
    if (!container) return services;
    const auto bundle = _platform.bundles.fromPath(container->path(), platform::BundleMode::directory);
    // A path without a directory gives a bundle without anything in it.
    if (!bundle || !bundle->property(platform::BundleProperty::supportPath)) {
        log::ops().info("failed to create bundle for %@", path());
        return services;
    }
    _platform.privacyConsent.flushBundleCaches(*bundle);
    const auto records = _platform.privacyConsent.informationForBundle(*bundle);
    if (!records) {
        log::ops().info("PVCAccessCopyInformationForBundle failed for %@", *bundle);
        return services;
    }
    for (const auto& record : *records) {
        if (record.granted.value_or(false)) services.insert(record.service);
    }
    return services;
}

} // namespace zbd
