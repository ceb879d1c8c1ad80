#include "platform/linux/UserDirectory.h"

#include "platform/linux/SystemError.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumComponent = 255; // NAME_MAX of the file systems in use
constexpr int openFlags = O_DIRECTORY | O_CLOEXEC;

/// Not open, with errno set, on failure. A confined service may not list these directories; to go through them to a
/// file of its own, a mere reference does.
Descriptor open(int parent, const std::string& name, int flags) {
    Descriptor directory(::openat(parent, name.c_str(), openFlags | O_RDONLY | flags));
    if (!directory && errno == EACCES) directory.reset(::openat(parent, name.c_str(), openFlags | O_PATH | flags));
    return directory;
}

} // namespace

int pathComponentError(std::string_view name) {
    if (name.empty() || name == "." || name == "..") return EINVAL;
    const auto forbidden = [](char c) { return c == '/' || static_cast<unsigned char>(c) < 0x20 || c == 0x7f; };
    if (std::any_of(name.begin(), name.end(), forbidden)) return EINVAL;
    return name.size() > maximumComponent ? ENAMETOOLONG : 0;
}

Result<Descriptor> openUsersDirectory(const std::string& path, uid_t user, MissingDirectory missing) {
    if (missing == MissingDirectory::made) {
        for (std::size_t end = path.find('/', 1); end != std::string::npos; end = path.find('/', end + 1)) {
            // A failure shows when the last directory is opened.
            static_cast<void>(::mkdir(path.substr(0, end).c_str(), 0755));
        }
        // A squatted private directory in it is of no use, because its owner is checked.
        if (::mkdir(path.c_str(), 0755) == 0 && ::geteuid() == 0 && ::chmod(path.c_str(), 01777) != 0) {
            return systemError(errno, path);
        }
    }
    Descriptor directory = open(AT_FDCWD, path, 0);
    struct stat status{};
    if (!directory || ::fstat(directory.get(), &status) != 0) return systemError(errno, path);
    // Whoever may rename entries here could put one user's directory in the place of another's.
    if (status.st_uid != 0 && status.st_uid != user) return systemError(EPERM, path);
    if ((status.st_mode & 022) != 0 && (status.st_mode & S_ISVTX) == 0) return systemError(EACCES, path);
    return directory;
}

Result<Descriptor> openUserDirectory(const std::string& users, uid_t user,
                                     std::initializer_list<std::string_view> components, MissingDirectory missing) {
    auto opened = openUsersDirectory(users, user, missing);
    if (!opened) return opened.error();

    Descriptor directory = *std::move(opened);
    const std::string own = std::to_string(user);
    std::string path = users;
    const auto enter = [&](const std::string& name) -> Failure {
        path += '/' + name;
        if (missing == MissingDirectory::made && ::mkdirat(directory.get(), name.c_str(), 0700) != 0 &&
            errno != EEXIST) {
            return systemError(errno, path);
        }
        Descriptor next = open(directory.get(), name, O_NOFOLLOW);
        struct stat status{};
        if (!next || ::fstat(next.get(), &status) != 0) return systemError(errno, path);
        if (status.st_uid != user) return systemError(EPERM, path);
        if ((status.st_mode & 077) != 0) return systemError(EACCES, path);
        directory = std::move(next);
        return std::nullopt;
    };

    if (auto failure = enter(own)) return *failure;
    for (const auto component : components) {
        if (auto failure = enter(std::string(component))) return *failure;
    }
    return directory;
}

} // namespace platform::linux_
