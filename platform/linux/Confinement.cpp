#include "platform/linux/Confinement.h"

#include "platform/linux/PeerProcess.h"

#include <fstream>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

/// What the link `name` of the process leads to; unknown when it cannot be read.
ProgramIdentity linkOf(pid_t pid, const char* name) {
    struct stat status{};
    if (stat(("/proc/" + std::to_string(pid) + "/" + name).c_str(), &status) != 0) return {};
    return {status.st_dev, status.st_ino};
}

/// A service manager commonly starts daemons in a mount namespace of their own; ordinary processes are then in that
/// of the machine's first process, and nonetheless free.
bool sharesLink(pid_t pid, const char* name) {
    ProgramIdentity link = linkOf(pid, name);
    return link.isKnown() && (link == linkOf(getpid(), name) || link == linkOf(1, name));
}

bool hasSeccompFilter(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line))
        if (line.starts_with("Seccomp:")) return line != "Seccomp:\t0";
    return true;
}

} // namespace

bool seesCommonFileTree(pid_t pid) { return sharesLink(pid, "ns/mnt") && sharesLink(pid, "root"); }

bool isConfined(pid_t pid) {
    return pid <= 0 || !sharesLink(pid, "ns/user") || !seesCommonFileTree(pid) || hasSeccompFilter(pid);
}

} // namespace platform::linux_
