#include "platform/linux/RequestSocket.h"

#include "platform/linux/ProcPath.h"
#include "platform/linux/ServiceThread.h"
#include "platform/linux/SystemError.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <vector>

namespace platform::linux_ {

namespace {

/// The socket's address by way of its open directory, since a root may lie deeper than an address is long.
sockaddr_un addressIn(int directory, const char* name) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = procPath(directory) + "/" + name;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    return address;
}

int connectTo(int socket, int directory, const char* name) {
    const sockaddr_un address = addressIn(directory, name);
    return connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 ? 0 : errno;
}

/// Room for one descriptor that travels with a message.
struct DescriptorMessage {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    iovec part{};
    msghdr message{};

    explicit DescriptorMessage(std::int32_t& number) : part{&number, sizeof number} {
        message.msg_iov = &part;
        message.msg_iovlen = 1;
        message.msg_control = control;
        message.msg_controllen = sizeof control;
    }
};

} // namespace

Result<std::unique_ptr<RequestSocket>> RequestSocket::start(const Root& root, const RequestSocketAddress& address,
                                                            const char* threadName, Serve serve) {
    std::unique_ptr<RequestSocket> socket(new RequestSocket(address, std::move(serve)));
    if (auto error = socket->listen(root)) return *error;
    auto thread = startServiceThread(threadName, [self = socket.get()] { self->run(); });
    if (!thread) return systemError(EAGAIN, threadName);
    socket->_thread = *std::move(thread);
    return socket;
}

