#include "platform/linux/Files.h"

#include "platform/linux/ActingAsPeer.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/ProcPath.h"

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <linux/openat2.h>
#include <memory>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

std::string systemText(int number) { return std::generic_category().message(number); }

Error readError(int number, const std::string& path) {
    int code = fileReadUnknownCode;
    if (number == ENOENT || number == ENOTDIR) code = fileReadNoSuchFileCode;
    if (number == EACCES || number == EPERM) code = fileReadNoPermissionCode;
    return {fileErrorDomain, code, path + ": " + systemText(number)};
}

Error writeError(int number, const std::string& path) {
    int code = fileWriteUnknownCode;
    switch (number) {
    case ENOSPC:
    case EDQUOT:
    case EFBIG: // the process's own limit on files is one more kind of full
        code = fileWriteOutOfSpaceCode;
        break;
    case EACCES:
    case EPERM:
    case EROFS: code = fileWriteNoPermissionCode; break;
    default: break;
    }
    return {fileErrorDomain, code, path + ": " + systemText(number)};
}

/// Where a path ends after its symbolic links, the last name of which need not exist.
struct Target {
    Descriptor directory;
    std::string name;
};

/// errno on failure.
int openTarget(std::string path, Target& target) {
    constexpr int maximumLinks = 40; // the kernel's own bound
    for (int links = 0;; ++links) {
        std::size_t slash = path.rfind('/');
        std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
        target.name = path.substr(slash == std::string::npos ? 0 : slash + 1);
        if (target.name.empty() || target.name == "." || target.name == "..") return EISDIR;
        target.directory = Descriptor(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!target.directory) return errno;
        char link[PATH_MAX];
        ssize_t size = readlinkat(target.directory.get(), target.name.c_str(), link, sizeof link);
        if (size < 0) return errno == EINVAL || errno == ENOENT ? 0 : errno; // no link, or nothing there yet
        if (size == static_cast<ssize_t>(sizeof link)) return ENAMETOOLONG;
        if (links == maximumLinks) return ELOOP;
        std::string destination(link, static_cast<std::size_t>(size));
        path = destination.starts_with('/') ? std::string() : directory + '/';
        path += destination;
    }
}

std::string temporaryName(const std::string& name) {
    constexpr std::string_view suffix = ".saving";
    // Two long names that are cut to the same one take turns by the lock.
    return "." + name.substr(0, NAME_MAX - 1 - suffix.size()) + std::string(suffix);
}

