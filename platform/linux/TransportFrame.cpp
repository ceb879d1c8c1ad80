#include "platform/linux/TransportFrame.h"

#include "platform/linux/TransportLimits.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace platform::linux_::qmx {

static_assert(std::endian::native == std::endian::little,
              "numbers on the wire are little-endian and copied as they are");

namespace {

template <class T> T load(const char* from) {
    T value;
    std::memcpy(&value, from, sizeof value);
    return value;
}

constexpr std::string_view greetingMagic("qmxs\x01\0\0\0", 8);
constexpr std::string_view answerMagic("qmxc\x01\0\0\0", 8);

FrameScan malformed(const char* problem) {
    FrameScan scan;
    scan.outcome = FrameScan::Outcome::malformed;
    scan.problem = problem;
    return scan;
}

} // namespace

FrameScan scanFrame(std::string_view bytes) {
    if (bytes.size() < frameLengthSize) return {};
    const std::size_t length = load<std::uint32_t>(bytes.data());
    if (length > maximumFrameLength) return malformed("frame too long");
    if (length < frameHeaderSize - frameLengthSize) return malformed("frame too short");
    if (bytes.size() < frameHeaderSize) return {};
    const auto type = static_cast<std::uint8_t>(bytes[4]);
    if (type < 1 || type > 3) return malformed("unknown frame type");
    if (bytes[5] != 0 || bytes[6] != 0 || bytes[7] != 0) return malformed("reserved bytes in use");
    if (bytes.size() < frameLengthSize + length) return {};
    FrameScan scan;
    scan.outcome = FrameScan::Outcome::complete;
    scan.size = frameLengthSize + length;
    scan.frame = {static_cast<FrameType>(type), load<std::uint64_t>(bytes.data() + 8),
                  bytes.substr(frameHeaderSize, scan.size - frameHeaderSize)};
    return scan;
}

bool appendFrame(std::string& out, FrameType type, std::uint64_t id, const Value& content) {
    const std::size_t start = out.size();
    const std::size_t length = frameHeaderSize - frameLengthSize + compactSize(content);
    if (length > maximumFrameLength) return false;
    out.reserve(start + frameLengthSize + length); // a long answer is copied once
    const auto field = static_cast<std::uint32_t>(length);
    std::array<char, frameHeaderSize> header{};
    std::memcpy(header.data(), &field, sizeof field);
    header[4] = static_cast<char>(type);
    std::memcpy(header.data() + 8, &id, sizeof id);
    out.append(header.data(), header.size());
    appendCompact(out, content);
    return true;
}

Handshake makeGreeting(const Nonce& nonce) {
    Handshake greeting{};
    std::copy(greetingMagic.begin(), greetingMagic.end(), greeting.begin());
    std::copy(nonce.begin(), nonce.end(), greeting.begin() + greetingMagic.size());
    return greeting;
}

bool isGreeting(const Handshake& greeting) {
    return std::string_view(greeting.data(), greetingMagic.size()) == greetingMagic;
}

Handshake makeAnswer(const Handshake& greeting) {
    Handshake answer{};
    std::copy(answerMagic.begin(), answerMagic.end(), answer.begin());
    std::transform(greeting.begin() + greetingMagic.size(), greeting.end(), answer.begin() + answerMagic.size(),
                   [](char byte) { return static_cast<char>(~byte); });
    return answer;
}

} // namespace platform::linux_::qmx
