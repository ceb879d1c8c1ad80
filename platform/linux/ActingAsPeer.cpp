#include "platform/linux/ActingAsPeer.h"

#include "platform/linux/PeerProcess.h"

#include <cerrno>
#include <sys/fsuid.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

std::optional<PeerRights> rightsOfPeer(int connection) {
    ucred peer{};
    socklen_t size = sizeof peer;
    if (getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) return std::nullopt;
    PeerRights rights{peer.uid, peer.gid, std::vector<gid_t>(32)}; // most users are in fewer
    std::vector<gid_t>& groups = rights.groups;
    size = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    int result = getsockopt(connection, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &size);
    groups.resize(size / sizeof(gid_t)); // the size is also what it should have been
    if (result != 0 && errno == ERANGE)
        result = getsockopt(connection, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &size);
    if (result != 0) return std::nullopt;
    return rights;
}

std::optional<PeerRights> rightsOfPeer(const AuditToken& peer) {
    const auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(peer.process);
    if (!process) return std::nullopt;
    return PeerRights{peer.uid, peer.gid, process->groups()};
}

ActingAsPeer::ActingAsPeer(const std::optional<PeerRights>& peer) {
    if (!peer) return;
    if (peer->user == geteuid()) {
        _ready = true;
        return;
    }
    if (geteuid() != 0 || !readOwnGroups()) return;
    _acting = true;
    // The system call itself: the library's function would change every thread.
    if (syscall(SYS_setgroups, peer->groups.size(), peer->groups.data()) != 0) return;
    setfsgid(peer->group);
    setfsuid(peer->user);
    constexpr auto query = static_cast<uid_t>(-1); // invalid, so that the call only answers
    _ready = static_cast<uid_t>(setfsuid(query)) == peer->user && static_cast<gid_t>(setfsgid(query)) == peer->group;
}

ActingAsPeer::~ActingAsPeer() {
    if (!_acting) return;
    setfsuid(geteuid());
    setfsgid(getegid());
    syscall(SYS_setgroups, _ownGroups.size(), _ownGroups.data());
}

bool ActingAsPeer::readOwnGroups() {
    const int count = getgroups(0, nullptr);
    if (count < 0) return false;
    _ownGroups.resize(static_cast<std::size_t>(count));
    return getgroups(count, _ownGroups.data()) == count;
}

} // namespace platform::linux_
