#include "platform/Uuid.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <sys/random.h>

namespace platform {

namespace {

constexpr bool separatorAt(std::size_t index) { return index == 8 || index == 13 || index == 18 || index == 23; }
constexpr std::size_t textLength = 36;

int digit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

} // namespace

UUID UUID::random() {
    UUID uuid;
    std::size_t filled = 0;
    while (filled < uuid.bytes.size()) {
        const ssize_t count = getrandom(uuid.bytes.data() + filled, uuid.bytes.size() - filled, 0);
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) {
            // An identifier that might repeat is worse than none.
            std::fputs("the system gives no random numbers\n", stderr);
            std::abort();
        }
        filled += static_cast<std::size_t>(count);
    }
    uuid.bytes[6] = static_cast<std::uint8_t>((uuid.bytes[6] & 0x0FU) | 0x40U);
    uuid.bytes[8] = static_cast<std::uint8_t>((uuid.bytes[8] & 0x3FU) | 0x80U);
    return uuid;
}

std::optional<UUID> UUID::parse(std::string_view text) {
    if (text.size() != textLength) return std::nullopt;
    UUID uuid;
    std::size_t nibble = 0;
    for (std::size_t i = 0; i < textLength; ++i) {
        if (separatorAt(i)) {
            if (text[i] != '-') return std::nullopt;
            continue;
        }
        const int value = digit(text[i]);
        if (value < 0) return std::nullopt;
        auto& byte = uuid.bytes[nibble / 2];
        byte = static_cast<std::uint8_t>(byte * 16 + value);
        ++nibble;
    }
    return uuid;
}

std::string UUID::text() const {
    static constexpr char digits[] = "0123456789ABCDEF";
    std::string text(textLength, '-');
    std::size_t nibble = 0;
    for (std::size_t i = 0; i < textLength; ++i) {
        if (separatorAt(i)) continue;
        const unsigned byte = bytes[nibble / 2];
        text[i] = digits[nibble % 2 == 0 ? byte >> 4U : byte & 0x0FU];
        ++nibble;
    }
    return text;
}

} // namespace platform
