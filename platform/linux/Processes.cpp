#include "platform/linux/Processes.h"

#include "platform/linux/Descriptor.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/SystemError.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <unistd.h>

namespace platform::linux_ {

Result<std::string> Processes::executablePath(std::int32_t pid, std::size_t bufferSize) {
    const std::string process = "process " + std::to_string(pid);
    if (pid <= 0) return systemError(ESRCH, process);
    char buffer[PATH_MAX];
    ssize_t size = readlink(("/proc/" + std::to_string(pid) + "/exe").c_str(), buffer, sizeof buffer);
    // Of a process that has ended, or that never had a program, the link is missing.
    if (size < 0) return systemError(errno == ENOENT ? ESRCH : errno, process);
    if (size == static_cast<ssize_t>(sizeof buffer)) return systemError(ENAMETOOLONG, process);
    std::string path(buffer, static_cast<std::size_t>(size));

    const ProgramIdentity program = ProgramIdentity::ofProcess(pid);
    if (!program.isKnown() || ProgramIdentity::ofFile(path) != program)
        return systemError(program.isKnown() ? ENOENT : ESRCH, process);
    if (path.size() >= bufferSize) return systemError(ENAMETOOLONG, process);
    return path;
}

Result<std::string> Processes::executablePath(const AuditToken& peer, std::size_t bufferSize) {
    const auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(peer.process);
    if (!process) return systemError(ESRCH, "process " + std::to_string(peer.pid));
    // Mostly the path that was read first still leads to the program.
    const std::string& known = process->executablePath();
    const bool isKnown =
        !known.empty() && known.size() < bufferSize && ProgramIdentity::ofFile(known) == process->program();
    Result<std::string> path = isKnown ? known : executablePath(process->pid(), bufferSize);
    // Asked last: what was read before it belongs to the program that connected.
    if (!process->isUnchanged()) return systemError(ESRCH, "process " + std::to_string(peer.pid));
    return path;
}

std::optional<std::string> Processes::environmentVariable(const std::string& name) {
    const char* value = std::getenv(name.c_str());
    return value ? std::optional<std::string>(value) : std::nullopt;
}

} // namespace platform::linux_
