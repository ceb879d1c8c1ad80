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

/// A directory descriptor that leads nowhere but below the directory: a detached, read-only copy of its mount. A plain
/// one would lead a process in another mount namespace through ".." to everything; it is only good for a peer that
/// sees the tree anyway, where the daemon may not copy mounts.
int confineDirectory(int connection, Descriptor& directory) {
    Descriptor copy(open_tree(directory.get(), "", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC | AT_EMPTY_PATH));
    if (copy) {
        mount_attr attributes{};
        attributes.attr_set = MOUNT_ATTR_RDONLY | MOUNT_ATTR_NOSUID | MOUNT_ATTR_NODEV;
        if (mount_setattr(copy.get(), "", AT_EMPTY_PATH, &attributes, sizeof attributes) != 0) return errno;
        directory = std::move(copy);
        return 0;
    }
    ucred peer{};
    socklen_t size = sizeof peer;
    if (getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) return errno;
    return seesCommonFileTree(peer.pid) ? 0 : EPERM;
}

/// Opens a regular file of an open directory, for reading.
int openFileBelow(const Descriptor& directory, const std::string& path, Descriptor& opened) {
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC; // what it is shows before it is opened: opening a device may act on it
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
    Descriptor file(static_cast<int>(syscall(SYS_openat2, directory.get(), path.c_str(), &how, sizeof how)));
    if (!file) return errno;
    FileStatus status;
    if (int number = readFileStatus(file.get(), "", status)) return number;
    if (!S_ISREG(status.mode)) return S_ISDIR(status.mode) ? EISDIR : EINVAL;
    opened = Descriptor(::open(procPath(file.get()).c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    return opened ? 0 : errno;
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
    FileStatus status;
    {
        // An extension lifts confinement, never file permissions.
        const ActingAsPeer peer(rightsOfPeer(connection));
        if (!peer.isReady()) return EPERM;
        opened = openReference(grant.name, grant.canonical ? RESOLVE_NO_SYMLINKS : RESOLVE_NO_MAGICLINKS);
        if (!opened) return errno;
        if (int number = readFileStatus(opened.get(), "", status)) return number;
        if (status.identity != grant.identity) return ESTALE; // another file has taken the path since
        if (!below.empty()) {
            if (!S_ISDIR(status.mode)) return ENOTDIR;
            const Descriptor directory = std::move(opened);
            return openFileBelow(directory, below, opened);
        }
        const std::string path = procPath(opened.get());
        if (S_ISREG(status.mode)) {
            opened = Descriptor(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
            return opened ? 0 : errno;
        }
        // A descriptor for openat alone asks no permission to read the directory itself.
        if (faccessat(AT_FDCWD, path.c_str(), R_OK | X_OK, AT_EACCESS) != 0) return errno;
    }
    return S_ISDIR(status.mode) ? confineDirectory(connection, opened) : EPERM;
}

} // namespace platform::linux_
