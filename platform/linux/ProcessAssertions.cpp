#include "platform/linux/ProcessAssertions.h"

#include "platform/SystemLog.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/ProcPath.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <linux/openat2.h>
#include <optional>
#include <string_view>
#include <sys/inotify.h>
#include <sys/ioctl.h>
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

/// The file of that name in the user's private directory. Not open, with errno set, on failure.
Descriptor openBusyFile(int users, uid_t user, const std::string& identifier) {
    const std::string own = std::to_string(user);
    // Most users have no such file, and then their directory need not be opened.
    if (!openOfUser(users, own + '/' + identifier, 0) && errno == ENOENT) return {};
    const Descriptor directory = openOfUser(users, own, O_DIRECTORY);
    struct stat status{};
    if (!directory || ::fstat(directory.get(), &status) != 0) return {};
    const bool isOwners = status.st_uid == user;
    if (isOwners && (status.st_mode & 077) == 0) return openOfUser(directory.get(), identifier, 0);
    errno = isOwners ? EACCES : EPERM;
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

/// Whose directory has this name. None for others, "01" among them.
std::optional<uid_t> userNamed(const std::string& name) {
    uid_t user = 0;
    std::from_chars(name.data(), name.data() + name.size(), user);
    return std::to_string(user) == name ? std::optional(user) : std::nullopt;
}

/// Users that cannot be looked at. Told in one line, for one user can have any number of files and, with subordinate
/// ids, of directories.
struct Untold {
    std::size_t count = 0;
    uid_t user = 0; // the first one
    std::optional<Error> error;

    void add(uid_t whose, Error&& why) {
        if (count++ != 0) return;
        user = whose;
        error = std::move(why);
    }
};

} // namespace

std::string busyDirectory(const Root& root) { return root.runtime() + "/vigild"; }

ProcessAssertions::ProcessAssertions(const Root& root) : _directory(busyDirectory(root)) {
    // A failure shows with the first question.
    static_cast<void>(openUsersDirectory(_directory, ::geteuid(), MissingDirectory::made));
}

/// Anybody can make directories there in any number, so each costs one look when it comes and none with the questions
/// that follow.
void ProcessAssertions::readUsers(int directory) {
    if (::geteuid() != 0) {
        _users = {::geteuid()};
        return;
    }
    if (readChanges(directory)) return;
    _users.clear();
    const auto listing = listDirectory(directory);
    if (!listing) {
        log().error("busy instances not told: %@", systemError(errno, _directory));
        _changes.reset(); // next time from the beginning
        return;
    }
    const auto others =
        std::ranges::count_if(listing->directories, [&](const std::string& name) { return !note(directory, name); });
    if (others == 0 || std::exchange(_toldOfOthers, true)) return;
    log().error("%d directories of busy instances belong to others than their names say", others);
}

bool ProcessAssertions::readChanges(int directory) {
    struct stat status{};
    if (::fstat(directory, &status) != 0) return false;
    if (!_changes || status.st_dev != _device || status.st_ino != _inode) {
        _device = status.st_dev;
        _inode = status.st_ino;
        _changes = Descriptor(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
        // Changes of owners and modes, which cost their maker less than they cost here, are not asked for.
        constexpr auto events = static_cast<std::uint32_t>(IN_CREATE | IN_MOVED_TO | IN_ONLYDIR);
        if (::inotify_add_watch(_changes.get(), procPath(directory).c_str(), events) < 0) _changes.reset();
        return false;
    }
    // What comes while this reads is for the next question.
    int pending = 0;
    if (::ioctl(_changes.get(), FIONREAD, &pending) != 0) pending = 0;
    bool isComplete = true;
    alignas(inotify_event) std::array<char, 16384> buffer; // NOLINT(cppcoreguidelines-pro-type-member-init)
    while (pending > 0) {
        const ssize_t size = ::read(_changes.get(), buffer.data(), buffer.size());
        if (size < 0 && errno == EINTR) continue;
        if (size <= 0) return false;
        pending -= static_cast<int>(size);
        for (std::size_t at = 0; at < static_cast<std::size_t>(size);) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + at); // NOLINT
            at += sizeof(inotify_event) + event->len;
            // Too many to tell of, or the directory is gone and another one has its number.
            if ((event->mask & (IN_Q_OVERFLOW | IN_IGNORED)) != 0) isComplete = false;
            if ((event->mask & IN_IGNORED) != 0) _inode = 0;
            if (event->len != 0 && (event->mask & IN_ISDIR) != 0) note(directory, event->name);
        }
    }
    return isComplete;
}

bool ProcessAssertions::note(int directory, const std::string& name) {
    const auto user = userNamed(name);
    struct statx status{};
    // Never waits for a file system that the user mounted there.
    constexpr int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC;
    if (!user || ::statx(directory, name.c_str(), flags, STATX_UID, &status) != 0) return true;
    // What the superuser made may be given to the user yet.
    if (status.stx_uid != *user && status.stx_uid != 0) return false;
    _users.insert(*user);
    return true;
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
    Untold untold;
    for (const auto& identifier : bundleIdentifiers) {
        if (pathComponentError(identifier) != 0) continue;
        for (const uid_t user : _users) {
            const Descriptor file = openBusyFile(directory->get(), user, identifier);
            if (!file) {
                if (errno != ENOENT) untold.add(user, systemError(errno, identifier));
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
    if (untold.error)
        log().error("busy instances of user %u not told: %@ (and %d more)", untold.user, *untold.error,
                    untold.count - 1);
    return instances;
}

} // namespace platform::linux_
