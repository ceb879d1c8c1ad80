#pragma once

#include "platform/Error.h"
#include "platform/Files.h"
#include "platform/ServiceManager.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/Root.h"

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace platform::linux_ {

/// How long instances have to end by themselves: long enough to save a document, short enough for a person who waits.
inline constexpr std::chrono::milliseconds terminationGrace{5000};

/// The part of "ignitd" that ends services. Each running instance is a file
/// `<root>/run/nordane/ignitd/<bundle identifier>@<version>/<pid>` that holds the process's start time in clock ticks
/// since boot, so that a process which got a recycled pid is never taken for the instance. The directories must belong
/// to the superuser or to the caller's user and be writable by their owner alone: whoever can add a file there has a
/// process ended. Callable from any thread; a thread of its own begins with the first removal.
class ServiceManager final : public platform::ServiceManager {
public:
    ServiceManager(const Root& root, platform::Files& files, std::chrono::milliseconds grace = terminationGrace);
    /// Removals that still wait are answered with ECANCELED; their instances have got SIGTERM or run on.
    ~ServiceManager() override;

    /// SIGTERM to each instance, SIGKILL to those that live on after the grace period. Errors: EINVAL and ENAMETOOLONG
    /// for names that cannot be part of a path, EPERM and EACCES for directories of others and processes that may not
    /// be signalled, else what the system gave. One failing instance does not keep the others from being ended.
    void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                               std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion) override;

    /// Records a running instance, for whoever launched it. `pid` must be the caller's child, not yet waited for, so
    /// that it cannot mean another process. ESRCH when there is no such process.
    Failure noteInstance(const std::string& bundleIdentifier, const std::string& version, pid_t pid);

private:
    struct Instance {
        Descriptor process; // a pidfd
        std::string path;   // of its file
    };
    struct Removal {
        std::string directory;
        std::shared_ptr<WorkQueue> queue;
        std::function<void(int)> completion;
        std::vector<Instance> instances; // those that still live
        std::chrono::steady_clock::time_point deadline;
        bool isKilled = false;
        bool hadInstances = false;
        int firstError = 0;
    };

    bool startThread();
    void run();
    void begin(Removal& removal);
    void terminate(Removal& removal, const std::string& name);
    bool advance(Removal& removal);
    static void answer(Removal& removal, int result);

    const std::string _directory;
    platform::Files& _files;
    const std::chrono::milliseconds _grace;

    std::mutex _mutex;
    Descriptor _wakeUp; // an eventfd: new removals, or the end
    std::vector<Removal> _submitted;
    bool _isStopping = false;
    std::optional<std::thread> _thread;
};

} // namespace platform::linux_
