#include "platform/linux/ServiceManager.h"

#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/FileTrust.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/ServiceThread.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <utility>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77 // newer than the C library's headers
#endif

namespace platform::linux_ {

namespace {

constexpr char separator = '@'; // between bundle identifier and version

/// The name of a service's directory; an errno value for names that give none. The identifier holds no separator, so
/// that no two services share one.
Result<std::string> directoryName(const std::string& bundleIdentifier, const std::string& version) {
    for (const auto& part : {bundleIdentifier, version}) {
        if (const int number = pathComponentError(part)) return systemError(number, "service name");
    }
    std::string name = bundleIdentifier + separator + version;
    if (bundleIdentifier.find(separator) != std::string::npos) return systemError(EINVAL, "service name");
    if (const int number = pathComponentError(name)) return systemError(number, "service name");
    return name;
}

/// The process that connected. None when it has ended, or is not the one that sent the request: who takes over another
/// one's connection must not ask in its name.
std::optional<ProcessIdentity> peerOf(int connection, pid_t sender) {
    ucred peer{};
    socklen_t size = sizeof peer;
    if (::getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0 || peer.pid != sender) {
        return std::nullopt;
    }
    int pidfd = -1;
    size = sizeof pidfd;
    const bool isKnown = ::getsockopt(connection, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &size) == 0;
    // Only an older kernel lacks the option. Any other failure may say that the process has ended, and then its pid may
    // be another one's.
    if (!isKnown && errno != ENOPROTOOPT) return std::nullopt;
    const Descriptor process = isKnown ? Descriptor(pidfd) : openProcess(peer.pid);
    auto identity = ProcessIdentity::of(peer.pid);
    return process && !hasEnded(process) ? identity : std::nullopt;
}

/// The process that the token names. None when it has ended.
std::optional<ProcessIdentity> identityOf(const AuditToken& token) {
    const auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(token.process);
    auto identity = process ? ProcessIdentity::of(process->pid()) : std::nullopt;
    // While the process lives its pid is its own, so that the start time read before was its own too.
    return identity && process->isAlive() ? identity : std::nullopt;
}

} // namespace

ServiceManager::ServiceManager(const Root& root, platform::Files& files, std::chrono::milliseconds grace,
                               const ServiceLimits& limits)
    : _root(root),
      _directory(root.runtime() + "/ignitd"),
      _files(files),
      _grace(grace),
      _limits(limits),
      _registrations(_directory + "/hosts", _watch, limits) {}

ServiceManager::~ServiceManager() {
    _launchSocket.reset(); // first, for its thread uses everything
    if (!_thread) return;
    {
        const std::lock_guard lock(_mutex);
        _isStopping = true;
    }
    ::eventfd_write(_wakeUp.get(), 1);
    _thread->join();
}

Failure ServiceManager::startServing() {
    if (auto failure = makeDirectory()) return failure;
    {
        const std::lock_guard lock(_mutex);
        if (!startThread()) return systemError(EAGAIN, "ignitd");
    }
    if (const int number = _registrations.load()) return systemError(number, _directory);
    loadInstances();
    auto socket = RequestSocket::start(_root, launchSocketAddress, "ignitd-launch",
                                       [this](int connection) { return serveLaunch(connection); });
    if (!socket) return socket.error();
    _launchSocket = *std::move(socket);
    return std::nullopt;
}

void ServiceManager::removeName() const {
    if (_launchSocket) _launchSocket->removeName();
}

/// An error unless the directory can be believed then.
Failure ServiceManager::makeDirectory() {
    for (std::size_t end = _directory.find('/', 1); end != std::string::npos; end = _directory.find('/', end + 1)) {
        static_cast<void>(::mkdir(_directory.substr(0, end).c_str(), 0755)); // shows below
    }
    if (::mkdir(_directory.c_str(), 0755) != 0 && errno != EEXIST) return systemError(errno, _directory);
    const auto directory = openTrustedDirectory(_directory);
    return directory ? Failure() : directory.error();
}

void ServiceManager::loadInstances() {
    const Descriptor directory = openDirectory(AT_FDCWD, _directory);
    const auto services = directory ? listDirectory(directory.get()) : std::nullopt;
    if (!services) return; // what is recorded stays, and is looked at when it is removed
    for (const auto& service : services->directories) {
        if (service.find(separator) == std::string::npos) continue;
        const Descriptor records = openDirectory(directory.get(), service);
        const auto instances = records ? listDirectory(records.get()) : std::nullopt;
        if (!instances) continue;
        for (const auto& name : instances->others) {
            const auto identity = ProcessIdentity::named(name);
            Descriptor process = identity ? openProcess(*identity) : Descriptor();
            if (process) {
                const std::string path = _directory + '/' + service + '/' + name;
                if (_watch.add(std::move(process), path) != 0) continue;
                // A crash may have left the file empty. Then the process was never told that it may start, and
                // asks anew.
                const auto user = recordedUser(records.get(), name);
                const std::lock_guard lock(_launching);
                if (user) _instances[path] = *user;
            } else if (!identity || errno == ESRCH) {
                ::unlinkat(records.get(), name.c_str(), 0);
            }
        }
        ::unlinkat(directory.get(), service.c_str(), AT_REMOVEDIR); // when it is empty
    }
}

int ServiceManager::addExternalServiceForHost(const AuditToken& host, const std::string& executablePath,
                                              const Dictionary& overlay) {
    const auto process = identityOf(host);
    if (!process) return ESRCH;
    const auto code = [](const Error& error) { return static_cast<int>(error.code); };
    const auto registration = registrationOf(_files, executablePath, overlay);
    if (!registration) return code(registration.error());
    const auto& service = registration->service;
    if (const auto name = directoryName(service.identifier, service.version); !name) return code(name.error());
    if (const auto failure = makeDirectory()) return code(*failure);
    {
        const std::lock_guard lock(_mutex);
        if (!startThread()) return EAGAIN;
    }
    return _registrations.add(*process, host.uid, *registration);
}

bool ServiceManager::serveLaunch(int connection) {
    const auto request = receiveRequest(connection, PATH_MAX);
    if (!request) return false;
    if (request->text.empty()) return true; // hung up
    Descriptor registration;
    const int number = request->text.size() > PATH_MAX ? ENAMETOOLONG : launch(*request, connection, registration);
    sendAnswer(connection, number, registration);
    return true;
}

int ServiceManager::launch(const Request& request, int connection, Descriptor& registration) {
    const auto process = peerOf(connection, request.sender);
    const auto host = process ? parentOf(*process) : std::nullopt;
    if (!host) return ESRCH;
    const std::lock_guard lock(_launching);
    auto found = _registrations.find(*host, request.text);
    if (!found) return static_cast<int>(found.error().code);
    if (const auto failure = noteInstance(found->service, *process)) return static_cast<int>(failure->code);
    registration = std::move((*found).file);
    return 0;
}

void ServiceManager::removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                                           std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion) {
    Removal removal;
    removal.service = {bundleIdentifier, version};
    removal.queue = std::move(queue);
    removal.completion = std::move(completion);
    const auto name = directoryName(bundleIdentifier, version);
    if (!name) return answer(removal, static_cast<int>(name.error().code));
    removal.directory = _directory + '/' + *name;

    const std::lock_guard lock(_mutex);
    if (!startThread()) return answer(removal, EAGAIN);
    _submitted.push_back(std::move(removal));
    ::eventfd_write(_wakeUp.get(), 1);
}

