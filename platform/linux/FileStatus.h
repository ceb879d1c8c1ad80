#pragma once

#include <cstdint>

namespace platform::linux_ {

/// One file or directory for good: an inode number that is used again comes with another time of birth.
struct FileIdentity {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    std::int64_t bornSeconds = 0; // zero on file systems that do not know it
    std::uint32_t bornNanoseconds = 0;
    friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

struct FileStatus {
    FileIdentity identity;
    std::uint32_t mode = 0;
    std::int64_t changedSeconds = 0; // the inode's own change, links to it included
    std::uint32_t changedNanoseconds = 0;
    friend bool operator==(const FileStatus&, const FileStatus&) = default;
};

/// What `path` (below the open `directory`, or AT_FDCWD) leads to; with an empty path `directory` itself. Symbolic
/// links are followed. Zero, or an errno value.
int readFileStatus(int directory, const char* path, FileStatus& status);

} // namespace platform::linux_
