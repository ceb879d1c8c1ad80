#pragma once

#include "platform/Platform.h"
#include "tests/support/ActivationRulesFake.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/CodeSigningFake.h"
#include "tests/support/ContainersFake.h"
#include "tests/support/FilesFake.h"
#include "tests/support/InterfacesFake.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/NotificationsFake.h"
#include "tests/support/PreferencesFake.h"
#include "tests/support/PrivacyConsentFake.h"
#include "tests/support/ProcessAssertionsFake.h"
#include "tests/support/ProcessesFake.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/RunLoopFake.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/ServiceManagerFake.h"
#include "tests/support/SystemLogFake.h"
#include "tests/support/TransportFake.h"
#include "tests/support/TypeConformanceFake.h"
#include "tests/support/WorkQueueFake.h"

namespace support {

/// A manifest with what every plug-in states, and its plug-in dictionary.
inline platform::Dictionary manifestOf(const std::string& identifier, platform::Dictionary extension) {
    return {{"VBBundleIdentifier", identifier}, {"VBBundleVersion", "1"}, {"VKExtension", extension}};
}

/// A well-configured data-only plug-in on the system volume.
inline FakePlugIn dataPlugIn(const std::string& name, const std::string& version = "1.0") {
    return {.path = "/System/Library/PlugIns/" + name + ".plugin",
            .info = manifestOf("com.example." + name,
                               {{"VKExtensionProtocol", "#Data"},
                                {"VKExtensionAttributes", platform::Dictionary{{"VKExtensionVersion", version}}}}),
            .onSystemPartition = true};
}

/// The whole platform in memory: what the daemon is constructed on in unit tests. Queues run their items in place.
/// Only what the daemon cannot start without is allowed: a place for the annotation file, and the container that older
/// annotations are looked for in.
struct FakePlatform {
    FakeWorkQueues queues{FakeWorkQueues::Mode::inPlace};
    FakeRunLoop runLoop{queues};
    FakeTransport transport;
    FakeRegistry registry;
    FakeServiceManager serviceManager;
    FakeSandbox sandbox;
    FakeCodeSigning codeSigning;
    FakeBundles bundles;
    FakeInterfaces interfaces;
    FakePreferences preferences;
    FakeContainers containers;
    FakeNotifications notifications;
    FakeLocale locale;
    FakeProcesses processes;
    FakeFiles files;
    FakeTypeConformance typeConformance;
    FakeActivationRules activationRules;
    FakePrivacyConsent privacyConsent;
    FakeProcessAssertions processAssertions;
    platform::Platform platform = with(queues, transport);

    FakePlatform() {
        files.addDirectory("/var/db");
        files.addDirectory("/containers/com.nordane.zbd");
        containers.allow("com.nordane.zbd", "/containers/com.nordane.zbd");
        processLog.clear();
    }

    /// A data plug-in of that name, installed.
    platform::PlugInProxyRef install(const std::string& name, std::optional<platform::Dictionary> entitlements = {}) {
        auto plugIn = dataPlugIn(name);
        plugIn.entitlements = std::move(entitlements);
        return registry.install(plugIn);
    }
    /// This platform, but with queues and a transport that do their work on other threads.
    platform::Platform with(platform::WorkQueues& otherQueues, platform::Transport& otherTransport) {
        return {otherQueues, runLoop,         otherTransport,  registry,       serviceManager,   sandbox, codeSigning,
                bundles,     interfaces,      preferences,     containers,     notifications,    locale,  processes,
                files,       typeConformance, activationRules, privacyConsent, processAssertions};
    }
};

} // namespace support
