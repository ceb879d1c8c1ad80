#include "platform/linux/Entitlements.h"

#include "platform/linux/Descriptor.h"
#include "platform/linux/FileTrust.h"
#include "platform/linux/ProcPath.h"
#include "platform/linux/SystemError.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

bool isPrivileged() { return geteuid() == 0; }

/// True when nobody but `owner` (and root) can change the program in the file: the attribute stays when the file is
/// written to, so it must not vouch for a program that others may rewrite. An access list that lets a named user write
/// shows in the group's bits.
bool belongsTo(const struct stat& status, uid_t owner) {
    return S_ISREG(status.st_mode) && status.st_uid == owner && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

/// Empty attributes count as broken, so an empty text stands for "none".
Result<std::string> readAttribute(int descriptor, const char* name) {
    // By path, since a descriptor opened with O_PATH does not do for fgetxattr.
    std::string path = procPath(descriptor);
    std::string bytes(1024, '\0');
    while (true) {
        ssize_t size = getxattr(path.c_str(), name, bytes.data(), bytes.size());
        if (size == 0) return systemError(EBADMSG, name);
        if (size > 0) return bytes.substr(0, static_cast<std::size_t>(size));
        if (errno == ENODATA || errno == EOPNOTSUPP) return std::string();
        if (errno != ERANGE || bytes.size() == maximumEntitlementsSize) return systemError(errno, name);
        bytes.resize(maximumEntitlementsSize);
    }
}

} // namespace

Result<std::optional<Dictionary>> readEntitlements(int descriptor) {
    struct stat status{};
    if (fstat(descriptor, &status) != 0) return systemError(errno, "entitlements");

    std::string bytes;
    const char* name = entitlementsAttribute;
    if ((belongsTo(status, 0) || belongsTo(status, geteuid())) && isTrustedFileSystem(descriptor)) {
        auto attribute = readAttribute(descriptor, name);
        if (!attribute) return attribute.error();
        bytes = *std::move(attribute);
    }
    if (bytes.empty() && !isPrivileged() && belongsTo(status, geteuid())) {
        name = userEntitlementsAttribute;
        auto attribute = readAttribute(descriptor, name);
        if (!attribute) return attribute.error();
        bytes = *std::move(attribute);
    }
    if (bytes.empty()) return std::optional<Dictionary>();

    auto value = decodePropertyList(bytes, maximumManifestNesting);
    if (!value) return value.error();
    auto dictionary = value->dictionary();
    if (!dictionary) return Error{propertyListErrorDomain, 0, std::string(name) + ": not a dictionary"};
    return dictionary;
}

Result<std::optional<Dictionary>> readEntitlements(const std::string& path) {
    Descriptor file(open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!file) return systemError(errno, path);
    return readEntitlements(file.get());
}

Failure writeEntitlements(const std::string& path, const Dictionary& entitlements) {
    Descriptor file(open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!file) return systemError(errno, path);
    struct stat status{};
    if (fstat(file.get(), &status) != 0) return systemError(errno, path);
    // Signed all the same, such a file would never be believed; better to hear of it now.
    if (!belongsTo(status, 0) && !belongsTo(status, geteuid()))
        return Error{posixErrorDomain, EPERM,
                     path + ": not a regular file of the signer's own that only its owner may write to"};
    if (isPrivileged() && !isTrustedFileSystem(file.get()))
        return Error{posixErrorDomain, EPERM, path + ": on a file system that is mounted nosuid"};
    auto bytes = encodeXML(Value(entitlements));
    if (!bytes) return bytes.error();
    if (bytes->size() > maximumEntitlementsSize) return systemError(E2BIG, path);
    const char* name = isPrivileged() ? entitlementsAttribute : userEntitlementsAttribute;
    if (setxattr(procPath(file.get()).c_str(), name, bytes->data(), bytes->size(), 0) != 0)
        return systemError(errno, path);
    return std::nullopt;
}

Failure removeEntitlements(const std::string& path) {
    Descriptor file(open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!file) return systemError(errno, path);
    const std::string attributed = procPath(file.get());
    const auto isGone = [&](const char* name) {
        return removexattr(attributed.c_str(), name) == 0 || errno == ENODATA || errno == EOPNOTSUPP;
    };
    if (!isGone(userEntitlementsAttribute)) return systemError(errno, path);
    if (isPrivileged() && !isGone(entitlementsAttribute)) return systemError(errno, path);
    return std::nullopt;
}

} // namespace platform::linux_
