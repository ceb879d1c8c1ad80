#include "platform/linux/TransportListener.h"

#include "platform/linux/DescriptorStore.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/TransportFrame.h"
#include "platform/linux/TransportLimits.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <sys/epoll.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <system_error>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace platform::linux_::qmx {

namespace {

/// How long a listener rests when the system has no descriptors or memory for another connection.
constexpr std::chrono::milliseconds restDelay{100};

constexpr const char* lockSuffix = ".lock";

std::string problemWith(const std::string& what) { return what + ": " + std::generic_category().message(errno); }

/// The kernel's statement of who sent the message; 0 when it made none.
pid_t senderOf(msghdr& message) {
    for (cmsghdr* part = CMSG_FIRSTHDR(&message); part != nullptr; part = CMSG_NXTHDR(&message, part)) {
        if (part->cmsg_level != SOL_SOCKET || part->cmsg_type != SCM_CREDENTIALS) continue;
        ucred credentials{};
        std::memcpy(&credentials, CMSG_DATA(part), sizeof credentials);
        return credentials.pid;
    }
    return 0;
}

/// An accepted peer that has not answered the greeting yet.
///
/// The kernel names the process that connected, but that process may be another program by now: connect, hand the
/// socket to a child, become a trusted program, and let the child ask in its name. So the program is looked at first,
/// the greeting sent then, and the answer must come from the very process that connected, while it still runs that
/// program: the program that rights are given to is one that had the socket in its hands.
class HandshakingPeer final : public Pollable {
public:
    HandshakingPeer(std::shared_ptr<Loop> loop, std::weak_ptr<StreamListener> listener, Descriptor socket,
                    AuditToken peer, Budget::Share place)
        : _loop(std::move(loop)),
          _listener(std::move(listener)),
          _socket(std::move(socket)),
          _peer(std::move(peer)),
          _place(std::move(place)) {}