bool ServiceManager::startThread() {
    if (!_wakeUp) _wakeUp = Descriptor(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (_wakeUp && !_thread) _thread = startServiceThread("ignitd", [this] { run(); });
    return _thread.has_value();
}

void ServiceManager::answer(Removal& removal, int result) {
    removal.queue->async([completion = std::move(removal.completion), result] { completion(result); });
}

void ServiceManager::run() {
    std::vector<Removal> removals;
    std::vector<pollfd> descriptors;
    for (;;) {
        std::vector<Removal> submitted;
        {
            const std::lock_guard lock(_mutex);
            submitted.swap(_submitted);
            if (_isStopping) {
                for (auto& removal : submitted) answer(removal, ECANCELED);
                for (auto& removal : removals) answer(removal, ECANCELED);
                return;
            }
        }
        forgetEnded();
        for (auto& removal : submitted) {
            begin(removal);
            removals.push_back(std::move(removal));
        }
        std::erase_if(removals, [this](Removal& removal) { return advance(removal); });

        descriptors.assign({{_wakeUp.get(), POLLIN, 0}, {_watch.descriptor(), POLLIN, 0}});
        auto timeout = std::chrono::milliseconds(-1);
        const auto now = std::chrono::steady_clock::now();
        for (const auto& removal : removals) {
            for (const auto& instance : removal.instances) {
                descriptors.push_back(pollfd{instance.process.get(), POLLIN, 0});
            }
            if (removal.isKilled) continue; // nothing left to do but wait
            const auto left =
                std::max(std::chrono::ceil<std::chrono::milliseconds>(removal.deadline - now), decltype(timeout)(0));
            if (timeout.count() < 0 || left < timeout) timeout = left;
        }
        ::poll(descriptors.data(), descriptors.size(), static_cast<int>(timeout.count()));
        eventfd_t ignored = 0;
        ::eventfd_read(_wakeUp.get(), &ignored);
    }
}

void ServiceManager::forgetEnded() {
    for (const auto& path : _watch.takeEnded()) {
        if (_registrations.end(path)) continue;
        const std::lock_guard lock(_launching);
        _instances.erase(path);
        ::unlink(path.c_str());
        ::rmdir(path.substr(0, path.rfind('/')).c_str()); // when that was the last one
    }
}

void ServiceManager::begin(Removal& removal) {
    removal.deadline = std::chrono::steady_clock::now() + _grace;
    {
        const std::lock_guard lock(_launching);
        _registrations.remove(removal.service);
    }
    for (const auto& path : {_directory, removal.directory}) {
        const auto directory = openTrustedDirectory(path);
        if (directory) continue;
        removal.firstError = directory.error().code == ENOENT ? 0 : static_cast<int>(directory.error().code);
        return;
    }
    const std::unique_ptr<DIR, int (*)(DIR*)> directory(::opendir(removal.directory.c_str()), ::closedir);
    if (!directory) {
        removal.firstError = errno == ENOENT ? 0 : errno;
        return;
    }
    while (const dirent* entry = ::readdir(directory.get())) {
        terminate(removal, ::dirfd(directory.get()), entry->d_name);
    }
}

int ServiceManager::Instance::signal(int number) const {
    if (ownerOf(pid) != user) return ESRCH;
    return ::syscall(SYS_pidfd_send_signal, process.get(), number, nullptr, 0) == 0 ? 0 : errno;
}

void ServiceManager::terminate(Removal& removal, int directory, const std::string& name) {
    const auto identity = ProcessIdentity::named(name);
    if (!identity) return; // no record of an instance
    const auto user = recordedUser(directory, name);
    Instance instance{openProcess(*identity), identity->pid, user.value_or(0), removal.directory + '/' + name};
    const auto note = [&removal](int number) {
        if (removal.firstError == 0) removal.firstError = number;
    };
    if (!instance.process && errno != ESRCH) return note(errno);
    if (!instance.process) {
        ::unlink(instance.path.c_str());
        return;
    }
    if (!user) return; // it never started
    if (const int number = instance.signal(SIGTERM)) {
        if (number != ESRCH) note(number);
        return;
    }
    removal.hadInstances = true;
    removal.instances.push_back(std::move(instance));
}

/// True when the removal has been answered.
bool ServiceManager::advance(Removal& removal) {
    if (!removal.isKilled && std::chrono::steady_clock::now() >= removal.deadline) {
        removal.isKilled = true;
        // One that has become another user's since is not waited for.
        std::erase_if(removal.instances, [](const Instance& instance) { return instance.signal(SIGKILL) == ESRCH; });
    }
    std::erase_if(removal.instances, [](const Instance& instance) {
        if (!hasEnded(instance.process)) return false;
        ::unlink(instance.path.c_str());
        return true;
    });
    if (removal.instances.empty()) {
        // Stays when something is recorded in it: an instance that could not be ended, or a new one.
        ::rmdir(removal.directory.c_str());
        const int result = removal.hadInstances ? serviceInstancesTerminated : serviceHasNoInstances;
        answer(removal, removal.firstError != 0 ? removal.firstError : result);
        return true;
    }
    return false;
}

Failure ServiceManager::noteInstance(const ServiceName& service, const ProcessIdentity& process) {
    const auto name = directoryName(service.identifier, service.version);
    if (!name) return name.error();
    const std::string directory = _directory + '/' + *name;
    const std::string path = directory + '/' + process.name();
    const auto user = ownerOf(process.pid);
    Descriptor pidfd = openProcess(process); // after the user, who is that very process's then
    if (!pidfd) return systemError(errno, path);
    if (!user) return systemError(EPERM, path);
    const auto known = _instances.find(path);
    if (known != _instances.end() && known->second == *user) return std::nullopt; // asks once more
    const auto isTheUsers = [&user](const auto& instance) { return instance.second == *user; };
    if (static_cast<std::size_t>(std::ranges::count_if(_instances, isTheUsers)) >= _limits.instancesOfUser) {
        return systemError(EDQUOT, path);
    }
    if (auto failure = makeDirectory()) return failure;
    // A removal may take the empty directory away between its making and the recording.
    Descriptor record;
    for (int tries = 0; tries < 3 && !record; ++tries) {
        if (::mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) return systemError(errno, directory);
        const auto trusted = openTrustedDirectory(directory);
        if (!trusted && trusted.error().code != ENOENT) return trusted.error();
        // One that an earlier daemon could not take up may be there.
        record = Descriptor(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
    }
    if (!record) return systemError(errno, path);
    const std::string text = std::to_string(*user);
    const ssize_t written = ::write(record.get(), text.data(), text.size());
    int number = written < 0 ? errno : ENOSPC;
    if (written == static_cast<ssize_t>(text.size())) number = _watch.add(std::move(pidfd), path);
    if (number != 0) {
        ::unlink(path.c_str());
        return systemError(number, path);
    }
    _instances[path] = *user;
    return std::nullopt;
}

} // namespace platform::linux_
