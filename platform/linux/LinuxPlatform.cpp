#include "platform/linux/LinuxPlatform.h"

#include "platform/linux/ActivationRules.h"
#include "platform/linux/Bundles.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Containers.h"
#include "platform/linux/DescriptorStore.h"
#include "platform/linux/Files.h"
#include "platform/linux/Interfaces.h"
#include "platform/linux/Locale.h"
#include "platform/linux/Notifications.h"
#include "platform/linux/Preferences.h"
#include "platform/linux/PrivacyConsent.h"
#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/Processes.h"
#include "platform/linux/Registry.h"
#include "platform/linux/Root.h"
#include "platform/linux/RunLoop.h"
#include "platform/linux/Sandbox.h"
#include "platform/linux/ServiceManager.h"
#include "platform/linux/SystemLog.h"
#include "platform/linux/Transport.h"
#include "platform/linux/TypeConformance.h"
#include "platform/linux/WorkQueue.h"

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <malloc.h>
#include <pthread.h>
#include <unistd.h>

namespace platform::linux_ {

struct LinuxPlatform::Services {
    Root root = Root::ofProcess();
    RunLoop runLoop;
    WorkQueues queues;
    Files files{root};
    Processes processes;
    CodeSigning codeSigning;
    Containers containers{root};
    Preferences preferences{root};
    Locale locale{root, files};
    Bundles bundles{files};
    Interfaces interfaces;
    Notifications notifications{root};
    Sandbox sandbox{root, SandboxRole::issuer};
    ServiceManager serviceManager{root, files};
    ServiceDescriptorStore descriptors;
    Registry registry{root, locale, containers, {}, &descriptors};
    Transport transport{root};
    TypeConformance typeConformance{root};
    ActivationRules activationRules;
    PrivacyConsent privacyConsent{root};
    ProcessAssertions processAssertions{root};
    Platform platform{queues,  runLoop,         transport,       registry,       serviceManager,   sandbox, codeSigning,
                      bundles, interfaces,      preferences,     containers,     notifications,    locale,  processes,
                      files,   typeConformance, activationRules, privacyConsent, processAssertions};
};

namespace {

/// A standard descriptor that the process was started without would go to the next file or socket that is opened, and
/// log lines would be written into that. Left open across exec, for the same reason.
void fillStandardDescriptors() {
    for (const int number : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
        if (fcntl(number, F_GETFD) != -1) continue;
        // The lowest free number is this one.
        if (open("/dev/null", O_RDWR | O_NOCTTY) != number) std::abort();
    }
}

/// How long the end of the process waits for the registry. Cut short, that loses nothing but time at the next start.
constexpr std::chrono::milliseconds registryPatience{500};

/// What an answer of many plug-ins took goes back to the system with it. Left alone, the allocator would take the
/// largest one as the measure of what to hold on to.
void boundFreeMemory() {
    constexpr int size = 8 << 20; // answers of a thousand plug-ins stay below, and need no new pages each time
    mallopt(M_ARENA_MAX, 1);      // so that what one thread let go of serves the others
    mallopt(M_MMAP_THRESHOLD, size);
    mallopt(M_TRIM_THRESHOLD, size);
}

} // namespace

LinuxPlatform::LinuxPlatform() {
    boundFreeMemory();
    fillStandardDescriptors();
    setSystemLog(SystemLog::ofProcess());
    // No channel of ours, so it shows its arguments: there the refusal of a removal names the path for the
    // administrator.
    systemLog().defaultHandle().setPrivateArguments(PrivateArguments::shown);
    // Threads inherit the mask, so SIGTERM waits for its source and never ends the process by itself.
    sigset_t terminate;
    sigemptyset(&terminate);
    sigaddset(&terminate, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &terminate, nullptr);
    // A reader of the log that went away, and a limit on file sizes, are errors of one write.
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN));
    static_cast<void>(std::signal(SIGXFSZ, SIG_IGN));
}

LinuxPlatform::~LinuxPlatform() = default;

Platform& LinuxPlatform::start() {
    _services = std::make_unique<Services>();
    if (const auto failure = _services->sandbox.startBroker()) {
        // Hosts then get tokens that they cannot consume; everything else works.
        systemLog().defaultHandle().error("sandbox broker unavailable: %{public}@", *failure);
    }
    if (const auto failure = _services->serviceManager.startServing()) {
        // Plug-ins are then made ready but cannot be launched; everything else works.
        systemLog().defaultHandle().error("service manager unavailable: %{public}@", *failure);
    }
    return _services->platform;
}

void LinuxPlatform::leave() {
    _services->sandbox.removeBrokerName();
    _services->serviceManager.removeName();
    _services->registry.stop(registryPatience);
}

} // namespace platform::linux_
