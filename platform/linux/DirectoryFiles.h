#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

/// Reading directories that strangers fill: every step starts at an open directory and follows no symbolic link, so
/// that what is read lies where it says it lies, also while somebody renames things around it.
namespace platform::linux_ {

/// Not open, with errno set, on failure; a symbolic link is a failure.
Descriptor openDirectory(int parent, const std::string& name);
/// An absolute path, none of whose components may be a symbolic link.
Descriptor openDirectory(const std::string& path);

/// What lies at `path`, as a mere reference (O_PATH): no right to the file itself is asked for, and no device acts.
/// `resolve` says which links may not be passed (the RESOLVE_ flags of openat2). Not open, with errno set, on failure.
Descriptor openReference(const std::string& path, std::uint64_t resolve);

/// True for an errno value that says more of this process or machine than of the file: another time it may work.
bool isShortage(int number);

/// The names in an open directory, sorted, those of subdirectories apart from the others. Names that begin with a dot
/// are left out. None, with errno set, when it cannot be read.
struct DirectoryListing {
    std::vector<std::string> directories;
    std::vector<std::string> others;
};
std::optional<DirectoryListing> listDirectory(int directory);

/// The bytes of a regular file; none when there is no such name. Never blocks on pipes and devices. `refusal` looks at
/// the open file before it is read: zero, or the errno value to fail with.
Result<std::optional<std::string>> readFile(int directory, const std::string& name, std::size_t limit,
                                            int (*refusal)(int descriptor) = nullptr);

/// Whether `name` can be one component of a path: no separator, not "." or "..", printable, of a bounded length.
bool isFileName(std::string_view name);

/// Whether `path` is `place` or lies below it.
bool isAtOrBelow(std::string_view path, std::string_view place);

} // namespace platform::linux_
