#pragma once

#include "bench/Process.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/TransportFrame.h"

#include <ctime>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>

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

/// Appends what is there, at least one byte.
inline void receiveSome(int socket, std::string& buffer) {
    constexpr std::size_t piece = std::size_t{64} << 10U;
    const std::size_t size = buffer.size();
    buffer.resize(size + piece);
    ssize_t received = 0;
    do received = recv(socket, buffer.data() + size, piece, 0);
    while (received < 0 && errno == EINTR);
    if (received <= 0) failSystem("the server closed the connection");
    buffer.resize(size + static_cast<std::size_t>(received));
}

/// Connected and greeted. Waits for a server that is about to listen.
inline Descriptor connectTo(const std::string& path, Process& server) {
    const sockaddr_un address = addressOf(path);
    Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    while (connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        if (errno != ENOENT && errno != ECONNREFUSED) failSystem("connect to " + path);
        if (!server.isRunning()) fail("the server of " + path + " ended");
        const timespec pause{0, 1'000'000};
        nanosleep(&pause, nullptr);
    }
    std::string buffer;
    while (buffer.size() < qmx::handshakeSize) receiveSome(socket.get(), buffer);
    qmx::Handshake greeting;
    buffer.copy(greeting.data(), greeting.size());
    const qmx::Handshake answer = qmx::makeAnswer(greeting);
    sendAll(socket.get(), {answer.data(), answer.size()});
    return socket;
}

/// The next frame, taken out of `buffer` by the following call.
class FrameReader {
public:
    qmx::Frame next(int socket) {
        _buffer.erase(0, _used);
        _used = 0;
        while (true) {
            const auto scan = qmx::scanFrame(_buffer);
            if (scan.outcome == qmx::FrameScan::Outcome::malformed) fail(scan.problem);
            if (scan.outcome == qmx::FrameScan::Outcome::complete) {
                _used = scan.size;
                return scan.frame;
            }
            receiveSome(socket, _buffer);
        }
    }

    std::size_t frameSize() const { return _used; }

private:
    std::string _buffer;
    std::size_t _used = 0;
};

inline double secondsNow() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + 1e-9 * static_cast<double>(now.tv_nsec);
}

} // namespace bench
