#pragma once

#include <cstddef>

/// What one peer can make this process hold or wait for. None of these bounds changes what the protocol means.
namespace platform::linux_::qmx {

/// The largest value of a frame's length field. A full "match" answer of 10,000 plug-ins is about 24 MB.
inline constexpr std::size_t maximumFrameLength = std::size_t{64} << 20U;

/// Requests of one connection that were delivered and not answered yet. Past it the connection is not read until half
/// of them are answered; half, so that a client that keeps it full does not cost a wake-up per reply.
/// Far above what one host keeps in flight, and small enough to look an id up by walking.
inline constexpr std::size_t maximumWaitingRequests = 256;
inline constexpr std::size_t resumeWaitingRequests = maximumWaitingRequests / 2;

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

/// Bytes taken from a socket at once: what its buffer usually holds.
inline constexpr std::size_t readSize = std::size_t{64} << 10U;

/// Frames of one connection delivered before the others get their turn.
inline constexpr unsigned framesPerTurn = 64;

/// Replies to requests that arrived together are written together, up to this many bytes.
inline constexpr std::size_t gatheredBytes = std::size_t{64} << 10U;

/// Buffers larger than this are given back once they are empty.
inline constexpr std::size_t keptBufferBytes = std::size_t{64} << 10U;

/// So that a service's name fits a socket address together with the prefix of the path through a descriptor.
inline constexpr std::size_t maximumServiceNameLength = 80;

} // namespace platform::linux_::qmx
