#include "platform/linux/DirectoryFiles.h"

#include "platform/linux/SystemError.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <memory>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

bool isDirectory(int parent, const dirent& entry) {
    if (entry.d_type != DT_UNKNOWN) return entry.d_type == DT_DIR;
    struct stat status{};
    return fstatat(parent, entry.d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(status.st_mode);
}

} // namespace

Descriptor openDirectory(int parent, const std::string& name) {
    return Descriptor(openat(parent, name.c_str(), directoryFlags));
}

Descriptor openDirectory(const std::string& path) {
    Descriptor directory(open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::string_view rest = path;
    while (directory && !rest.empty()) {
        const std::size_t end = std::min(rest.find('/'), rest.size());
        const std::string name(rest.substr(0, end));
        rest.remove_prefix(std::min(end + 1, rest.size()));
        if (name.empty()) continue;
        // Passing through a directory takes no right to read it.
        const int flags = rest.empty() ? directoryFlags : O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
        directory = Descriptor(openat(directory.get(), name.c_str(), flags));
    }
    return directory;
}

Descriptor openReference(const std::string& path, std::uint64_t resolve) {
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC;
    how.resolve = resolve;
    return Descriptor(static_cast<int>(syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how)));
}

bool isShortage(int number) {
    return number == EMFILE || number == ENFILE || number == ENOMEM || number == EIO || number == EINTR;
}

std::optional<DirectoryListing> listDirectory(int directory) {
    // Opened once more: reading moves the position, and closing the stream closes its descriptor.
    Descriptor again(openat(directory, ".", directoryFlags));
    if (!again) return std::nullopt;
    std::unique_ptr<DIR, int (*)(DIR*)> stream(fdopendir(again.get()), closedir);
    if (!stream) return std::nullopt;
    (void)again.release();
    DirectoryListing listing;
    while (true) {
        errno = 0;
        const dirent* entry = readdir(stream.get());
        if (entry == nullptr) break;
        if (entry->d_name[0] == '.') continue;
        (isDirectory(directory, *entry) ? listing.directories : listing.others).emplace_back(entry->d_name);
    }
    if (errno != 0) return std::nullopt;
    std::ranges::sort(listing.directories);
    std::ranges::sort(listing.others);
    return listing;
}

Result<std::optional<std::string>> readFile(int directory, const std::string& name, std::size_t limit,
                                            int (*refusal)(int descriptor)) {
    Descriptor file(openat(directory, name.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC));
    if (!file) {
        if (errno == ENOENT) return std::optional<std::string>();
        return systemError(errno, name);
    }
    struct stat status{};
    if (fstat(file.get(), &status) != 0) return systemError(errno, name);
    if (!S_ISREG(status.st_mode)) return Error{posixErrorDomain, EINVAL, name + ": not a regular file"};
    if (const int number = refusal != nullptr ? refusal(file.get()) : 0) return systemError(number, name);
    const Error tooLarge{posixErrorDomain, EFBIG, name + ": larger than " + std::to_string(limit) + " bytes"};
    if (static_cast<std::uint64_t>(status.st_size) > limit) return tooLarge;
    // The size is a hint, for the file may be growing; one byte more shows the end without another round.
    std::string bytes;
    std::size_t used = 0;
    std::size_t wanted = static_cast<std::size_t>(status.st_size) + 1;
    while (true) {
        bytes.resize(wanted);
        const ssize_t count = read(file.get(), bytes.data() + used, bytes.size() - used);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return systemError(errno, name);
        if (count == 0) break;
        used += static_cast<std::size_t>(count);
        if (used > limit) return tooLarge;
        if (used == bytes.size()) wanted = std::min(2 * used, limit + 1);
    }
    bytes.resize(used);
    return std::optional(std::move(bytes));
}

bool isFileName(std::string_view name) {
    if (name.empty() || name.size() > NAME_MAX || name == "." || name == "..") return false;
    return std::ranges::none_of(name, [](unsigned char byte) { return byte < 0x20 || byte == 0x7f || byte == '/'; });
}

bool isAtOrBelow(std::string_view path, std::string_view place) {
    return path.starts_with(place) && (path.size() == place.size() || path[place.size()] == '/');
}

} // namespace platform::linux_
