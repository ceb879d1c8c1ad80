#pragma once

#include "platform/PropertyList.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

/// What travels on a connection: a handshake, then frames.
namespace platform::linux_::qmx {

enum class FrameType : std::uint8_t { request = 1, reply = 2, message = 3 };

/// One frame, looking into the bytes it was found in.
struct Frame {
    FrameType type = FrameType::message;
    std::uint64_t id = 0;
    std::string_view body;
};

/// The first four bytes of a frame count those that follow; type, reserved bytes and id are among them.
inline constexpr std::size_t frameLengthSize = 4;
inline constexpr std::size_t frameHeaderSize = 16;

struct FrameScan {
    enum class Outcome { incomplete, complete, malformed };
    Outcome outcome = Outcome::incomplete;
    Frame frame;
    std::size_t size = 0;          // bytes of the complete frame
    const char* problem = nullptr; // what is wrong with a malformed one
};

/// Looks at the front of `bytes`. A header is judged as soon as it is there, before its body is waited for.
FrameScan scanFrame(std::string_view bytes);

/// Appends a frame around `content`. False, and nothing appended, when it would exceed `maximumFrameLength`.
bool appendFrame(std::string& out, FrameType type, std::uint64_t id, const Value& content);

/// The listener greets with a nonce, and the peer answers with the nonce's complement: an answer, so that the kernel
/// names its sender; a complement, so that a program that merely copies its input to its output does not answer for
/// whoever started it.
inline constexpr std::size_t nonceSize = 16;
inline constexpr std::size_t handshakeSize = 8 + nonceSize;
using Nonce = std::array<char, nonceSize>;
using Handshake = std::array<char, handshakeSize>;

Handshake makeGreeting(const Nonce& nonce);
/// False when `greeting` is none of this protocol's.
bool isGreeting(const Handshake& greeting);
Handshake makeAnswer(const Handshake& greeting);

} // namespace platform::linux_::qmx
