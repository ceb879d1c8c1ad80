#pragma once

#include "platform/Transport.h"
#include "platform/linux/TransportBudget.h"
#include "platform/linux/TransportFrame.h"

#include <chrono>
#include <cstddef>
#include <memory>

/// What one peer can make this process hold or wait for. None of these bounds changes what the protocol means.
namespace platform::linux_::qmx {

/// The largest value of a frame's length field.
inline constexpr std::size_t maximumFrameLength = std::size_t{64} << 20U;
static_assert(maximumMessageSize + frameHeaderSize <= maximumFrameLength);

/// Requests of one connection that were delivered and not answered yet. Past it the connection is not read until half
/// of them are answered; half, so that a client that keeps it full does not cost a wake-up per reply.
/// Far above what one host keeps in flight, and small enough to look an id up by walking.
inline constexpr std::size_t maximumWaitingRequests = 256;
inline constexpr std::size_t resumeWaitingRequests = maximumWaitingRequests / 2;

/// Bytes of those requests as they came, by the same rule: a client that sends large requests faster than they are
/// served is held up, before its user's budget ends the connection. One annotation of 100,000 plug-ins is 6 MB; the
/// next is read meanwhile.
inline constexpr std::size_t pauseWaitingBytes = std::size_t{8} << 20U;
inline constexpr std::size_t resumeWaitingBytes = pauseWaitingBytes / 2;

/// What the value of one request may take in memory, as `decodeMessage` counts it. Texts take once to three times
/// their bytes, dictionaries of short entries five times: an annotation of a plug-in by one number is 63 bytes and
/// counts 325, so 100,000 of them in one request take an eighth of this. An array of booleans would take sixteen times
/// its bytes, which for the longest frame is four times this.
inline constexpr std::size_t maximumDecodedBytes = std::size_t{256} << 20U;

/// What peers may make this process keep of what they send: bytes of unfinished frames, and values of requests until
/// they are answered or dropped. One user's budget holds the largest request, its frame included, and small ones
/// beside. Past it the connection that wants more is closed. To leave it unread instead could last for ever: what it
/// waits for may be other unfinished frames, which wait for the same.
/// While a message is decoded its value is not counted yet; that is one at a time.
inline constexpr Budget::Limits receivedBytes{std::size_t{512} << 20U, std::size_t{1} << 30U, std::size_t{64} << 10U};

/// What peers may make this process keep because they do not read. Forty hosts of one user may be slow to read the
/// longest answers at the same time.
inline constexpr Budget::Limits unsentBytes{std::size_t{1} << 30U, std::size_t{2} << 30U, std::size_t{64} << 10U};

/// Bytes that wait for a slow reader. Above the first bound no more of its requests are read, so that a client that
/// asks without reading stops itself; below the second they are read again.
inline constexpr std::size_t pauseUnsentBytes = std::size_t{1} << 20U;
inline constexpr std::size_t resumeUnsentBytes = pauseUnsentBytes / 2;
/// Requests taken before the pause may still be answered at length: two of the longest replies fit. A connection with
/// more than that waiting is closed.
inline constexpr std::size_t maximumUnsentBytes = std::size_t{128} << 20U;

/// Accepted connections of one user, unfinished handshakes among them. A user's processes need one each; a thousand
/// cost about 2,000 descriptors of the half million that a process may usually have, so that one user cannot lock
/// out another.
inline constexpr std::size_t maximumConnectionsPerUser = 1000;

/// From the moment a peer is accepted to its whole answer to the greeting. A peer answers at once, also on a machine
/// that is very busy; one that does not would keep its place for ever. After the handshake there is no deadline:
/// hosts keep idle connections, and an unfinished frame costs no more than an idle connection and its bytes.
inline constexpr std::chrono::milliseconds handshakeDeadline{30'000};

/// Bytes taken from a socket at once: what its buffer usually holds.
inline constexpr std::size_t readSize = std::size_t{64} << 10U;

/// Frames of one connection delivered before the others get their turn.
inline constexpr unsigned framesPerTurn = 64;

/// Replies to requests that arrived together are written together, up to this many bytes.
inline constexpr std::size_t gatheredBytes = std::size_t{64} << 10U;

/// Buffers larger than this are given back once they are empty or nearly so. One read behind the start of a small frame
/// stays below it.
inline constexpr std::size_t keptBufferBytes = 2 * readSize;

/// So that a service's name fits a socket address together with the prefix of the path through a descriptor.
inline constexpr std::size_t maximumServiceNameLength = 80;

/// The bounds that are for all connections of a transport.
struct Limits {
    std::chrono::milliseconds handshake = handshakeDeadline;
    Budget::Limits connections{maximumConnectionsPerUser};
    Budget::Limits received = receivedBytes;
    Budget::Limits unsent = unsentBytes;
};

/// What is left of them.
struct Budgets {
    explicit Budgets(const Limits& limits)
        : connections(std::make_shared<Budget>(limits.connections)),
          received(std::make_shared<Budget>(limits.received)),
          unsent(std::make_shared<Budget>(limits.unsent)) {}

    const std::shared_ptr<Budget> connections;
    const std::shared_ptr<Budget> received;
    const std::shared_ptr<Budget> unsent;
};

} // namespace platform::linux_::qmx
