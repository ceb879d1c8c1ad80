#pragma once

#include "platform/Error.h"
#include "platform/Transport.h"

#include <cstddef>
#include <string>
#include <string_view>

namespace platform {

/// Domain and codes of file errors. Other failures carry `fileReadUnknownCode` or `fileWriteUnknownCode` and the
/// system's text in the description.
inline constexpr const char* fileErrorDomain = "Files";
inline constexpr int fileReadUnknownCode = 256;
inline constexpr int fileReadNoPermissionCode = 257;
inline constexpr int fileReadNoSuchFileCode = 260;
inline constexpr int fileReadTooLargeCode = 263;
inline constexpr int fileWriteUnknownCode = 512;
inline constexpr int fileWriteNoPermissionCode = 513;
inline constexpr int fileWriteOutOfSpaceCode = 640;

class Files {
public:
    virtual ~Files() = default;

    /// Where a well-known absolute path of the platform ("/System/", "/var/db/...") lies: the path itself, or the same
    /// path below the root of a scratch platform.
    virtual std::string locate(const std::string& wellKnownPath) = 0;

    /// Bytes of a whole regular file (anything else, a device or a pipe included, is an error: nothing here blocks).
    /// A file larger than `limit` is an error.
    virtual Result<std::string> read(const std::string& path, std::size_t limit) = 0;

    /// Replaces the file as a whole: readers, and whoever looks after a crash at any moment, find the old bytes or the
    /// new ones. On failure the old file is untouched and nothing is left beside it, with one exception: when syncing
    /// the directory fails at the very end, the new file stands, but may not outlast a power failure. Keeps the mode
    /// of an existing file, else 0600; but rights of a group that cannot be kept are dropped. A symbolic link at
    /// `path` is followed. What exists and is no regular file is not replaced.
    virtual Failure writeAtomically(const std::string& path, std::string_view bytes) = 0;

    /// Adds `suffix` to the name of the file, symbolic links followed; an earlier file of that name is replaced. What
    /// is no regular file stays. Fails with `fileReadNoSuchFileCode` when there is none.
    virtual Failure setAside(const std::string& path, std::string_view suffix) = 0;

    /// The canonical path, as realpath(3) gives it; an error for what does not exist and for results of `limit` bytes
    /// or more.
    virtual Result<std::string> realPath(const std::string& path, std::size_t limit) = 0;

    /// The same for a path that `peer` named, as far as that peer may look: for a privileged process, everything else
    /// is an error too.
    virtual Result<std::string> realPath(const std::string& path, std::size_t limit, const AuditToken& peer) = 0;
};

} // namespace platform