    static void begin(std::shared_ptr<HandshakingPeer> peer, std::chrono::milliseconds deadline) {
        // Before the greeting, so that the answer to it never comes without its sender. Not once for the listening
        // socket: connections made to a socket that was passed in are older than that would be.
        const int on = 1;
        if (::setsockopt(peer->_socket.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0) return;
        Nonce nonce;
        if (::getrandom(nonce.data(), nonce.size(), 0) != static_cast<ssize_t>(nonce.size())) return;
        const Handshake greeting = makeGreeting(nonce);
        peer->_expected = makeAnswer(greeting);
        // A fresh socket has room for it; one that has not is closed.
        if (::send(peer->_socket.get(), greeting.data(), greeting.size(), MSG_NOSIGNAL | MSG_DONTWAIT) !=
            static_cast<ssize_t>(greeting.size())) {
            return;
        }
        Loop& loop = *peer->_loop;
        if (!loop.watch(peer->_socket.get(), EPOLLIN, peer.get())) return;
        HandshakingPeer* const kept = peer.get();
        loop.keep(std::move(peer));
        loop.expire(kept, deadline);
    }

    void onEvents(std::uint32_t) override {
        if (!readAnswer()) return giveUp();
        if (_received < handshakeSize) return;
        const auto process = std::static_pointer_cast<const LinuxPeerProcess>(_peer.process);
        if (_answer != _expected || !process->isUnchanged()) return giveUp();
        const int off = 0; // from here on the sender of single frames is nobody's business
        ::setsockopt(_socket.get(), SOL_SOCKET, SO_PASSCRED, &off, sizeof off);
        _loop->unwatch(_socket.get());
        if (const auto listener = _listener.lock()) {
            listener->accepted(std::move(_socket), std::move(_peer), std::move(_place));
        }
        giveUp();
    }

    void onDeadline() override { giveUp(); }
    void shutDown() override { _socket.reset(); }

private:
    bool readAnswer() {
        iovec part{_answer.data() + _received, handshakeSize - _received};
        // Room for the credentials alone: descriptors that a peer sends along are not taken.
        alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(ucred))> control;
        msghdr message{};
        message.msg_iov = &part;
        message.msg_iovlen = 1;
        message.msg_control = control.data();
        message.msg_controllen = control.size();
        const ssize_t count = ::recvmsg(_socket.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
        if (count < 0) return errno == EAGAIN || errno == EINTR;
        if (count == 0 || senderOf(message) != _peer.pid) return false;
        _received += static_cast<std::size_t>(count);
        return true;
    }

    void giveUp() {
        _socket.reset();
        _place = {};
        _loop->drop(this);
    }

    const std::shared_ptr<Loop> _loop;
    const std::weak_ptr<StreamListener> _listener;
    Descriptor _socket;
    AuditToken _peer;
    Budget::Share _place; // among its user's connections
    Handshake _expected{};
    Handshake _answer{};
    std::size_t _received = 0;
};

} // namespace

bool isServiceName(const std::string& name) {
    return !name.empty() && name.size() <= maximumServiceNameLength && name.front() != '.' &&
           name.find('/') == std::string::npos && name.find('\0') == std::string::npos && !name.ends_with(lockSuffix);
}

StreamListener::StreamListener(std::shared_ptr<Loop> loop, std::shared_ptr<const Budgets> budgets,
                               std::chrono::milliseconds handshake, std::shared_ptr<WorkQueue> queue)
    : _loop(std::move(loop)), _budgets(std::move(budgets)), _handshake(handshake), _queue(std::move(queue)) {}

StreamListener::~StreamListener() { close(); }

void StreamListener::open(const std::string& directory, const std::string& serviceName) {
    if (!isServiceName(serviceName)) {
        _problem = "not a service name: " + serviceName;
        return;
    }
    if (!adopt(directory + "/" + serviceName, serviceName)) _problem = bind(directory, serviceName);
    if (!_socket) return;
    _spare = Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
}

/// The socket that the service manager listens on for this service, by its name or its path.
bool StreamListener::adopt(const std::string& path, const std::string& serviceName) {
    int found = -1;
    for (const auto& [name, number] : passedDescriptors()) {
        const char* const expected = serviceName == name ? nullptr : path.c_str();
        if (found < 0 && ::sd_is_socket_unix(number, SOCK_STREAM, 1, expected, 0) > 0) found = number;
    }
    if (found < 0) return false;
    _socket = Descriptor(::fcntl(found, F_DUPFD_CLOEXEC, 0));
    if (!_socket) return false;
    const int flags = ::fcntl(_socket.get(), F_GETFL);
    return ::fcntl(_socket.get(), F_SETFL, flags | O_NONBLOCK) == 0;
}

/// What went wrong; empty when the name is ours.
std::string StreamListener::bind(const std::string& directory, const std::string& serviceName) {
    std::error_code failed;
    const auto before = std::filesystem::status(directory, failed);
    if (!std::filesystem::exists(before)) {
        std::filesystem::create_directories(directory, failed);
        // Whatever the umask is: everyone may connect to the sockets inside.
        ::chmod(directory.c_str(), 0755);
    }
    _directory = Descriptor(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!_directory) return problemWith(directory);

    // The lock ends with its process, however that ends; a socket without a locked lock is a dead one's.
    const std::string lockName = serviceName + lockSuffix;
    Descriptor lock(::openat(_directory.get(), lockName.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
    if (!lock) return problemWith(lockName);
    if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
        return errno == EWOULDBLOCK ? "service name taken: " + serviceName : problemWith(lockName);
    }

    Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!socket) return problemWith("socket");
    if (::unlinkat(_directory.get(), serviceName.c_str(), 0) != 0 && errno != ENOENT) return problemWith(serviceName);
    const int bound = withSocketAddress(directory, serviceName, [&](const sockaddr* address, socklen_t size) {
        return ::bind(socket.get(), address, size);
    });
    if (bound != 0) return problemWith("bind " + serviceName);
    struct stat status{};
    if (::fstatat(_directory.get(), serviceName.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
        return problemWith(serviceName);
    }
    // Anyone may connect: rights come from entitlements. Nobody does before it listens.
    if (::fchmodat(_directory.get(), serviceName.c_str(), 0666, 0) != 0) return problemWith("chmod " + serviceName);
    if (::listen(socket.get(), SOMAXCONN) != 0) return problemWith("listen " + serviceName);
    _socket = std::move(socket);
    _lock = std::move(lock);
    _fileName = serviceName;
    _device = status.st_dev;
    _inode = status.st_ino;
    return {};
}

/// While the lock is held nobody else can have made a file of this name; what somebody put there by hand stays.
void StreamListener::removeName() const {
    if (_fileName.empty()) return;
    struct stat status{};
    if (::fstatat(_directory.get(), _fileName.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && status.st_dev == _device &&
        status.st_ino == _inode) {
        ::unlinkat(_directory.get(), _fileName.c_str(), 0);
    }
}

void StreamListener::close() {
    if (_socket) removeName();
    _socket.reset();
    _spare.reset();
    // Last, so that whoever takes the name next finds the old socket gone. The lock's file stays: removing it could
    // leave two owners of two files of one name.
    _lock.reset();
}

std::optional<std::string> StreamListener::refusal() const { return _socket ? std::nullopt : std::optional(_problem); }

void StreamListener::setEventHandler(EventHandler handler) {
    auto shared = handler ? std::make_shared<EventHandler>(std::move(handler)) : nullptr;
    const std::lock_guard lock(_mutex);
    if (!_cancelled) _handler.swap(shared);
}

void StreamListener::resume() {
    {
        const std::lock_guard lock(_mutex);
        if (_resumed || _cancelled) return;
        _resumed = true;
    }
    _loop->post([listener = shared_from_this()] {
        {
            const std::lock_guard lock(listener->_mutex);
            if (listener->_cancelled) return;
        }
        listener->_loop->keep(listener);
        if (listener->_socket) {
            if (listener->_loop->watch(listener->_socket.get(), EPOLLIN, listener.get())) return;
            listener->_problem = "no room to wait for the service's socket";
        }
        listener->deliver(TransportError{TransportErrorKind::other, listener->_problem});
    });
}

void StreamListener::cancel() {
    std::shared_ptr<EventHandler> handler; // destroyed without the lock
    {
        const std::lock_guard lock(_mutex);
        if (_cancelled) return;
        _cancelled = true;
        handler.swap(_handler);
        if (!_resumed) return close();
    }
    removeName(); // at once: the process may end before the loop gets to it
    _loop->post([listener = shared_from_this()] {
        if (listener->_socket) listener->_loop->unwatch(listener->_socket.get());
        listener->close();
        listener->_loop->drop(listener.get());
    });
}

void StreamListener::shutDown() {
    std::shared_ptr<EventHandler> handler;
    {
        const std::lock_guard lock(_mutex);
        _cancelled = true;
        handler.swap(_handler);
    }
    close();
}

void StreamListener::onEvents(std::uint32_t) {
    {
        const std::lock_guard lock(_mutex);
        if (_cancelled) return;
    }
    acceptOne();
}

/// One at a time: more give another event, and one call in vain per connection is saved.
void StreamListener::acceptOne() {
    Descriptor socket(::accept4(_socket.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!socket) {
        if (errno == EMFILE || errno == ENFILE) return shed();
        if (errno == ENOBUFS || errno == ENOMEM) return rest();
        return; // the peer is gone already, or nothing that another try would not meet
    }
    const auto user = peerUser(socket.get());
    if (!user) return;
    auto place = _budgets->connections->shareOf(*user);
    if (!place.resize(1)) return;
    auto peer = identifyPeer(socket.get());
    if (!peer) return;
    HandshakingPeer::begin(std::make_shared<HandshakingPeer>(_loop, weak_from_this(), std::move(socket),
                                                             *std::move(peer), std::move(place)),
                           _handshake);
}

/// Out of descriptors: the first in line is turned away with the spare one, or it would stay in line and wake the
/// thread for ever.
void StreamListener::shed() {
    _spare.reset();
    const bool turnedAway =
        static_cast<bool>(Descriptor(::accept4(_socket.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC)));
    _spare = Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    if (!turnedAway) rest();
}

void StreamListener::rest() {
    _loop->rewatch(_socket.get(), 0, this);
    _loop->after(restDelay, [listener = shared_from_this()] {
        if (listener->_socket) listener->_loop->rewatch(listener->_socket.get(), EPOLLIN, listener.get());
    });
}

void StreamListener::accepted(Descriptor socket, AuditToken peer, Budget::Share place) {
    deliver(std::make_shared<StreamConnection>(_loop, std::move(socket), std::move(peer), std::move(place), *_budgets));
}

void StreamListener::deliver(Event event) {
    const auto tell = [listener = shared_from_this(), event = std::move(event)] {
        std::shared_ptr<EventHandler> handler;
        {
            const std::lock_guard lock(listener->_mutex);
            handler = listener->_handler;
        }
        if (handler && !listener->_loop->isStopped()) (*handler)(event);
    };
    _queue->asyncOnCaller(tell, [] { return true; });
}

} // namespace platform::linux_::qmx
