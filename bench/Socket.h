#pragma once

#include "bench/Process.h"
#include "bench/Timing.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/TransportFrame.h"

#include <algorithm>
#include <string>
#include <string_view>
#include <sys/socket.h>
#include <sys/un.h>
#include <utility>
#include <vector>

/// The daemon's protocol over a bare socket, as a client that does nothing else would speak it.
namespace bench {

using platform::linux_::Descriptor;
namespace qmx = platform::linux_::qmx;

inline sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) fail("path too long for a socket: " + path);
    path.copy(address.sun_path, path.size());
    return address;
}

inline void sendAll(int socket, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t sent = send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL);
        if (sent < 0 && errno == EINTR) continue;
        if (sent <= 0) failSystem("send");
        bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
}

/// Bytes that arrive, in one buffer that is never cleared: to clear it again and again would cost as much as to
/// receive.
class Inbox {
public:
    std::string_view bytes() const { return {_buffer.data() + _begin, _end - _begin}; }
    void take(std::size_t count) { _begin += count; }

    /// Adds what is there, at least one byte.
    void receive(int socket) {
        if (_begin == _end) _begin = _end = 0;
        if (_buffer.size() - _end < piece) {
            std::copy(_buffer.begin() + offset(_begin), _buffer.begin() + offset(_end), _buffer.begin());
            _end -= std::exchange(_begin, 0);
            if (_buffer.size() - _end < piece) _buffer.resize(2 * _buffer.size() + piece);
        }
        ssize_t received = 0;
        do received = recv(socket, _buffer.data() + _end, _buffer.size() - _end, 0);
        while (received < 0 && errno == EINTR);
        if (received < 0) failSystem("recv");
        if (received == 0) fail("the server closed the connection");
        _end += static_cast<std::size_t>(received);
    }

private:
    static constexpr std::size_t piece = std::size_t{64} << 10U;
    static std::ptrdiff_t offset(std::size_t position) { return static_cast<std::ptrdiff_t>(position); }

    std::vector<char> _buffer;
    std::size_t _begin = 0;
    std::size_t _end = 0;
};

/// Connected and greeted. Waits for a server that is about to listen.
inline Descriptor connectTo(const std::string& path, Process& server) {
    const sockaddr_un address = addressOf(path);
    Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    while (connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        if (errno != ENOENT && errno != ECONNREFUSED) failSystem("connect to " + path);
        if (!server.isRunning()) fail("the server of " + path + " ended");
        const timespec pause{0, 100'000};
        nanosleep(&pause, nullptr);
    }
    Inbox inbox;
    while (inbox.bytes().size() < qmx::handshakeSize) inbox.receive(socket.get());
    qmx::Handshake greeting;
    inbox.bytes().copy(greeting.data(), greeting.size());
    const qmx::Handshake answer = qmx::makeAnswer(greeting);
    sendAll(socket.get(), {answer.data(), answer.size()});
    return socket;
}

/// Takes one frame after another; each is good until the next.
class FrameReader {
public:
    qmx::Frame next(int socket) {
        _inbox.take(std::exchange(_size, 0));
        while (true) {
            const auto scan = qmx::scanFrame(_inbox.bytes());
            if (scan.outcome == qmx::FrameScan::Outcome::malformed) fail(scan.problem);
            if (scan.outcome == qmx::FrameScan::Outcome::complete) {
                _size = scan.size;
                return scan.frame;
            }
            _inbox.receive(socket);
        }
    }

    std::size_t frameSize() const { return _size; }

private:
    Inbox _inbox;
    std::size_t _size = 0;
};

} // namespace bench
