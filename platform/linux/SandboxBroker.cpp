#include "platform/linux/SandboxBroker.h"

#include "platform/linux/Confinement.h"
#include "platform/linux/ProcPath.h"
#include "platform/linux/ServiceThread.h"

#include "platform/linux/SystemError.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <linux/openat2.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/fsuid.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/un.h>
#include <vector>

namespace platform::linux_ {

namespace {

constexpr const char* socketName = "com.nordane.sandbox";

/// The socket's address by way of its open directory, since a root may lie deeper than an address is long.
sockaddr_un addressIn(int directory) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = procPath(directory) + "/" + socketName;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    return address;
}

int connectTo(int socket, int directory) {
    sockaddr_un address = addressIn(directory);
    return connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 ? 0 : errno;
}

/// Lets this thread alone act on files as the peer: an extension lifts confinement, never file permissions, and
/// root's own would reach everything.
class ActingAsPeer {
public:
    explicit ActingAsPeer(int connection) {
        ucred peer{};
        socklen_t size = sizeof peer;
        if (getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) return;
        if (peer.uid == geteuid()) {
            _ready = true;
            return;
        }
        std::vector<gid_t> groups;
        if (geteuid() != 0 || !readPeerGroups(connection, groups) || !readOwnGroups()) return;
        _acting = true;
        // The system call itself: the library's function would change every thread.
        if (syscall(SYS_setgroups, groups.size(), groups.data()) != 0) return;
        setfsgid(peer.gid);
        setfsuid(peer.uid);
        constexpr auto query = static_cast<uid_t>(-1); // invalid, so that the call only answers
        _ready = static_cast<uid_t>(setfsuid(query)) == peer.uid && static_cast<gid_t>(setfsgid(query)) == peer.gid;
    }

    ~ActingAsPeer() {
        if (!_acting) return;
        setfsuid(geteuid());
        setfsgid(getegid());
        syscall(SYS_setgroups, _ownGroups.size(), _ownGroups.data());
    }
    ActingAsPeer(const ActingAsPeer&) = delete;
    ActingAsPeer& operator=(const ActingAsPeer&) = delete;

    bool isReady() const { return _ready; }

private:
    static bool readPeerGroups(int connection, std::vector<gid_t>& groups) {
        groups.resize(32); // most users are in fewer
        auto size = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
        int result = getsockopt(connection, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &size);
        groups.resize(size / sizeof(gid_t)); // the size is also what it should have been
        if (result != 0 && errno == ERANGE)
            result = getsockopt(connection, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &size);
        return result == 0;
    }

    bool readOwnGroups() {
        int count = getgroups(0, nullptr);
        if (count < 0) return false;
        _ownGroups.resize(static_cast<std::size_t>(count));
        return getgroups(count, _ownGroups.data()) == count;
    }

