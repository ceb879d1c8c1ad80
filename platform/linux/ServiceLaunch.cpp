#include "platform/linux/ServiceLaunch.h"

#include "platform/SystemLog.h"
#include "platform/linux/ConfinementProfiles.h"
#include "platform/linux/Containers.h"
#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/RequestSocket.h"
#include "platform/linux/ServiceEnvironment.h"
#include "platform/linux/ServiceManager.h"
#include "platform/linux/ServiceRegistrations.h"
#include "platform/linux/UserDirectory.h"

#include <array>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <linux/capability.h>
#include <linux/close_range.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

using Outcome = std::optional<LaunchRefusal>; // none: go on

std::string textOf(int number) { return std::generic_category().message(number); }

/// None when it is longer than `limit` or cannot be read.
std::optional<std::string> readAll(const Descriptor& file, std::size_t limit) {
    std::string bytes(limit + 1, '\0');
    std::size_t used = 0;
    while (used < bytes.size()) {
        const ssize_t size = ::read(file.get(), bytes.data() + used, bytes.size() - used);
        if (size < 0 && errno == EINTR) continue;
        if (size < 0) return std::nullopt;
        if (size == 0) break;
        used += static_cast<std::size_t>(size);
    }
    if (used > limit) return std::nullopt;
    bytes.resize(used);
    return bytes;
}

/// What "ignitd" answered.
struct Granted {
    ServiceRegistration registration;
    uid_t manager = 0;
};

Outcome askManager(const Root& root, const std::string& name, Granted& granted) {
    const auto connection = connectToRequestSocket(root, launchSocketAddress);
    if (!connection) return LaunchRefusal{LaunchStatus::noManager, connection.error().text()};
    ucred manager{};
    socklen_t size = sizeof manager;
    if (::getsockopt(connection->get(), SOL_SOCKET, SO_PEERCRED, &manager, &size) != 0 ||
        (manager.uid != 0 && manager.uid != ::geteuid())) {
        return LaunchRefusal{LaunchStatus::noManager, "the service manager is another user's"};
    }
    granted.manager = manager.uid;

    Descriptor file;
    const int number = exchangeRequest(connection->get(), name, file);
    if (number == ENOENT) {
        return LaunchRefusal{LaunchStatus::notRegistered,
                             name + " is not registered for process " + std::to_string(::getppid())};
    }
    if (number == EDQUOT || number == EPERM) return LaunchRefusal{LaunchStatus::refused, textOf(number)};
    if (number != 0) return LaunchRefusal{LaunchStatus::noManager, textOf(number)};
    const auto bytes = readAll(file, maximumRegistrationSize);
    auto registration = bytes ? ServiceRegistration::decoded(*bytes) : std::nullopt;
    if (!registration) return LaunchRefusal{LaunchStatus::refused, "the registration cannot be read"};
    granted.registration = *std::move(registration);
    return std::nullopt;
}

/// The data container, with the directory for temporary files in it.
Result<Descriptor> openContainer(const std::string& path) {
    Descriptor container(::open(path.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!container) return Error{posixErrorDomain, errno, path + ": " + textOf(errno)};
    if (::mkdirat(container.get(), "tmp", 0700) != 0 && errno != EEXIST) {
        return Error{posixErrorDomain, errno, path + "/tmp: " + textOf(errno)};
    }
    return container;
}

/// A standard descriptor that is missing would go to the next file that the service opens.
bool fillStandardDescriptors() {
    for (const int number : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
        if (::fcntl(number, F_GETFD) == -1 && ::open("/dev/null", O_RDWR | O_NOCTTY) != number) return false;
    }
    return true;
}

/// Also the superuser's services run without the superuser's rights.
bool dropCapabilities() {
    ::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0); // where there are none, there is nothing to clear
    // The bounding set is what a program that the superuser executes gets. Ends at the first that the kernel does not
    // know; who may not drop any has none to pass on.
    for (unsigned long capability = 0; ::prctl(PR_CAPBSET_DROP, capability, 0, 0, 0) == 0;) ++capability;
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    const __user_cap_data_struct none[_LINUX_CAPABILITY_U32S_3] = {};
    if (::syscall(SYS_capset, &header, none) != 0) return false;
    return ::geteuid() != 0 || ::prctl(PR_CAPBSET_READ, CAP_SYS_ADMIN, 0, 0, 0) == 0;
}

/// A host that ignores or blocks signals must not have services that cannot be asked to end. Asks the kernel itself:
/// the C library hides the two signals that it keeps for its threads, and those too are inherited as ignored or
/// blocked.
void resetSignals() {
    const std::array<std::uint64_t, 8> byDefault{}; // the kernel's action and its mask of signals: zeros mean SIG_DFL
    const std::uint64_t none = 0;
    for (int number = 1; number <= SIGRTMAX; ++number) {
        ::syscall(SYS_rt_sigaction, number, byDefault.data(), nullptr, sizeof none); // not all can be set
    }
    ::syscall(SYS_rt_sigprocmask, SIG_SETMASK, &none, nullptr, sizeof none);
}

