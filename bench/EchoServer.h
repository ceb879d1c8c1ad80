#pragma once

#include "bench/Load.h"
#include "bench/Socket.h"

#include <condition_variable>
#include <map>
#include <mutex>
#include <sys/epoll.h>
#include <thread>
#include <vector>

/// The reference: what a server costs that does nothing. One thread waits for all sockets and hands each frame to a
/// second one, which answers with as many bytes as the daemon would, out of one prepared buffer.
namespace bench {

class EchoServer {
public:
    EchoServer(const std::string& path, std::size_t replySize) : _reply(replySize, 'x') {
        if (replySize < qmx::frameHeaderSize) fail("a reply is at least a header");
        const auto length = static_cast<std::uint32_t>(replySize - qmx::frameLengthSize);
        std::memcpy(_reply.data(), &length, sizeof length);
        std::memset(_reply.data() + sizeof length, 0, qmx::frameHeaderSize - sizeof length);
        _reply[sizeof length] = static_cast<char>(qmx::FrameType::reply);

        const sockaddr_un address = addressOf(path);
        if (bind(_listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) failSystem(path);
        if (listen(_listener.get(), SOMAXCONN) != 0) failSystem("listen");
        watch(_listener.get());
    }

    [[noreturn]] void run() {
        std::thread answerer([this] { answer(); });
        std::array<epoll_event, 64> events{};
        while (true) {
            const int count = epoll_wait(_epoll.get(), events.data(), static_cast<int>(events.size()), -1);
            for (int i = 0; i < count; ++i) {
                const int socket = events[static_cast<std::size_t>(i)].data.fd;
                if (socket == _listener.get())
                    accept();
                else
                    read(socket);
            }
        }
    }

private:
    struct Peer {
        std::string buffer;
        bool isGreeted = false;
    };
    struct Request {
        int socket;
        std::uint64_t id;
    };

    void watch(int socket) {
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.fd = socket;
        if (epoll_ctl(_epoll.get(), EPOLL_CTL_ADD, socket, &event) != 0) failSystem("epoll_ctl");
    }

    void accept() {
        const int socket = accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (socket < 0) return;
        const qmx::Handshake greeting = qmx::makeGreeting({});
        sendAll(socket, {greeting.data(), greeting.size()});
        _peers[socket] = {};
        watch(socket);
    }

    void read(int socket) {
        Peer& peer = _peers[socket];
        const std::size_t size = peer.buffer.size();
        constexpr std::size_t piece = std::size_t{64} << 10U;
        peer.buffer.resize(size + piece);
        const ssize_t received = recv(socket, peer.buffer.data() + size, piece, 0);
        if (received <= 0) {
            // Answers that are still under way to a closed socket could meet the number's next owner; clients close
            // only when they have all of theirs.
            _peers.erase(socket);
            close(socket);
            return;
        }
        peer.buffer.resize(size + static_cast<std::size_t>(received));
        std::size_t used = 0;
        if (!peer.isGreeted) {
            if (peer.buffer.size() < qmx::handshakeSize) return;
            used = qmx::handshakeSize;
            peer.isGreeted = true;
        }
        while (true) {
            const auto scan = qmx::scanFrame(std::string_view(peer.buffer).substr(used));
            if (scan.outcome != qmx::FrameScan::Outcome::complete) break;
            used += scan.size;
            {
                const std::lock_guard lock(_mutex);
                _requests.push_back({socket, scan.frame.id});
            }
            _arrived.notify_one();
        }
        peer.buffer.erase(0, used);
    }

    void answer() {
        std::vector<Request> requests;
        while (true) {
            {
                std::unique_lock lock(_mutex);
                _arrived.wait(lock, [this] { return !_requests.empty(); });
                requests.swap(_requests);
            }
            for (const Request& request : requests) {
                std::memcpy(_reply.data() + 8, &request.id, sizeof request.id);
                sendAll(request.socket, _reply);
            }
            requests.clear();
        }
    }

    Descriptor _listener{::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    Descriptor _epoll{epoll_create1(EPOLL_CLOEXEC)};
    std::map<int, Peer> _peers;
    std::string _reply;
    std::mutex _mutex;
    std::condition_variable _arrived;
    std::vector<Request> _requests; // guarded by _mutex
};

/// The echo in a process of its own.
class EchoProcess {
public:
    /// `self` is this program, which knows the role "echo".
    EchoProcess(const std::string& self, std::string path, std::size_t replySize)
        : _path(std::move(path)),
          _replySize(replySize),
          _process({self, "echo", _path, std::to_string(replySize)}, {}) {}

    /// The same requests, answered by the echo.
    Target targetLike(const Target& target) { return {_path, _process, target.requests, _replySize}; }

private:
    std::string _path;
    std::size_t _replySize;
    Process _process;
};

} // namespace bench
