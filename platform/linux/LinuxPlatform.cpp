#include "platform/linux/LinuxPlatform.h"

#include "platform/linux/Bundles.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Containers.h"
#include "platform/linux/Files.h"
#include "platform/linux/Interfaces.h"
#include "platform/linux/Locale.h"
#include "platform/linux/Notifications.h"
#include "platform/linux/Preferences.h"
#include "platform/linux/Processes.h"
#include "platform/linux/Registry.h"
#include "platform/linux/Root.h"
#include "platform/linux/RunLoop.h"
#include "platform/linux/Sandbox.h"
#include "platform/linux/ServiceManager.h"
#include "platform/linux/SystemLog.h"
#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"

#include <csignal>
#include <pthread.h>

namespace platform::linux_ {

struct LinuxPlatform::Services {
    Root root = Root::ofProcess();
    RunLoop runLoop;
    WorkQueues queues;
    Files files{root};
    Processes processes;
    CodeSigning codeSigning;
    Containers containers{root};
    Preferences preferences{root, files};
    Locale locale{root, files};
    Bundles bundles{files};
    Interfaces interfaces;
    Notifications notifications{root};
    Sandbox sandbox{root, SandboxRole::issuer};
    ServiceManager serviceManager{root, files};
    Registry registry{root, locale, containers};
    Transport transport{root};
    Platform platform{queues,  runLoop,    transport,   registry,   serviceManager, sandbox, codeSigning, bundles,
                      interfaces, preferences, containers, notifications, locale, processes, files};
};

LinuxPlatform::LinuxPlatform() {
    setSystemLog(SystemLog::ofProcess());
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
    return _services->platform;
}

} // namespace platform::linux_
