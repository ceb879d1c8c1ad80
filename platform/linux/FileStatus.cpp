#include "platform/linux/FileStatus.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

namespace platform::linux_ {

int readFileStatus(int directory, const char* path, FileStatus& status) {
    struct statx read{};
    const int flags = AT_NO_AUTOMOUNT | (*path == '\0' ? AT_EMPTY_PATH : 0);
    constexpr unsigned wanted = STATX_TYPE | STATX_MODE | STATX_INO | STATX_CTIME | STATX_BTIME;
    if (statx(directory, path, flags, wanted, &read) != 0) return errno;
    status.identity = {makedev(read.stx_dev_major, read.stx_dev_minor), read.stx_ino, 0, 0};
    if ((read.stx_mask & STATX_BTIME) != 0) {
        status.identity.bornSeconds = read.stx_btime.tv_sec;
        status.identity.bornNanoseconds = read.stx_btime.tv_nsec;
    }
    status.mode = read.stx_mode;
    status.changedSeconds = read.stx_ctime.tv_sec;
    status.changedNanoseconds = read.stx_ctime.tv_nsec;
    return 0;
}

} // namespace platform::linux_