Failure RequestSocket::listen(const Root& root) {
    const std::string path = root.runtime() + "/" + _address.name;
    std::error_code error;
    std::filesystem::create_directories(root.runtime(), error);
    if (error) return systemError(error.value(), path);
    _directory = Descriptor(::open(root.runtime().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!_directory) return systemError(errno, path);
    _stop = Descriptor(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    _reserve = Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    _listener = Descriptor(socket(AF_UNIX, _address.type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    Descriptor probe(socket(AF_UNIX, _address.type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!_stop || !_listener || !probe) return systemError(errno, path);
    // Accepted connections have it from the listener: every request comes with its sender.
    const int isOn = 1;
    if (setsockopt(_listener.get(), SOL_SOCKET, SO_PASSCRED, &isOn, sizeof isOn) != 0) return systemError(errno, path);

    // Nobody listens at what a killed daemon left behind.
    if (connectTo(probe.get(), _directory.get(), _address.name) == ECONNREFUSED)
        unlinkat(_directory.get(), _address.name, 0);
    sockaddr_un address = addressIn(_directory.get(), _address.name);
    if (bind(_listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return systemError(errno, path);
    FileStatus status;
    // A daemon of one user has nothing for others; one for all users judges each by what they ask.
    mode_t mode = geteuid() == 0 ? 0666 : 0600;
    if (fchmodat(_directory.get(), _address.name, mode, 0) != 0 ||
        readFileStatus(_directory.get(), _address.name, status) != 0)
        return systemError(errno, path);
    _socket = status.identity;
    if (::listen(_listener.get(), SOMAXCONN) != 0) return systemError(errno, path);
    return std::nullopt;
}

RequestSocket::~RequestSocket() {
    if (_thread.joinable()) {
        eventfd_write(_stop.get(), 1);
        _thread.join();
    }
    removeName();
}

void RequestSocket::removeName() const {
    FileStatus status;
    // By now the name may be another daemon's.
    if (_socket.inode != 0 && readFileStatus(_directory.get(), _address.name, status) == 0 &&
        status.identity == _socket)
        unlinkat(_directory.get(), _address.name, 0);
}

void RequestSocket::run() {
    std::vector<pollfd> polled;
    while (true) {
        polled.assign({{_stop.get(), POLLIN, 0}, {_listener.get(), POLLIN, 0}});
        for (const auto& connection : _silent) polled.push_back({connection.get(), POLLIN, 0});
        if (poll(polled.data(), polled.size(), -1) < 0) continue; // interrupted; or out of memory, which passes
        if (polled[0].revents != 0) return;
        // Erasing from the back keeps the indices of those in front.
        for (std::size_t index = polled.size(); index-- > 2;)
            if (polled[index].revents != 0 && _serve(polled[index].fd))
                _silent.erase(_silent.begin() + static_cast<std::ptrdiff_t>(index - 2));
        if (polled[1].revents != 0) acceptWaiting();
    }
}

void RequestSocket::acceptWaiting() {
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
        if (_serve(connection.get())) continue;
        if (_silent.size() == maximumSilentConnections) _silent.pop_front();
        _silent.push_back(std::move(connection));
    }
}

std::optional<Request> receiveRequest(int connection, std::size_t limit) {
    Request request{std::string(limit + 1, '\0')};
    // The sender comes first and fills it; descriptors that a peer sends along have no room and are closed.
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))] = {};
    iovec part{request.text.data(), request.text.size()};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t size = recvmsg(connection, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (size < 0 && (errno == EAGAIN || errno == EINTR)) return std::nullopt;
    request.text.resize(size < 0 ? 0 : static_cast<std::size_t>(size));
    const cmsghdr* header = size < 0 ? nullptr : CMSG_FIRSTHDR(&message);
    if (header != nullptr && header->cmsg_level == SOL_SOCKET && header->cmsg_type == SCM_CREDENTIALS) {
        ucred sender{};
        std::memcpy(&sender, CMSG_DATA(header), sizeof sender);
        request.sender = sender.pid;
    }
    return request;
}

void sendAnswer(int connection, std::int32_t number, const Descriptor& opened) {
    DescriptorMessage answer(number);
    if (opened) {
        cmsghdr* header = CMSG_FIRSTHDR(&answer.message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(sizeof(int));
        const int descriptor = opened.get();
        std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
    } else {
        answer.message.msg_controllen = 0;
    }
    // A fresh connection has room for one answer; a peer that is gone wants none.
    (void)sendmsg(connection, &answer.message, MSG_NOSIGNAL | MSG_DONTWAIT);
}

Result<Descriptor> connectToRequestSocket(const Root& root, const RequestSocketAddress& address) {
    const std::string path = root.runtime() + "/" + address.name;
    Descriptor directory(::open(root.runtime().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!directory) return systemError(errno, path);
    Descriptor connection(socket(AF_UNIX, address.type | SOCK_CLOEXEC, 0));
    if (!connection) return systemError(errno, path);
    const timeval patience{10, 0}; // the daemon answers at once or is in trouble
    setsockopt(connection.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    setsockopt(connection.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    if (int number = connectTo(connection.get(), directory.get(), address.name)) return systemError(number, path);
    return connection;
}

int exchangeRequest(int connection, std::string_view request, Descriptor& opened) {
    // A failed send leaves its mark in what is received: nothing, or the answer that came first.
    ssize_t sent = 0;
    do sent = send(connection, request.data(), request.size(), MSG_NOSIGNAL);
    while (sent < 0 && errno == EINTR);

    std::int32_t number = 0;
    DescriptorMessage answer(number);
    ssize_t size = 0;
    do size = recvmsg(connection, &answer.message, MSG_CMSG_CLOEXEC);
    while (size < 0 && errno == EINTR);
    if (size < 0) return errno == EAGAIN ? ETIMEDOUT : errno;
    const cmsghdr* header = CMSG_FIRSTHDR(&answer.message);
    if (header != nullptr && header->cmsg_level == SOL_SOCKET && header->cmsg_type == SCM_RIGHTS) {
        int descriptor = -1;
        std::memcpy(&descriptor, CMSG_DATA(header), sizeof descriptor);
        opened = Descriptor(descriptor);
    }
    if (size != static_cast<ssize_t>(sizeof number)) return ECONNRESET;
    // An answer whose descriptor did not fit into this process any more is no success.
    return (answer.message.msg_flags & MSG_CTRUNC) != 0 ? EMFILE : number;
}

} // namespace platform::linux_
