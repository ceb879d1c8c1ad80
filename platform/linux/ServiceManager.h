#pragma once

#include "platform/Error.h"
#include "platform/Files.h"
#include "platform/ServiceManager.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/ProcessIdentity.h"
#include "platform/linux/ProcessWatch.h"
#include "platform/linux/RequestSocket.h"
#include "platform/linux/Root.h"
#include "platform/linux/ServiceRegistrations.h"

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <sys/socket.h>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace platform::linux_ {

/// How long instances have to end by themselves: long enough to save a document, short enough for a person who waits.
inline constexpr std::chrono::milliseconds terminationGrace{5000};

/// Where launchers ask (see ServiceLaunch.h). A stream, which the services' own confinement keeps them from: no service
/// launches another one in the name of its host.
inline constexpr RequestSocketAddress launchSocketAddress{"com.nordane.ignitd", SOCK_STREAM};

/// "ignitd": which host may start which services, and which instances run. All of it is files in
/// `<root>/run/nordane/ignitd`, so that it outlives the daemon: the registrations of ServiceRegistrations in `hosts`,
/// and a file `<bundle identifier>@<version>/<process>` for each running instance, with its user's id. Processes are
/// named with their start time, so that one which got a recycled pid inherits nothing and is never ended; neither is an
/// instance that belongs to another user by now, for it runs a set-user-id program and is no instance any more. The
/// start time counts from boot, so that the runtime directory must not survive one. The directories must
/// belong to the superuser or to the caller's user and be writable by their owner alone: whoever can add a file there
/// has programs started and processes ended. Callable from any thread; a thread of its own begins with the first use,
/// another one serves launchers.
class ServiceManager final : public platform::ServiceManager {
public:
    ServiceManager(const Root& root, platform::Files& files, std::chrono::milliseconds grace = terminationGrace,
                   const ServiceLimits& limits = {});
    /// Removals that still wait are answered with ECANCELED; their instances have got SIGTERM or run on.
    ~ServiceManager() override;

    /// Takes up what an earlier daemon left of processes that still run, and serves launchers from now on. Once.
    Failure startServing();
    /// Removes the launchers' socket, for a process that ends without destroying this object.
    void removeName() const;

    /// Errors: EINVAL for what is no bundle's executable or no property list and for names as below, ESRCH when the
    /// host has ended, E2BIG for a huge overlay, EDQUOT for too many, EPERM and EACCES for directories of others, else
    /// what the system gave.
    int addExternalServiceForHost(const AuditToken& host, const std::string& executablePath,
                                  const Dictionary& overlay) override;
    /// Takes the registrations of the service from all hosts; then SIGTERM to each instance, SIGKILL to those that live
    /// on after the grace period. Errors: EINVAL and ENAMETOOLONG for names that cannot be part of a path, EPERM and
    /// EACCES for directories of others and processes that may not be signalled, else what the system gave. One failing
    /// instance does not keep the others from being ended.
    void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                               std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion) override;

private:
    struct Instance {
        Descriptor process; // a pidfd
        pid_t pid;
        uid_t user;       // when it was recorded
        std::string path; // of its file

        /// Zero, or an errno value. Nothing happens to a process of another user by now.
        int signal(int number) const;
    };
    struct Removal {
        ServiceName service;
        std::string directory;
        std::shared_ptr<WorkQueue> queue;
        std::function<void(int)> completion;
        std::vector<Instance> instances; // those that still live
        std::chrono::steady_clock::time_point deadline;
        bool isKilled = false;
        bool hadInstances = false;
        int firstError = 0;
    };

    Failure makeDirectory();
    void loadInstances();
    void forgetEnded();
    /// Under `_launching`.
    Failure noteInstance(const ServiceName& service, const ProcessIdentity& process);
    bool serveLaunch(int connection);
    int launch(const Request& request, int connection, Descriptor& registration);
    bool startThread();
    void run();
    void begin(Removal& removal);
    void terminate(Removal& removal, int directory, const std::string& name);
    bool advance(Removal& removal);
    static void answer(Removal& removal, int result);

    const Root _root;
    const std::string _directory;
    platform::Files& _files;
    const std::chrono::milliseconds _grace;
    const ServiceLimits _limits;
    ProcessWatch _watch; // hosts and instances, by their paths
    ServiceRegistrations _registrations;
    // Held from finding a registration to recording the instance, and while a service's registrations are removed: a
    // removal sees every instance that it has not prevented.
    std::mutex _launching;
    std::map<std::string, uid_t> _instances; // guarded by _launching; their users, by their files

    std::mutex _mutex;
    Descriptor _wakeUp; // an eventfd: new removals, or the end
    std::vector<Removal> _submitted;
    bool _isStopping = false;
    std::optional<std::thread> _thread;
    std::unique_ptr<RequestSocket> _launchSocket;
};

} // namespace platform::linux_
