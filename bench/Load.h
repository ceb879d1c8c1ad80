#pragma once

#include "bench/Socket.h"
#include "bench/Timing.h"

#include <cstring>
#include <functional>
#include <list>
#include <sys/epoll.h>
#include <vector>

/// Clients of either server: the same code asks the daemon and the echo.
namespace bench {

/// Where to ask, with what. The requests are whole frames, asked in turn.
struct Target {
    std::string path;
    Process& server;
    std::vector<std::string> requests;
    std::size_t replySize; // of every reply; another size means that something else was measured
};

/// Mean microseconds from request to reply, one client that waits for each. `use` gets each reply's body.
inline double roundTrip(const Target& target, double seconds,
                        const std::function<void(std::string_view)>& use = nullptr) {
    const Descriptor socket = connectTo(target.path, target.server);
    FrameReader reader;
    std::size_t count = 0;
    return meanMicroseconds(seconds, [&] {
        sendAll(socket.get(), target.requests[count++ % target.requests.size()]);
        const qmx::Frame reply = reader.next(socket.get());
        if (reader.frameSize() != target.replySize) fail("a reply of another size");
        if (use) use(reply.body);
    });
}

/// Replies per second to `clients` connections that each keep `depth` requests waiting.
inline double throughput(const Target& target, std::size_t clients, std::size_t depth, double seconds) {
    struct Client {
        Descriptor socket;
        Inbox inbox;
    };
    const Descriptor epoll(epoll_create1(EPOLL_CLOEXEC));
    std::list<Client> all;
    std::vector<std::string> requests = target.requests;
    std::uint64_t next = 0;
    const auto ask = [&](Client& client, std::size_t count) {
        // A send for each, as from a program that asks when it needs to know.
        for (std::size_t i = 0; i < count; ++i, ++next) {
            std::string& request = requests[next % requests.size()];
            // No two that wait have the same id, which stands at the end of the frame's header.
            std::memcpy(request.data() + qmx::frameHeaderSize - sizeof next, &next, sizeof next);
            sendAll(client.socket.get(), request);
        }
    };
    for (std::size_t i = 0; i < clients; ++i) {
        Client& client = all.emplace_back();
        client.socket = connectTo(target.path, target.server);
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.ptr = &client;
        if (epoll_ctl(epoll.get(), EPOLL_CTL_ADD, client.socket.get(), &event) != 0) failSystem("epoll_ctl");
    }
    for (Client& client : all) ask(client, depth);

    std::array<epoll_event, 64> events{};
    const double start = secondsNow();
    double end = start;
    std::size_t answered = 0;
    std::size_t waiting = clients * depth;
    bool isOver = false;
    while (waiting > 0) {
        const int count = epoll_wait(epoll.get(), events.data(), static_cast<int>(events.size()), -1);
        for (int i = 0; i < count; ++i) {
            Client& client = *static_cast<Client*>(events[static_cast<std::size_t>(i)].data.ptr);
            client.inbox.receive(client.socket.get());
            const std::size_t replies = client.inbox.bytes().size() / target.replySize;
            for (std::size_t reply = 0; reply < replies; ++reply) {
                if (qmx::scanFrame(client.inbox.bytes()).size != target.replySize) fail("a reply of another size");
                client.inbox.take(target.replySize);
            }
            waiting -= replies;
            if (isOver) continue;
            answered += replies;
            ask(client, replies);
            waiting += replies;
        }
        if (isOver) continue; // the rest is only taken in, so that nothing is under way when the sockets close
        end = secondsNow();
        isOver = end - start >= seconds;
    }
    return static_cast<double>(answered) / (end - start);
}

} // namespace bench