    std::vector<gid_t> _ownGroups;
    bool _acting = false;
    bool _ready = false;
};

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

void sendReply(int connection, std::int32_t number, const Descriptor& opened) {
    iovec part{&number, sizeof number};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    if (opened) {
        message.msg_control = control;
        message.msg_controllen = sizeof control;
        cmsghdr* header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(sizeof(int));
        int descriptor = opened.get();
        std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
    }
    // A fresh connection has room for one packet; a peer that is gone wants none.
    (void)sendmsg(connection, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
}

} // namespace

Result<std::unique_ptr<SandboxBroker>> SandboxBroker::start(const Root& root, TokenSigner& signer) {
    std::unique_ptr<SandboxBroker> broker(new SandboxBroker(signer));
    if (auto error = broker->listen(root)) return *error;
    auto thread = startServiceThread("sandbox-broker", [self = broker.get()] { self->run(); });
    if (!thread) return systemError(EAGAIN, "sandbox broker");
    broker->_thread = *std::move(thread);
    return broker;
}

Failure SandboxBroker::listen(const Root& root) {
    const std::string path = root.runtime() + "/" + socketName;
    std::error_code error;
    std::filesystem::create_directories(root.runtime(), error);
    if (error) return systemError(error.value(), path);
    _directory = Descriptor(::open(root.runtime().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!_directory) return systemError(errno, path);
    _stop = Descriptor(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    _reserve = Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    _listener = Descriptor(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    Descriptor probe(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!_stop || !_listener || !probe) return systemError(errno, path);

    // Nobody listens at what a killed daemon left behind.
    if (connectTo(probe.get(), _directory.get()) == ECONNREFUSED) unlinkat(_directory.get(), socketName, 0);
    sockaddr_un address = addressIn(_directory.get());
    if (bind(_listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return systemError(errno, path);
    FileStatus status;
    // A daemon of one user has nothing for others; one for all users judges each by the token.
    mode_t mode = geteuid() == 0 ? 0666 : 0600;
    if (fchmodat(_directory.get(), socketName, mode, 0) != 0 ||
        readFileStatus(_directory.get(), socketName, status) != 0)
        return systemError(errno, path);
    _socket = status.identity;
    if (::listen(_listener.get(), SOMAXCONN) != 0) return systemError(errno, path);
    return std::nullopt;
}

SandboxBroker::~SandboxBroker() {
    if (_thread.joinable()) {
        eventfd_write(_stop.get(), 1);
        _thread.join();
    }
    FileStatus status;
    // By now the name may be another daemon's.
    if (_socket.inode != 0 && readFileStatus(_directory.get(), socketName, status) == 0 && status.identity == _socket)
        unlinkat(_directory.get(), socketName, 0);
}

Result<Descriptor> SandboxBroker::connect(const Root& root) {
    const std::string path = root.runtime() + "/" + socketName;
    Descriptor directory(::open(root.runtime().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!directory) return systemError(errno, path);
    Descriptor connection(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    if (!connection) return systemError(errno, path);
    const timeval patience{10, 0}; // the broker answers at once or is in trouble
    setsockopt(connection.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    setsockopt(connection.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    if (int number = connectTo(connection.get(), directory.get())) return systemError(number, path);
    return connection;
}

void SandboxBroker::run() {
    std::vector<pollfd> polled;
    while (true) {
        polled.assign({{_stop.get(), POLLIN, 0}, {_listener.get(), POLLIN, 0}});
        for (const auto& connection : _silent) polled.push_back({connection.get(), POLLIN, 0});
        if (poll(polled.data(), polled.size(), -1) < 0) continue; // interrupted; or out of memory, which passes
        if (polled[0].revents != 0) return;
        // Erasing from the back keeps the indices of those in front.
        for (std::size_t index = polled.size(); index-- > 2;)
            if (polled[index].revents != 0 && serve(polled[index].fd))
                _silent.erase(_silent.begin() + static_cast<std::ptrdiff_t>(index - 2));
        if (polled[1].revents != 0) acceptWaiting();
    }
}

void SandboxBroker::acceptWaiting() {
    // As many as may be silent, then a look at the stop event and at the others.
    for (std::size_t count = 0; count < maximumSilentConnections; ++count) {
        Descriptor connection(accept4(_listener.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
        if (!connection && (errno == EMFILE || errno == ENFILE)) {
            // Left waiting, the connection would wake this thread again and again.
            _reserve = Descriptor();
            Descriptor refused(accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
            refused = Descriptor();
            _reserve = Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
            return;
        }
        if (!connection) return;
        if (serve(connection.get())) continue;
        if (_silent.size() == maximumSilentConnections) _silent.pop_front();
        _silent.push_back(std::move(connection));
    }
}

bool SandboxBroker::serve(int connection) {
    std::string token(maximumTokenSize, '\0');
    // With MSG_TRUNC the packet's real size comes back, however much of it fits.
    ssize_t size = recv(connection, token.data(), token.size(), MSG_DONTWAIT | MSG_TRUNC);
    if (size < 0) return errno != EAGAIN && errno != EINTR;
    Descriptor opened;
    if (size == 0) return true; // hung up
    if (static_cast<std::size_t>(size) > maximumTokenSize) {
        sendReply(connection, EINVAL, opened);
        return true;
    }
    auto grant = _signer.verify(std::string_view(token).substr(0, static_cast<std::size_t>(size)));
    int number = EPERM;
    if (grant) number = grant->kind == SandboxGrant::Kind::file ? open(*grant, connection, opened) : 0;
    if (number != 0) opened = Descriptor();
    sendReply(connection, number, opened);
    return true;
}

int SandboxBroker::open(const SandboxGrant& grant, int connection, Descriptor& opened) const {
    FileStatus status;
    {
        ActingAsPeer peer(connection);
        if (!peer.isReady()) return EPERM;
        open_how how{};
        how.flags = O_PATH | O_CLOEXEC;
        how.resolve = grant.canonical ? RESOLVE_NO_SYMLINKS : RESOLVE_NO_MAGICLINKS;
        opened = Descriptor(static_cast<int>(syscall(SYS_openat2, AT_FDCWD, grant.name.c_str(), &how, sizeof how)));
        if (!opened) return errno;
        if (int number = readFileStatus(opened.get(), "", status)) return number;
        if (status.identity != grant.identity) return ESTALE; // another file has taken the path since
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
