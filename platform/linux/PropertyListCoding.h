#pragma once

#include "platform/PropertyList.h"

#include <cstddef>
#include <span>
#include <string>
#include <string_view>

/// What the encodings of property lists share.
namespace platform::linux_ {

/// `code` of an error in propertyListErrorDomain.
enum class CodingError { malformed = 1, notEncodable = 2 };

inline Error codingError(CodingError code, std::string text) {
    return {propertyListErrorDomain, static_cast<std::int64_t>(code), std::move(text)};
}

/// Every encoding holds the years 1 to 9999, which have a four-digit text form, so that no date is lost when a value
/// goes from one encoding to another. False for NaN.
inline bool isEncodableDate(Date date) {
    constexpr double firstSecond = -62135596800.0;     // 0001-01-01T00:00:00Z
    constexpr double endOfLastSecond = 253402300800.0; // 10000-01-01T00:00:00Z
    return date.seconds >= firstSecond && date.seconds < endOfLastSecond;
}

/// What an encoder writes of a dictionary: entries whose encoding is kept, then others.
struct EncodingParts {
    std::string_view kept; // entry behind entry
    std::size_t keptEntries = 0;
    std::span<const Dictionary::Entry> others;
};

// Look into a value of that kind, which must stay as it is meanwhile, without a share in it.
EncodingParts encodingParts(const Value& dictionary) noexcept;
/// What the data is the encoding of; null for other data.
const Value* deferredContent(const Value& data) noexcept;
std::span<const Value> itemsOf(const Value& array) noexcept;

/// Appends an entry of a dictionary as it stands in the dictionary's compact encoding.
void appendEntry(std::string& out, const Dictionary::Entry& entry);

/// Decodes a file that begins with compactMagic. `nesting` as in `decodeCompact`.
Result<Value> decodeCompactFile(std::string_view bytes, std::size_t nesting);

} // namespace platform::linux_
