#include "platform/linux/ProcessAssertions.h"

#include "platform/SystemLog.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <utility>

namespace platform::linux_ {

namespace {

// Of one file. A user may lock as many bytes as they like, and each costs a question.
constexpr int maximumQuestions = 256;

LogHandle& log() { return systemLog().defaultHandle(); }

/// Opens for reading what a user made. Never waits: not for a pipe, not for a lease, and not for a file system that
/// the user mounted there. Not open, with errno set, on failure.
Descriptor openOfUser(int directory, const std::string& name, int flags) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC | flags);
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_XDEV;
    return Descriptor(static_cast<int>(::syscall(SYS_openat2, directory, name.c_str(), &how, sizeof how)));
}

/// The private directory of the user of that id; not open when there is none.
Descriptor openPrivateDirectory(int users, uid_t user) {
    Descriptor directory = openOfUser(users, std::to_string(user), O_DIRECTORY);
    struct stat status{};
    int number = !directory || ::fstat(directory.get(), &status) != 0 ? errno : 0;
    if (number == ENOENT) return {};
    if (number == 0 && status.st_uid != user) number = EPERM;
    if (number == 0 && (status.st_mode & 077) != 0) number = EACCES;
    if (number == 0) return directory;
    log().error("busy instances of user %u not told: %@", user, systemError(number, "directory"));
    return {};
}

/// The processes that hold a lock on the open file; 0 for those that have no pid here.
std::set<pid_t> lockHolders(int file) {
    std::set<pid_t> holders;
    std::vector<std::pair<off_t, off_t>> ranges{{0, 0}}; // from and length; length 0 is all the rest
    for (int questions = 0; !ranges.empty() && questions < maximumQuestions; ++questions) {
        const auto [from, length] = ranges.back();
        ranges.pop_back();
        struct flock lock{};
        lock.l_type = F_WRLCK;
        lock.l_whence = SEEK_SET;
        lock.l_start = from;
        lock.l_len = length;
        if (::fcntl(file, F_GETLK, &lock) != 0 || lock.l_type == F_UNLCK) continue;
        holders.insert(std::max(lock.l_pid, 0));
        // The kernel tells of one lock in the range; others may lie on either side of it.
        if (lock.l_start > from) ranges.emplace_back(from, lock.l_start - from);
        if (lock.l_len == 0) continue;
        const off_t next = lock.l_start + lock.l_len;
        if (length == 0 || next < from + length) ranges.emplace_back(next, length == 0 ? 0 : from + length - next);
    }
    return holders;
}

/// The users whose instances count.
std::vector<uid_t> usersIn(int directory) {
    if (::geteuid() != 0) return {::geteuid()};
    std::vector<uid_t> users;
    const auto listing = listDirectory(directory);
    if (!listing) return users;
    for (const std::string& name : listing->directories) {
        uid_t user = 0;
        const auto [end, error] = std::from_chars(name.data(), name.data() + name.size(), user);
        if (error == std::errc() && end == name.data() + name.size()) users.push_back(user);
    }
    return users;
}

} // namespace

std::string busyDirectory(const Root& root) { return root.runtime() + "/vigild"; }

ProcessAssertions::ProcessAssertions(const Root& root) : _directory(busyDirectory(root)) {
    // A failure shows with the first question.
    static_cast<void>(openUsersDirectory(_directory, ::geteuid(), MissingDirectory::made));
}

/// Opening every user's directory for each plug-in of a long request would let one user, who can make any number of
/// directories, stop the daemon. So they stay open until the directory around them changes.
void ProcessAssertions::readUsers(int directory) {
    struct stat status{};
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    const bool isKnown = ::fstat(directory, &status) == 0 && status.st_ino == _inode &&
                         status.st_mtim.tv_sec == _changed.tv_sec && status.st_mtim.tv_nsec == _changed.tv_nsec;
    // Within the clock's grain another change may follow that does not show.
    if (isKnown && now.tv_sec > _changed.tv_sec + 1) return;
    _users.clear();
    for (const uid_t user : usersIn(directory)) {
        if (auto own = openPrivateDirectory(directory, user)) _users.emplace_back(user, std::move(own));
    }
    _inode = status.st_ino;
    _changed = status.st_mtim;
}

std::vector<Dictionary> ProcessAssertions::busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) {
    const auto directory = openUsersDirectory(_directory, ::geteuid(), MissingDirectory::refused);
    if (!directory) {
        if (directory.error().code != ENOENT) log().error("busy instances not told: %@", directory.error());
        return {};
    }
    const std::lock_guard lock(_lock);
    readUsers(directory->get());
    std::vector<Dictionary> instances;
    for (const auto& identifier : bundleIdentifiers) {
        if (pathComponentError(identifier) != 0) continue;
        for (const auto& [user, own] : _users) {
            const Descriptor file = openOfUser(own.get(), identifier, 0);
            if (!file) {
                if (errno != ENOENT)
                    log().error("busy instances of user %u not told: %@", user, systemError(errno, identifier));
                continue;
            }
            for (const pid_t process : lockHolders(file.get())) {
                MutableDictionary instance{{instanceBundleIdentifierKey, identifier}, {instanceUserKey, user}};
                if (process != 0) instance.set(instanceProcessKey, process);
                log().info("instance of %s is busy: process %d of user %u", identifier, process, user);
                instances.push_back(std::move(instance));
            }
        }
    }
    return instances;
}

} // namespace platform::linux_
