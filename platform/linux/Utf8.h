#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string_view>

/// Checks text that comes from outside: one reading of UTF-8 for every encoding.
namespace platform::linux_ {

/// The length of the well-formed character at `text[at]`; 0 when there is none. Overlong forms, surrogates and
/// what lies above U+10FFFF are not well formed.
inline std::size_t utf8Length(std::string_view text, std::size_t at) noexcept {
    const auto byte = [&](std::size_t offset) { return static_cast<unsigned char>(text[at + offset]); };
    const std::size_t left = text.size() - at;
    const auto continues = [&](std::size_t offset) { return (byte(offset) & 0xC0U) == 0x80U; };
    const unsigned first = byte(0);
    if (first < 0x80) return 1;
    if (first < 0xC2) return 0;
    if (first < 0xE0) return left >= 2 && continues(1) ? 2 : 0;
    if (first < 0xF0) {
        if (left < 3 || !continues(1) || !continues(2)) return 0;
        if (first == 0xE0 && byte(1) < 0xA0) return 0; // overlong
        if (first == 0xED && byte(1) > 0x9F) return 0; // a surrogate
        return 3;
    }
    if (first > 0xF4 || left < 4 || !continues(1) || !continues(2) || !continues(3)) return 0;
    if (first == 0xF0 && byte(1) < 0x90) return 0; // overlong
    if (first == 0xF4 && byte(1) > 0x8F) return 0; // above U+10FFFF
    return 4;
}

/// The length of the run of printable ASCII at the start of `text`, in steps of eight bytes where it can.
inline std::size_t plainLength(std::string_view text) noexcept {
    constexpr std::uint64_t ones = 0x0101010101010101U;
    constexpr std::uint64_t highBits = 0x80 * ones;
    std::size_t at = 0;
    for (std::uint64_t word = 0; text.size() - at >= sizeof word; at += sizeof word) {
        std::memcpy(&word, text.data() + at, sizeof word);
        // A high bit is set for a byte beyond ASCII, for DEL, and for one below a blank; carries and borrows begin only
        // at such bytes.
        if (((word | (word + ones) | (word - 0x20 * ones)) & highBits) != 0) break;
    }
    while (at < text.size() && text[at] >= 0x20 && text[at] < 0x7F) ++at;
    return at;
}

/// The offset of the first byte that is NUL or not part of well-formed UTF-8; none when all is well.
inline std::optional<std::size_t> firstBadByte(std::string_view text) noexcept {
    constexpr std::uint64_t ones = 0x0101010101010101U;
    constexpr std::uint64_t highBits = 0x8080808080808080U;
    std::size_t at = 0;
    while (at < text.size()) {
        if (text.size() - at >= sizeof(std::uint64_t)) {
            std::uint64_t word;
            std::memcpy(&word, text.data() + at, sizeof word);
            // Eight bytes in one step: none has its high bit set and none is NUL.
            if (((word | (word - ones)) & highBits) == 0) {
                at += sizeof word;
                continue;
            }
        }
        if (text[at] == '\0') return at;
        const std::size_t length = utf8Length(text, at);
        if (length == 0) return at;
        at += length;
    }
    return std::nullopt;
}

} // namespace platform::linux_
