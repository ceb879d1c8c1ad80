#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

/// A 16-byte identifier (RFC 4122).
struct UUID {
    std::array<std::uint8_t, 16> bytes{};

    /// A random version-4 UUID from the system's generator.
    static UUID random();

    /// Reads the 36-character text form (8-4-4-4-12 hexadecimal digits, either case); none for anything else.
    static std::optional<UUID> parse(std::string_view text);

    /// The 36-character text form in upper case.
    std::string text() const;

    friend auto operator<=>(const UUID&, const UUID&) = default;
};

} // namespace platform

template <> struct std::hash<platform::UUID> {
    std::size_t operator()(const platform::UUID& uuid) const noexcept {
        // UUIDs are random or assigned by the registry, never chosen by a peer, so their own bits serve.
        std::size_t value = 0;
        for (std::size_t i = 0; i < sizeof value; ++i) value = (value << 8U) | (uuid.bytes[i] ^ uuid.bytes[i + 8]);
        return value;
    }
};
