#pragma once

#include <optional>
#include <string_view>

namespace platform::linux_ {

/// The encoding of the value under `key` in the compact encoding of a dictionary (`docs/wire-protocol.md`), found
/// without decoding what lies before it. None when there is no such key, or the bytes are of no dictionary. Of damaged
/// bytes an answer may be damaged too; it lies within them.
std::optional<std::string_view> findEncoded(std::string_view dictionary, std::string_view key);

/// The text of the encoding of a string; none for one of another kind.
std::optional<std::string_view> encodedString(std::string_view value);

} // namespace platform::linux_
