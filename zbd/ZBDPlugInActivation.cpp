#include "Zembra/ZBBundle.h"
#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Format.h"
#include "zbd/ZBDPlugIn.h"
#include "zbd/ZBDQmxClient.h"

#include <algorithm>
#include <array>

namespace zbd {

namespace log = zembra::log;
namespace manifest = zembra::manifest;
namespace service = zembra::service;
using platform::Dictionary;
using platform::MutableDictionary;
using platform::Value;

namespace {

/// Variables that the daemon sets itself.
constexpr std::string_view home = "HOME";
constexpr std::string_view fixedUserHome = "VBFIXED_USER_HOME";
constexpr std::string_view temporaryDirectory = "TMPDIR";
constexpr std::string_view testSDK = "ZBTEST_SDK"; // handed on from the daemon's own environment

constexpr std::string_view keyboardService = "com.nordane.keyboard-service";
constexpr std::string_view filterData = "com.nordane.netplug.filter-data";

struct Profile {
    std::string_view extensionPoint;
    const char* name;
};

/// For the extension points that want another sandbox than the common one.
constexpr std::array profiles{
    Profile{"com.nordane.peekview.extension.preview", "peekviewd"},
    Profile{"com.nordane.peekview.preview", "peekview-preview"},
    Profile{"com.nordane.peekview.thumbnail", "peekview-thumbnail"},
    Profile{"com.nordane.app.non-ui-extension", "sketchpad-devtools"},
    Profile{"com.nordane.app.non-ui-extension.multiple-instances", "sketchpad-devtools"},
    Profile{"com.nordane.senderscreen.message-filter", "message-filter"},
};
constexpr const char* commonProfile = "plugin";

} // namespace

const char* ZBDPlugIn::sandboxProfile() const {
    const Value declaredPoint = pluginKey(manifest::pointIdentifier);
    if (declaredPoint == Value(keyboardService)) {
        const bool hasNetwork = attribute(manifest::requestsOpenAccess) == Value(true) &&
                                allowedPVCServices().contains(std::string(platform::keyboardNetworkAccess));
        return hasNetwork ? commonProfile : "keyboard";
    }
    if (declaredPoint == Value(filterData)) return "network-filter";
    const auto dictionary = plugInDictionary();
    const Value point = dictionary ? (*dictionary)[manifest::pointIdentifier] : Value();
    const auto found = std::find_if(profiles.begin(), profiles.end(),
                                    [&](const Profile& profile) { return point == Value(profile.extensionPoint); });
    return found == profiles.end() ? commonProfile : found->name;
}

platform::Failure ZBDPlugIn::enableForClient(const ZBDQmxClient& host,
                                             const std::optional<Dictionary>& environment) const {
    // Later sources replace earlier values: the host's, the daemon's, the plug-in's own.
    MutableDictionary launchEnvironment;
    if (environment) launchEnvironment.merge(*environment);
    if (const auto container = dataContainerURL()) {
        launchEnvironment.set(home, container->path());
        launchEnvironment.set(fixedUserHome, container->path());
        launchEnvironment.set(temporaryDirectory, container->appending("tmp").path());
    } else {
        log::ops().debug("no data container for plug-in %@(%@) %{public}@ at %@", identifier(), version(), uuidText(),
                         path());
    }
    const char* const profile = sandboxProfile();
    if (const auto sdk = _platform.processes.environmentVariable(std::string(testSDK))) {
        launchEnvironment.set(testSDK, *sdk);
    }

    MutableDictionary description;
    const Value declared = infoKey(manifest::qmxService);
    if (const auto dictionary = declared.dictionary()) {
        log::cx().debug("raw QMXService=%@", *dictionary);
        description.merge(*dictionary);
    } else {
        log::ops().info("no QMXService for plug-in; database returned %@", declared);
    }
    if (const auto own = description.dictionary(service::environmentVariables)) launchEnvironment.merge(*own);
    description.set(service::environmentVariables, launchEnvironment);
    description.set(service::sandboxProfile, profile);
    description.set(service::omitSandboxParameters, true);
    log::ops().info("assigning plug-in %@(%@) %{public}@ to %s sandbox", identifier(), version(), uuidText(), profile);

    const Dictionary overlay{{manifest::qmxService, description}, {manifest::bundlePackageType, "QMX!"}};
    log::ops().notice("allowing host %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", host.pid(), host.path(),
                      identifier(), version(), uuidText(), url()->path());

    // Not the bundle's own executablePath(), which answers the bundle directory when there is no executable.
    const auto bundle = zembra::ZBBundle::initWithURL(_platform.bundles, *url());
    const auto executable = bundle ? bundle->stringProperty(platform::BundleProperty::executablePath) : std::nullopt;
    if (!executable) {
        log::ops().error("failed to obtain execPath for plug-in %@(%{public}@) bundle=%@", *this, uuidText(),
                         bundle ? Value(bundle->description()) : Value());
        return zembra::errorWithCode(zembra::code::malformed, "cannot obtain executable path for plug-in %@(%@)",
                                     identifier(), uuidText());
    }
    log::ops().debug("activation overlay=%@", overlay);
    // A host that is gone has no token; its pid may be another process's by now.
    const auto connection = host.connection();
    const auto process = connection ? connection->peerAuditToken() : platform::AuditToken();
    const int error = _platform.serviceManager.addExternalServiceForHost(process, *executable, overlay);
    if (error == 0) return std::nullopt;
    log::ops().error("ignitd error %d trying to allow %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", error,
                     host.pid(), host.path(), identifier(), version(), uuidText(), path());
    return zembra::errorWithCode(zembra::code::malformed, "unable to enable plug-in %@(%@)", identifier(), uuidText());
}

std::optional<Dictionary> ZBDPlugIn::checkBusy() const {
    std::set<std::string> identifiers;
    if (const auto bundleIdentifier = infoKey(manifest::bundleIdentifier).string()) {
        identifiers.emplace(*bundleIdentifier);
    }
    for (const Dictionary& instance : _platform.processAssertions.busyExtensionInstances(identifiers)) {
        if (const auto bundleIdentifier = instance.string(platform::instanceBundleIdentifierKey)) {
            return Dictionary{{platform::instanceBundleIdentifierKey, *bundleIdentifier}};
        }
        log::ops().error("vigild reported incomplete bundle for plug-in %@/%{public}@", identifier(), uuidText());
    }
    return std::nullopt;
}

} // namespace zbd
