#include "platform/linux/ServiceManager.h"

#include "platform/linux/ServiceThread.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <csignal>
#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumRecordSize = 32; // a 64-bit number
constexpr std::size_t maximumStatSize = 4096; // of /proc/<pid>/stat
constexpr char separator = '@';               // between bundle identifier and version

// Called directly: the C library declares its own wrappers for C alone.
Descriptor openProcess(pid_t pid) { return Descriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0))); }
int signalProcess(const Descriptor& process, int signal) {
    return static_cast<int>(::syscall(SYS_pidfd_send_signal, process.get(), signal, nullptr, 0));
}

template <class Number> std::optional<Number> numberOf(std::string_view text) {
    Number number{};
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return number;
}

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

/// Field 22 of /proc/<pid>/stat (proc(5)), as text. None when there is no such process.
std::optional<std::string> startTime(pid_t pid) {
    const Descriptor file(::open(("/proc/" + std::to_string(pid) + "/stat").c_str(), O_RDONLY | O_CLOEXEC));
    if (!file) return std::nullopt;
    std::string text(maximumStatSize, '\0');
    ssize_t size = 0;
    do size = ::read(file.get(), text.data(), text.size());
    while (size < 0 && errno == EINTR);
    if (size <= 0) return std::nullopt;
    text.resize(static_cast<std::size_t>(size));

    // The second field is the program's name in parentheses, which may hold anything, blanks and parentheses too.
    std::size_t at = text.rfind(')');
    for (int field = 2; field < 22 && at != std::string::npos; ++field) at = text.find(' ', at + 1);
    if (at == std::string::npos) return std::nullopt;
    return text.substr(at + 1, text.find(' ', at + 1) - at - 1);
}

/// Zero when the directory's files can be believed, else an errno value.
int directoryError(const std::string& path) {
    struct stat status{};
    if (::lstat(path.c_str(), &status) != 0) return errno;
    if (!S_ISDIR(status.st_mode)) return ENOTDIR;
    if (status.st_uid != 0 && status.st_uid != ::geteuid()) return EPERM;
    return (status.st_mode & 022) != 0 ? EACCES : 0;
}

bool hasEnded(const Descriptor& process) {
    pollfd descriptor{process.get(), POLLIN, 0};
    return ::poll(&descriptor, 1, 0) > 0;
}

} // namespace

ServiceManager::ServiceManager(const Root& root, platform::Files& files, std::chrono::milliseconds grace)
    : _directory(root.runtime() + "/ignitd"), _files(files), _grace(grace) {}

ServiceManager::~ServiceManager() {
    if (!_thread) return;
    {
        const std::lock_guard lock(_mutex);
        _isStopping = true;
    }
    ::eventfd_write(_wakeUp.get(), 1);
    _thread->join();
}

void ServiceManager::removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                                           std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion) {
    Removal removal;
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
        for (auto& removal : submitted) {
            begin(removal);
            removals.push_back(std::move(removal));
        }
        std::erase_if(removals, [this](Removal& removal) { return advance(removal); });

        descriptors.assign(1, pollfd{_wakeUp.get(), POLLIN, 0});
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

void ServiceManager::begin(Removal& removal) {
    removal.deadline = std::chrono::steady_clock::now() + _grace;
    for (const auto& directory : {_directory, removal.directory}) {
        const int number = directoryError(directory);
        if (number == ENOENT) return;
        if (number != 0) {
            removal.firstError = number;
            return;
        }
    }
    const std::unique_ptr<DIR, int (*)(DIR*)> directory(::opendir(removal.directory.c_str()), ::closedir);
    if (!directory) {
        removal.firstError = errno == ENOENT ? 0 : errno;
        return;
    }
    while (const dirent* entry = ::readdir(directory.get())) terminate(removal, entry->d_name);
}

void ServiceManager::terminate(Removal& removal, const std::string& name) {
    const auto pid = numberOf<pid_t>(name);
    if (!pid || *pid <= 0) return; // no record of an instance
    Instance instance{openProcess(*pid), removal.directory + '/' + name};
    const auto note = [&removal](int number) {
        if (removal.firstError == 0) removal.firstError = number;
    };
    if (!instance.process && errno != ESRCH) return note(errno);

    // The start time is read after the process was opened: if it is the recorded one now, the pid has been that
    // process's all the time, and it is the one that is open.
    const auto record = _files.read(instance.path, maximumRecordSize);
    if (!record) {
        if (record.error().code != fileReadNoSuchFileCode) note(EIO);
        return;
    }
    const bool isInstance = instance.process && startTime(*pid) == *record && !hasEnded(instance.process);
    if (!isInstance) {
        ::unlink(instance.path.c_str());
        return;
    }
    if (signalProcess(instance.process, SIGTERM) != 0 && errno != ESRCH) return note(errno);
    removal.hadInstances = true;
    removal.instances.push_back(std::move(instance));
}

/// True when the removal has been answered.
bool ServiceManager::advance(Removal& removal) {
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
    if (!removal.isKilled && std::chrono::steady_clock::now() >= removal.deadline) {
        removal.isKilled = true;
        for (const auto& instance : removal.instances) signalProcess(instance.process, SIGKILL);
    }
    return false;
}

Failure ServiceManager::noteInstance(const std::string& bundleIdentifier, const std::string& version, pid_t pid) {
    const auto name = directoryName(bundleIdentifier, version);
    if (!name) return name.error();
    const auto time = startTime(pid);
    if (!time) return systemError(ESRCH, "process " + std::to_string(pid));

    const std::string directory = _directory + '/' + *name;
    const std::string path = directory + '/' + std::to_string(pid);
    Failure failure;
    // A removal may take the empty directory away between its making and the writing.
    for (int tries = 0; tries < 3; ++tries) {
        for (std::size_t end = directory.find('/', 1); end != std::string::npos; end = directory.find('/', end + 1)) {
            static_cast<void>(::mkdir(directory.substr(0, end).c_str(), 0755)); // shows below
        }
        if (::mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) return systemError(errno, directory);
        if (const int number = directoryError(directory); number != 0 && number != ENOENT) {
            return systemError(number, directory);
        }
        failure = _files.writeAtomically(path, *time);
        if (!failure) break;
    }
    return failure;
}

} // namespace platform::linux_
