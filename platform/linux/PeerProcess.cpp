#include "platform/linux/PeerProcess.h"

#include <array>
#include <climits>
#include <poll.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

std::string executableLink(pid_t pid) { return "/proc/" + std::to_string(pid) + "/exe"; }

} // namespace

ProgramIdentity ProgramIdentity::ofProcess(pid_t pid) { return ofFile(executableLink(pid)); }

ProgramIdentity ProgramIdentity::ofFile(const std::string& path) {
    struct stat status{};
    if (::stat(path.c_str(), &status) != 0) return {};
    return {status.st_dev, status.st_ino};
}

std::shared_ptr<const LinuxPeerProcess> LinuxPeerProcess::look(pid_t pid, Descriptor pidfd, std::vector<gid_t> groups) {
    // Close-on-exec from birth.
    if (!pidfd) pidfd = Descriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    if (!pidfd) return nullptr;
    std::shared_ptr<LinuxPeerProcess> process(new LinuxPeerProcess(pid, std::move(pidfd), std::move(groups)));
    process->_program = ProgramIdentity::ofProcess(pid);
    std::array<char, PATH_MAX> path;
    const ssize_t length = ::readlink(executableLink(pid).c_str(), path.data(), path.size());
    // A name that fills the buffer may be cut, and a cut path would name another file.
    if (length > 0 && static_cast<std::size_t>(length) < path.size()) {
        process->_executablePath.assign(path.data(), static_cast<std::size_t>(length));
    }
    // While the pidfd's process lives, its pid is its own: what was read above was read of it.
    if (!process->isAlive()) return nullptr;
    return process;
}

bool LinuxPeerProcess::isAlive() const {
    pollfd end{_pidfd.get(), POLLIN, 0};
    return ::poll(&end, 1, 0) == 0;
}

bool LinuxPeerProcess::isUnchanged() const {
    const ProgramIdentity now = ProgramIdentity::ofProcess(_pid);
    return now == _program && isAlive();
}

} // namespace platform::linux_