/// The temporary file, locked and empty, or none with errno set.
Descriptor lockTemporary(int directory, const char* name) {
    while (true) {
        // O_NONBLOCK: should somebody have put a pipe there, opening it must not hang.
        Descriptor file(openat(directory, name, O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
        if (!file && errno != ELOOP && errno != ENXIO) return Descriptor();
        struct stat status{};
        if (file && fstat(file.get(), &status) != 0) return Descriptor();
        // In a directory where others may write, a prepared file would stay theirs after the rename, and a second
        // name for it would go on changing it.
        if (!file || !S_ISREG(status.st_mode) || status.st_uid != geteuid() || status.st_nlink > 1) {
            if (unlinkat(directory, name, 0) != 0 && errno != ENOENT) return Descriptor();
            continue;
        }
        while (flock(file.get(), LOCK_EX) != 0)
            if (errno != EINTR) return Descriptor();
        struct stat named{};
        if (fstatat(directory, name, &named, AT_SYMLINK_NOFOLLOW) != 0) {
            if (errno != ENOENT) return Descriptor();
            continue; // whoever had the lock has moved it into place or removed it
        }
        if (fstat(file.get(), &status) != 0) return Descriptor();
        if (named.st_dev != status.st_dev || named.st_ino != status.st_ino) continue;
        if (ftruncate(file.get(), 0) != 0 || fchmod(file.get(), 0600) != 0) return Descriptor();
        return file;
    }
}

bool writeFully(int file, std::string_view bytes) {
    while (!bytes.empty()) {
        ssize_t written = write(file, bytes.data(), bytes.size());
        if (written < 0 && errno == EINTR) continue;
        if (written < 0) return false;
        bytes.remove_prefix(static_cast<std::size_t>(written));
    }
    return true;
}

/// Gives the new file the old one's owner, as far as this process may, and mode.
bool keepOwnerAndMode(int file, const struct stat& old) {
    mode_t mode = old.st_mode & 07777;
    struct stat created{};
    if (fstat(file, &created) != 0) return false;
    bool owner = created.st_uid == old.st_uid || fchown(file, old.st_uid, static_cast<gid_t>(-1)) == 0;
    bool group = created.st_gid == old.st_gid || fchown(file, static_cast<uid_t>(-1), old.st_gid) == 0;
    if (!owner) mode &= ~static_cast<mode_t>(S_ISUID);
    // The group's rights were not meant for another group.
    if (!group) mode &= ~static_cast<mode_t>(S_ISGID | S_IRWXG);
    return fchmod(file, mode) == 0;
}

} // namespace

std::string Files::locate(const std::string& wellKnownPath) { return _root.at(wellKnownPath); }

Result<std::string> Files::read(const std::string& path, std::size_t limit) {
    // Looked at before it is opened: opening alone makes some devices act, and a watchdog would reset the machine.
    Descriptor located(open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!located) return readError(errno, path);
    struct stat status{};
    if (fstat(located.get(), &status) != 0) return readError(errno, path);
    if (S_ISDIR(status.st_mode)) return readError(EISDIR, path);
    if (!S_ISREG(status.st_mode)) return Error{fileErrorDomain, fileReadUnknownCode, path + ": not a regular file"};
    Error tooLarge{fileErrorDomain, fileReadTooLargeCode, path + ": larger than " + std::to_string(limit) + " bytes"};
    if (static_cast<std::uint64_t>(status.st_size) > limit) return tooLarge;

    Descriptor file(open(procPath(located.get()).c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!file) return readError(errno, path);
    // The size is a hint: the file may grow or shrink meanwhile, and files of /proc have none. One byte more than
    // expected shows the end without another round.
    std::string bytes;
    std::size_t used = 0;
    std::size_t wanted = static_cast<std::size_t>(status.st_size) + 1;
    while (true) {
        bytes.resize(wanted);
        ssize_t count = ::read(file.get(), bytes.data() + used, bytes.size() - used);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return readError(errno, path);
        if (count == 0) break;
        used += static_cast<std::size_t>(count);
        if (used > limit) return tooLarge;
        if (used == bytes.size()) wanted = used + std::min(std::max<std::size_t>(used, 4096), limit - used + 1);
    }
    bytes.resize(used);
    return bytes;
}

Failure Files::writeAtomically(const std::string& path, std::string_view bytes) {
    Target target;
    if (int number = openTarget(path, target); number != 0 || !target.directory) return writeError(number, path);
    const int directory = target.directory.get();
    const char* name = target.name.c_str();
    struct stat old{};
    bool exists = fstatat(directory, name, &old, AT_SYMLINK_NOFOLLOW) == 0;
    if (!exists && errno != ENOENT) return writeError(errno, path);
    if (exists && S_ISDIR(old.st_mode)) return writeError(EISDIR, path);
    // A rename would replace the device itself.
    if (exists && !S_ISREG(old.st_mode))
        return Error{fileErrorDomain, fileWriteUnknownCode, path + ": not a regular file"};

    std::string temporary = temporaryName(target.name);
    Descriptor file = lockTemporary(directory, temporary.c_str());
    if (!file) return writeError(errno, path);
    if (!writeFully(file.get(), bytes) || (exists && !keepOwnerAndMode(file.get(), old)) || fsync(file.get()) != 0 ||
        renameat(directory, temporary.c_str(), directory, name) != 0) {
        Error error = writeError(errno, path);
        unlinkat(directory, temporary.c_str(), 0); // still under the lock, so it is this call's own
        return error;
    }
    // File systems that cannot sync a directory say EINVAL.
    if (fsync(directory) != 0 && errno != EINVAL) return writeError(errno, path);
    return std::nullopt;
}

Failure Files::setAside(const std::string& path, std::string_view suffix) {
    Target target;
    if (int number = openTarget(path, target); number != 0 || !target.directory) return readError(number, path);
    const int directory = target.directory.get();
    struct stat status{};
    if (fstatat(directory, target.name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) return readError(errno, path);
    if (!S_ISREG(status.st_mode)) return Error{fileErrorDomain, fileWriteUnknownCode, path + ": not a regular file"};
    const std::string aside = target.name + std::string(suffix);
    if (renameat(directory, target.name.c_str(), directory, aside.c_str()) != 0) return writeError(errno, path);
    return std::nullopt;
}

Result<std::string> Files::realPath(const std::string& path, std::size_t limit) {
    std::unique_ptr<char, decltype(&std::free)> resolved(realpath(path.c_str(), nullptr), &std::free);
    if (!resolved) return readError(errno, path);
    std::string result = resolved.get();
    if (result.size() >= limit) return readError(ENAMETOOLONG, path);
    return result;
}

Result<std::string> Files::realPath(const std::string& path, std::size_t limit, const AuditToken& peer) {
    if (geteuid() != 0) return realPath(path, limit);
    Descriptor located;
    {
        const ActingAsPeer acting(rightsOfPeer(peer));
        if (!acting.isReady()) return readError(EACCES, path);
        located = openReference(path, RESOLVE_NO_MAGICLINKS);
        if (!located) return readError(errno, path);
    }
    // The name of what the peer reached; going the way once more could lead elsewhere by now.
    char name[PATH_MAX];
    const ssize_t size = readlink(procPath(located.get()).c_str(), name, sizeof name);
    if (size < 0) return readError(errno, path);
    std::string result(name, static_cast<std::size_t>(size));
    if (result.size() >= std::min(limit, sizeof name)) return readError(ENAMETOOLONG, path);
    // What was deleted meanwhile, or has no name in this file tree, is shown with a name that is not its own.
    struct stat reached{};
    struct stat named{};
    if (fstat(located.get(), &reached) != 0 || lstat(result.c_str(), &named) != 0) return readError(errno, path);
    if (reached.st_dev != named.st_dev || reached.st_ino != named.st_ino) return readError(ENOENT, path);
    return result;
}

} // namespace platform::linux_
