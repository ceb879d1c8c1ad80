#pragma once

#include "platform/Transport.h"
#include "platform/linux/Descriptor.h"

#include <memory>
#include <string>
#include <sys/types.h>
#include <utility>
#include <vector>

namespace platform::linux_ {

/// Which file a process runs. Zero when it could not be read (another user's process, or one that is gone; no such
/// file).
struct ProgramIdentity {
    dev_t device = 0;
    ino_t inode = 0;

    bool isKnown() const { return inode != 0; }
    /// What `/proc/<pid>/exe` leads to now.
    static ProgramIdentity ofProcess(pid_t pid);
    static ProgramIdentity ofFile(const std::string& path);
    friend bool operator==(const ProgramIdentity&, const ProgramIdentity&) = default;
};

/// A process held by a pidfd, with the program it ran when it was looked at first. A pid that is used again never
/// passes for it, and neither does the same process after it ran another program.
class LinuxPeerProcess final : public PeerProcess {
public:
    /// Looks at `pid` now. Without `pidfd` one is opened. None when there is no such process. `groups` are the
    /// supplementary ones that it had when it connected.
    static std::shared_ptr<const LinuxPeerProcess> look(pid_t pid, Descriptor pidfd = Descriptor(),
                                                        std::vector<gid_t> groups = {});

    pid_t pid() const { return _pid; }
    /// Owned by this object; becomes readable when the process ends.
    int pidfd() const { return _pidfd.get(); }
    const ProgramIdentity& program() const { return _program; }
    const std::vector<gid_t>& groups() const { return _groups; }
    /// The path of that program as the kernel named it then. Empty when it could not be read.
    const std::string& executablePath() const { return _executablePath; }

    /// False once the process has ended, also before anyone has waited for it.
    bool isAlive() const;
    /// Alive, and still running the program it ran then. What was read about the process before this call belongs to
    /// that program.
    bool isUnchanged() const;

private:
    LinuxPeerProcess(pid_t pid, Descriptor pidfd, std::vector<gid_t> groups)
        : _pid(pid), _pidfd(std::move(pidfd)), _groups(std::move(groups)) {}

    pid_t _pid;
    Descriptor _pidfd;
    std::vector<gid_t> _groups;
    ProgramIdentity _program;
    std::string _executablePath;
};

} // namespace platform::linux_
