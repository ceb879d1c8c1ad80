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
    platform::Platform platform{queues,          runLoop,         transport,      registry,         serviceManager,
                                sandbox,         codeSigning,     bundles,        interfaces,       preferences,
                                containers,      notifications,   locale,         processes,        files,
                                typeConformance, activationRules, privacyConsent, processAssertions};

    FakePlatform() {
        files.addDirectory("/var/db");
        files.addDirectory("/containers/com.nordane.zbd");
        containers.allow("com.nordane.zbd", "/containers/com.nordane.zbd");
        processLog.clear();
    }

    /// This platform, but with services that do their work on other threads.
    platform::Platform with(platform::WorkQueues& otherQueues, platform::Transport& otherTransport,
                            platform::Notifications& otherNotifications) {
        return {otherQueues, runLoop,         otherTransport,  registry,       serviceManager,     sandbox, codeSigning,
                bundles,     interfaces,      preferences,     containers,     otherNotifications, locale,  processes,
                files,       typeConformance, activationRules, privacyConsent, processAssertions};
    }
};

/// The text of a file URL, or a path: what most tests say of a plug-in.
inline platform::Dictionary manifestOf(const std::string& identifier, platform::Dictionary extension) {
    return {{"VBBundleIdentifier", identifier}, {"VBBundleVersion", "1"}, {"VKExtension", extension}};
}

/// A well-configured data-only plug-in on the system volume.
inline FakePlugIn dataPlugIn(const std::string& name) {
    return {.path = "/System/Library/PlugIns/" + name + ".plugin",
            .info = manifestOf("com.example." + name,
                               {{"VKExtensionProtocol", "#Data"},
                                {"VKExtensionAttributes", platform::Dictionary{{"VKExtensionVersion", "1.0"}}}}),
            .onSystemPartition = true};
}

} // namespace support
