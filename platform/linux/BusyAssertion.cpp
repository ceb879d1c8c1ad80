#include "platform/linux/BusyAssertion.h"

#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <cerrno>
#include <cstdint>
#include <fcntl.h>
#include <map>
#include <mutex>
#include <random>
#include <unistd.h>

namespace platform::linux_ {

namespace {

/// The busy files that this process has open, by path. Closing any descriptor of a file ends all locks that the process
/// holds on it, so each file is opened once, and opened and closed only under the mutex.
struct OpenFiles {
    std::mutex mutex;
    std::map<std::string, std::weak_ptr<Descriptor>> files;
};
OpenFiles& openFiles() {
    static OpenFiles& files = *new OpenFiles; // never destroyed: an assertion may live in another static object
    return files;
}

/// A byte that no other instance locks. Not the pid, which two instances in different pid namespaces may share.
off_t randomByte() {
    std::random_device device;
    return static_cast<off_t>((std::uint64_t{device()} << 30U | device() >> 2U) & INT64_MAX >> 1U);
}

} // namespace

BusyAssertion::BusyAssertion(const Root& root, const std::string& bundleIdentifier)
    : _failure(hold(root, bundleIdentifier)) {}

BusyAssertion::~BusyAssertion() {
    const std::lock_guard lock(openFiles().mutex);
    _file.reset();
}

Failure BusyAssertion::hold(const Root& root, const std::string& bundleIdentifier) {
    if (const int number = pathComponentError(bundleIdentifier)) return systemError(number, "bundle identifier");
    const std::string users = busyDirectory(root);
    const std::string path = users + '/' + std::to_string(::geteuid()) + '/' + bundleIdentifier;

    const std::lock_guard guard(openFiles().mutex);
    auto& known = openFiles().files[path];
    auto file = known.lock();
    if (!file) {
        const auto directory = openUserDirectory(users, ::geteuid(), {}, MissingDirectory::made);
        if (!directory) return directory.error();
        file = std::make_shared<Descriptor>(
            ::openat(directory->get(), bundleIdentifier.c_str(),
                     O_RDONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0600));
        if (!*file) return systemError(errno, path);
        known = file;
    }
    // A lock for reading: confined plug-ins may not write to the file, which lies in memory that is not theirs to fill.
    // Also when the file was open: after a fork it may be, and only the parent has a lock.
    struct flock lock{};
    lock.l_type = F_RDLCK;
    lock.l_whence = SEEK_SET;
    lock.l_start = randomByte();
    lock.l_len = 1;
    if (::fcntl(file->get(), F_SETLK, &lock) != 0) return systemError(errno, path);
    _file = std::move(file);
    return std::nullopt;
}

} // namespace platform::linux_
