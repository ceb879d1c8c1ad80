#include "platform/linux/SandboxBroker.h"

#include "platform/linux/ActingAsPeer.h"
#include "platform/linux/Confinement.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/ProcPath.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

/// Of packets, so that services confined to such sockets reach it (see SystemCallFilter.cpp).
constexpr RequestSocketAddress address{"com.nordane.sandbox", SOCK_SEQPACKET};

/// A token, NUL, and the longest path.
constexpr std::size_t maximumRequestSize = maximumTokenSize + 1 + PATH_MAX;

/// What the descriptor names, in a detached, read-only copy of its mount. A plain descriptor of a directory would lead
/// a process in another mount namespace through ".." to everything, and one of a file can be opened once more to write.
/// Not open where the daemon may not copy mounts.
Descriptor readOnlyCopy(const Descriptor& reference) {
    Descriptor copy(open_tree(reference.get(), "", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC | AT_EMPTY_PATH));
    mount_attr attributes{};
    attributes.attr_set = MOUNT_ATTR_RDONLY | MOUNT_ATTR_NOSUID | MOUNT_ATTR_NODEV;
    if (copy && mount_setattr(copy.get(), "", AT_EMPTY_PATH, &attributes, sizeof attributes) != 0) copy.reset();
    return copy;
}

/// For a peer that sees the tree of files anyway, a plain descriptor gives nothing more.
bool seesCommonFileTreeAt(int connection) {
    ucred peer{};
    socklen_t size = sizeof peer;
    return getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0 && seesCommonFileTree(peer.pid);
}

/// Refers to what the grant is for, or to a regular file below. With the rights of the calling thread.
int locate(const SandboxGrant& grant, const std::string& below, Descriptor& located, FileStatus& status) {
    located = openReference(grant.name, grant.canonical ? RESOLVE_NO_SYMLINKS : RESOLVE_NO_MAGICLINKS);
    if (!located) return errno;
    if (int number = readFileStatus(located.get(), "", status)) return number;
    if (status.identity != grant.identity) return ESTALE; // another file has taken the path since
    if (below.empty()) return S_ISREG(status.mode) || S_ISDIR(status.mode) ? 0 : EPERM;
    if (!S_ISDIR(status.mode)) return ENOTDIR;
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC; // what it is shows before it is opened: opening a device may act on it
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
    located = Descriptor(static_cast<int>(syscall(SYS_openat2, located.get(), below.c_str(), &how, sizeof how)));
    if (!located) return errno;
    if (int number = readFileStatus(located.get(), "", status)) return number;
    if (!S_ISREG(status.mode)) return S_ISDIR(status.mode) ? EISDIR : EINVAL;
    return 0;
}

/// Whether the user could write to the file, or let themselves. With the rights of the calling thread, the user's.
bool mayWrite(uid_t user, const Descriptor& file) {
    struct stat status{};
    return fstat(file.get(), &status) != 0 || status.st_uid == user ||
           faccessat(AT_FDCWD, procPath(file.get()).c_str(), W_OK, AT_EACCESS) == 0;
}

} // namespace

Result<std::unique_ptr<SandboxBroker>> SandboxBroker::start(const Root& root, TokenSigner& signer) {
    std::unique_ptr<SandboxBroker> broker(new SandboxBroker(signer));
    auto socket = RequestSocket::start(root, address, "sandbox-broker",
                                       [self = broker.get()](int connection) { return self->serve(connection); });
    if (!socket) return socket.error();
    broker->_socket = *std::move(socket);
    return broker;
}

Result<Descriptor> SandboxBroker::connect(const Root& root) { return connectToRequestSocket(root, address); }

bool SandboxBroker::serve(int connection) {
    const auto request = receiveRequest(connection, maximumRequestSize);
    if (!request) return false;
    const std::string& text = request->text;
    if (text.empty()) return true; // hung up
    const std::size_t end = std::min(text.find('\0'), text.size());
    const auto token = std::string_view(text).substr(0, end);
    const std::string below = text.substr(std::min(end + 1, text.size()));
    Descriptor opened;
    int number = EPERM;
    if (token.size() > maximumTokenSize || below.size() >= PATH_MAX || below.find('\0') != std::string::npos) {
        number = EINVAL;
    } else if (const auto grant = _signer.verify(token)) {
        number = grant->kind == SandboxGrant::Kind::file ? open(*grant, below, connection, opened) : 0;
    }
    if (number != 0) opened = Descriptor();
    sendAnswer(connection, number, opened);
    return true;
}

int SandboxBroker::open(const SandboxGrant& grant, const std::string& below, int connection, Descriptor& opened) {
    // An extension lifts confinement, never file permissions.
    const auto rights = rightsOfPeer(connection);
    Descriptor located;
    FileStatus status;
    bool isWritable = false;
    {
        const ActingAsPeer peer(rights);
        if (!peer.isReady()) return EPERM;
        if (int number = locate(grant, below, located, status)) return number;
        // A descriptor for openat alone asks no permission to read the directory itself.
        if (S_ISDIR(status.mode) && faccessat(AT_FDCWD, procPath(located.get()).c_str(), R_OK | X_OK, AT_EACCESS) != 0)
            return errno;
        isWritable = S_ISREG(status.mode) && mayWrite(rights->user, located);
    }
    // With the daemon's own rights, which copying takes.
    if (auto copy = readOnlyCopy(located)) {
        located = std::move(copy);
    } else if ((S_ISDIR(status.mode) || isWritable) && !seesCommonFileTreeAt(connection)) {
        return EPERM;
    }
    if (S_ISDIR(status.mode)) {
        opened = std::move(located);
        return 0;
    }
    const ActingAsPeer peer(rights);
    if (!peer.isReady()) return EPERM;
    opened = Descriptor(::open(procPath(located.get()).c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    return opened ? 0 : errno;
}

} // namespace platform::linux_
