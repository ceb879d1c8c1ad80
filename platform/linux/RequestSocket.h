#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/Root.h"

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <thread>

namespace platform::linux_ {

/// Connections that have not yet sent their request. One more drops the oldest. Who sends at once is mostly served when
/// accepted, before silent peers can matter; one that is accepted between its connecting and its sending may be
/// dropped.
inline constexpr std::size_t maximumSilentConnections = 64;

/// Where a socket is, and of which type.
struct RequestSocketAddress {
    const char* name; // in the runtime directory
    int type;         // SOCK_SEQPACKET or SOCK_STREAM
};

/// A Unix socket in the runtime directory at which every connection brings one request and gets one answer, on a thread
/// of its own. A request must be small enough to be sent in one piece.
class RequestSocket {
public:
    /// Serves what has come in on a connection, and answers. False while nothing has come. It is called on the socket's
    /// thread.
    using Serve = std::function<bool(int connection)>;

    /// Listens from now on. `threadName` is 15 bytes at the most.
    static Result<std::unique_ptr<RequestSocket>> start(const Root& root, const RequestSocketAddress& address,
                                                        const char* threadName, Serve serve);
    /// Stops the thread and removes the socket.
    ~RequestSocket();
    /// Removes the socket while the thread runs on.
    void removeName() const;
    RequestSocket(const RequestSocket&) = delete;
    RequestSocket& operator=(const RequestSocket&) = delete;

private:
    RequestSocket(const RequestSocketAddress& address, Serve serve) : _address(address), _serve(std::move(serve)) {}
    Failure listen(const Root& root);
    void run();
    void acceptWaiting();

    const RequestSocketAddress _address;
    const Serve _serve;
    Descriptor _directory;
    Descriptor _listener;
    Descriptor _stop;
    Descriptor _reserve; // given up to accept and close a connection when the process has no descriptor left
    FileIdentity _socket;
    std::deque<Descriptor> _silent; // oldest first; used on the thread only
    std::thread _thread;
};

struct Request {
    std::string text;  // empty when the peer hung up
    pid_t sender = -1; // the process that sent it, as the kernel attests; not always the one that connected
};
/// The whole request that waits on `connection`, at most `limit` bytes; longer ones come back cut, one byte over it.
/// None while nothing has come.
std::optional<Request> receiveRequest(int connection, std::size_t limit);
/// Answers with an errno value (32 bits, native order) and, when it is open, a descriptor. A peer that does not take it
/// gets nothing.
void sendAnswer(int connection, std::int32_t number, const Descriptor& opened);

/// A connection. Waiting on it is bounded.
Result<Descriptor> connectToRequestSocket(const Root& root, const RequestSocketAddress& address);
/// Sends the request, not empty, and waits for the answer. Zero, or an errno value: the one that was answered, or that
/// of the exchange.
int exchangeRequest(int connection, std::string_view request, Descriptor& opened);

} // namespace platform::linux_