/// The file that tells "vigild" of a busy instance, made here so that the service needs no right to make others, nor to
/// see those of others.
Descriptor openBusyFile(const Root& root, const std::string& identifier) {
    const std::string users = busyDirectory(root);
    const auto own = openUserDirectory(users, ::geteuid(), {}, MissingDirectory::made);
    if (!own) return {};
    return Descriptor(::openat(own->get(), identifier.c_str(),
                               O_RDONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0600));
}

Outcome confineService(const ServiceDescription& service, const std::vector<OwnPlace>& own) {
    const int version = landlockVersion();
    if (version == 0) {
        const std::string missing = "this kernel has no Landlock, or has it switched off, so the service cannot be "
                                    "kept from the user's files";
        if (::secure_getenv(allowUnconfinedVariable) == nullptr) {
            return LaunchRefusal{LaunchStatus::notConfined, missing};
        }
        systemLog().defaultHandle().error("starting a service unconfined, as %{public}s says: %{public}s",
                                          allowUnconfinedVariable, missing.c_str());
    }
    if (const auto failure = confine(*service.profile, own, version)) {
        return LaunchRefusal{LaunchStatus::notConfined, failure->text()};
    }
    return std::nullopt;
}

std::vector<char*> pointersTo(std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    pointers.reserve(texts.size() + 1);
    for (auto& text : texts) pointers.push_back(text.data());
    pointers.push_back(nullptr);
    return pointers;
}

/// Executables are registered by their canonical path.
std::string canonicalName(const std::string& name) {
    if (name.find('/') == std::string::npos) return name;
    const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(name.c_str(), nullptr), &std::free);
    return resolved ? std::string(resolved.get()) : name;
}

} // namespace

LaunchRefusal becomeService(const Root& root, const std::string& name, const std::vector<std::string>& arguments) {
    if (name.empty() || name.size() >= PATH_MAX) return {LaunchStatus::usage, "no name of a service"};
    if (!fillStandardDescriptors()) return {LaunchStatus::refused, "/dev/null: " + textOf(errno)};
    Granted granted;
    if (auto refusal = askManager(root, canonicalName(name), granted)) return *refusal;
    const ServiceRegistration& registration = granted.registration;

    const auto opened = openService(registration);
    if (!opened) {
        const bool isReplaced = opened.error().code == ESTALE || opened.error().code == ELOOP;
        return {LaunchStatus::refused, isReplaced
                                           ? registration.executablePath + " was replaced since it was registered"
                                           : opened.error().text()};
    }
    const auto read = readServiceDescription(registration.overlay);
    if (const auto* fault = std::get_if<std::string>(&read)) return {LaunchStatus::refused, *fault};
    const auto& service = std::get<ServiceDescription>(read);
    for (const auto& variable : service.dropped) {
        systemLog().defaultHandle().notice("%{public}s is not for services to be given; dropped", variable.c_str());
    }

    const std::string& identifier = registration.service.identifier;
    const auto path = Containers(root).userContainer(registration.container);
    if (!path) return {LaunchStatus::refused, path.error().text()};
    const auto container = openContainer(*path);
    if (!container) return {LaunchStatus::refused, container.error().text()};
    std::vector<OwnPlace> own{{opened->bundle.get(), readFiles | executeFiles},
                              {container->get(), readFiles | changeFiles}};
    const Descriptor busy = openBusyFile(root, identifier);
    if (busy) {
        own.push_back({busy.get(), readFiles}); // enough for a lock
    } else {
        systemLog().defaultHandle().error("%{public}s will never count as busy: its file cannot be made",
                                          identifier.c_str());
    }
    const std::string managersContainer =
        root.users() + '/' + std::to_string(granted.manager) + "/Containers/" + registration.container;
    auto environment = serviceEnvironment(service, managersContainer, *path);
    std::vector<std::string> texts{registration.executablePath};
    texts.insert(texts.end(), arguments.begin(), arguments.end());
    const auto argumentPointers = pointersTo(texts);
    const auto environmentPointers = pointersTo(environment);

    if (::fchdir(container->get()) != 0) return {LaunchStatus::refused, *path + ": " + textOf(errno)};
    if (::close_range(STDERR_FILENO + 1, UINT_MAX, CLOSE_RANGE_CLOEXEC) != 0) {
        return {LaunchStatus::notConfined, "close_range: " + textOf(errno)};
    }
    if (!dropCapabilities()) return {LaunchStatus::notConfined, "the privileges cannot be given up"};
    if (auto refusal = confineService(service, own)) return *refusal;
    resetSignals();
    ::execveat(opened->executable.get(), "", argumentPointers.data(), environmentPointers.data(), AT_EMPTY_PATH);
    // A script's interpreter would have to open it again, by a descriptor that is closed by then.
    const std::string reason = errno == ENOENT ? "no program for this machine, or a script" : textOf(errno);
    return {LaunchStatus::notExecuted, registration.executablePath + ": " + reason};
}

} // namespace platform::linux_
