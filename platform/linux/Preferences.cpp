#include "platform/linux/Preferences.h"

#include "platform/linux/Descriptor.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <array>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumFileSize = 1U << 20U; // settings of people; read as a whole on every change
constexpr std::string_view directoryName = "Preferences";

// Time stamps advance with the kernel's tick, 10 ms at the most. A younger file could change again and look the same.
constexpr std::int64_t tickNanoseconds = 10'000'000;

std::string hostName() {
    std::array<char, HOST_NAME_MAX + 1> name{};
    if (::gethostname(name.data(), name.size()) != 0 || pathComponentError(name.data()) != 0) return "localhost";
    return name.data();
}

std::int64_t nanoseconds(const timespec& time) { return std::int64_t{time.tv_sec} * 1'000'000'000 + time.tv_nsec; }

bool isOlderThanTick(const timespec& changed) {
    timespec now{};
    if (::clock_gettime(CLOCK_REALTIME, &now) != 0) return false;
    return nanoseconds(now) - nanoseconds(changed) > tickNanoseconds;
}

/// The bytes from the descriptor's position to the end. EFBIG beyond the limit.
Result<std::string> readAll(int descriptor, const std::string& path) {
    std::string bytes(maximumFileSize + 1, '\0');
    std::size_t size = 0;
    while (size < bytes.size()) {
        // A regular file; who asks for values meanwhile waits for them.
        // NOLINTNEXTLINE(clang-analyzer-unix.BlockInCriticalSection)
        const ssize_t got = ::read(descriptor, bytes.data() + size, bytes.size() - size);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) return systemError(errno, path);
        if (got == 0) break;
        size += static_cast<std::size_t>(got);
    }
    if (size > maximumFileSize) return systemError(EFBIG, path);
    bytes.resize(size);
    return bytes;
}

} // namespace

Preferences::Preferences(Root root, uid_t user) : _root(std::move(root)), _user(user), _host(hostName()) {}

Preferences::Identity Preferences::identityOf(const struct stat& status) {
    return {status.st_dev, status.st_ino, status.st_size, status.st_mtim, status.st_ctim};
}

bool Preferences::isSame(const Identity& left, const Identity& right) {
    return left.device == right.device && left.inode == right.inode && left.size == right.size &&
           nanoseconds(left.modified) == nanoseconds(right.modified) &&
           nanoseconds(left.changed) == nanoseconds(right.changed);
}

std::string Preferences::fileName(const std::string& domain) const { return domain + '.' + _host + ".vlist"; }

std::string Preferences::path(const std::string& domain) const {
    return _root.users() + '/' + std::to_string(_user) + '/' + std::string(directoryName) + '/' + fileName(domain);
}

void Preferences::addDomain(const std::string& domain) {
    if (pathComponentError(domain) != 0 || pathComponentError(fileName(domain)) != 0) return;
    const std::lock_guard lock(_mutex);
    _domains.try_emplace(domain);
}

bool Preferences::synchronize(const std::string& domain) {
    const std::lock_guard lock(_mutex);
    const auto found = _domains.find(domain);
    if (found == _domains.end()) return false;
    Domain& known = found->second;

    struct stat status{};
    if (::lstat(path(domain).c_str(), &status) != 0) {
        if (errno != ENOENT) return false;
        known = Domain{};
        return true;
    }
    if (known.identity && isSame(*known.identity, identityOf(status))) return known.isReadable;

    auto stored = read(domain);
    known.isReadable = static_cast<bool>(stored);
    if (stored) {
        known.values = stored->values;
        known.identity = stored->identity;
    } else {
        // What could not be read is looked at again each time: its cause may lie outside the file.
        known.identity.reset();
    }
    return known.isReadable;
}

Value Preferences::value(const std::string& domain, const std::string& key) {
    const std::lock_guard lock(_mutex);
    const auto found = _domains.find(domain);
    return found == _domains.end() ? Value() : found->second.values[key];
}

Result<Preferences::Stored> Preferences::read(const std::string& domain) const {
    const auto directory = openUserDirectory(_root.users(), _user, {directoryName}, MissingDirectory::refused);
    if (!directory) return directory.error();
    const std::string place = path(domain);
    // Not blocking, should it be a pipe; not through a link, which could lead to a file that others write.
    const Descriptor file(
        ::openat(directory->get(), fileName(domain).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    struct stat status{};
    if (!file || ::fstat(file.get(), &status) != 0) return systemError(errno, place);
    if (!S_ISREG(status.st_mode)) return systemError(EINVAL, place);
    if (status.st_uid != _user && status.st_uid != 0) return systemError(EPERM, place);
    if ((status.st_mode & 022) != 0) return systemError(EACCES, place);

    // Before the file is read: a write during the reading then shows in the next look.
    const Identity identity = identityOf(status);
    const bool isSettled = isOlderThanTick(status.st_ctim);
    const auto bytes = readAll(file.get(), place);
    if (!bytes) return bytes.error();
    const auto content = decodePropertyList(*bytes);
    if (!content) return content.error();
    const auto values = content->dictionary();
    if (!values) return Error{propertyListErrorDomain, 0, place + ": no dictionary"};
    return Stored{*values, isSettled ? std::optional(identity) : std::nullopt};
}

} // namespace platform::linux_
