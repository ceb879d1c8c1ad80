#include "platform/linux/EncodedDictionary.h"

#include <cstddef>
#include <cstdint>

namespace platform::linux_ {

namespace {

// The encoding's tags, by what follows them.
enum Tag : std::uint8_t {
    falseTag = 0x01,       // nothing
    firstNumberTag = 0x03, // eight bytes
    lastNumberTag = 0x06,
    stringTag = 0x07, // a size and as many bytes
    dataTag = 0x08,
    uuidTag = 0x09,
    arrayTag = 0x0A, // a size, a count and as many bytes as the size says
    dictionaryTag = 0x0B,
};

/// Takes pieces from the front of an encoding. Once a piece is larger than what is left, nothing is left.
class Pieces {
public:
    explicit Pieces(std::string_view bytes) : _left(bytes) {}

    std::string_view left() const { return _left; }
    std::string_view take(std::size_t size) {
        if (size > _left.size()) {
            _left = {};
            return {};
        }
        const auto piece = _left.substr(0, size);
        _left.remove_prefix(size);
        return piece;
    }
    /// 0, which is no tag, when nothing is left.
    std::uint8_t takeTag() {
        const auto piece = take(1);
        return piece.empty() ? std::uint8_t{0} : static_cast<std::uint8_t>(piece[0]);
    }
    std::uint32_t takeSize() {
        const auto piece = take(sizeof(std::uint32_t));
        if (piece.empty()) return 0;
        const auto byte = [&](std::size_t i) { return std::uint32_t{static_cast<std::uint8_t>(piece[i])}; };
        return byte(0) | (byte(1) << 8U) | (byte(2) << 16U) | (byte(3) << 24U); // one load instead of a loop
    }
    std::string_view takeValue() {
        const auto start = _left;
        const std::uint8_t tag = takeTag();
        if (tag >= firstNumberTag && tag <= lastNumberTag) take(sizeof(std::uint64_t));
        if (tag == stringTag || tag == dataTag) take(takeSize());
        if (tag == uuidTag) take(16);
        if (tag == arrayTag || tag == dictionaryTag) take(std::size_t{takeSize()} + sizeof(std::uint32_t));
        if (tag < falseTag || tag > dictionaryTag) _left = {};
        return start.substr(0, start.size() - _left.size());
    }

private:
    std::string_view _left;
};

} // namespace

std::optional<std::string_view> findEncoded(std::string_view dictionary, std::string_view key) {
    Pieces pieces(dictionary);
    if (pieces.takeTag() != dictionaryTag) return std::nullopt;
    pieces.takeSize();
    pieces.takeSize();
    while (!pieces.left().empty()) {
        const auto name = pieces.take(pieces.takeSize());
        const auto value = pieces.takeValue();
        if (name == key) return value;
    }
    return std::nullopt;
}

std::optional<std::string_view> encodedString(std::string_view value) {
    Pieces pieces(value);
    if (pieces.takeTag() != stringTag) return std::nullopt;
    return pieces.take(pieces.takeSize());
}

} // namespace platform::linux_
