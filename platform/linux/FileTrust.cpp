#include "platform/linux/FileTrust.h"

#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/SystemError.h"

#include <cerrno>
#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/vfs.h>
#include <unistd.h>

namespace platform::linux_ {

int trustError(int descriptor) {
    struct stat status{};
    if (::fstat(descriptor, &status) != 0) return errno;
    if (status.st_uid != 0 && status.st_uid != ::geteuid()) return EPERM;
    return (status.st_mode & (S_IWGRP | S_IWOTH)) != 0 ? EACCES : 0;
}

bool isTrustedFileSystem(int descriptor) {
    struct statfs status{};
    if (::fstatfs(descriptor, &status) != 0) return false;
    return status.f_type == TMPFS_MAGIC || (status.f_flags & ST_NOSUID) == 0;
}

Result<Descriptor> openTrustedDirectory(const std::string& path) {
    Descriptor directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!directory) return systemError(errno, path);
    if (const int number = trustError(directory.get())) return systemError(number, path);
    return directory;
}

Result<std::optional<Dictionary>> readTrustedDictionary(int directory, const std::string& name, std::size_t limit) {
    const auto bytes = readFile(directory, name, limit, trustError);
    if (!bytes) return bytes.error();
    if (!*bytes) return std::optional<Dictionary>();
    const auto content = decodePropertyList(**bytes);
    if (!content) return Error{content.error().domain, content.error().code, name + ": " + content.error().text()};
    const auto dictionary = content->dictionary();
    if (!dictionary) return Error{propertyListErrorDomain, 0, name + ": no dictionary"};
    return dictionary;
}

} // namespace platform::linux_
