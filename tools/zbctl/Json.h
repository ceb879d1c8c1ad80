#pragma once

#include "platform/Error.h"
#include "platform/PropertyList.h"

#include <nlohmann/json.hpp>
#include <string>
#include <string_view>

/// Property-list values as JSON and back.
namespace zbctl {

/// Keeps the order of keys.
using Json = nlohmann::ordered_json;

/// Data becomes {"$data": base64}; dates (ISO 8601, UTC) and UUIDs become text. Real numbers that JSON cannot hold
/// become null.
Json toJson(const platform::Value& value);

/// An error when the text is no JSON, or an object of it has a key twice: which of the entries counts would be a guess.
platform::Result<Json> parseJson(std::string_view text);

/// JSON's kinds as they are; null has no counterpart and is refused, as is what the encodings refuse (NUL in texts,
/// too deep nesting).
platform::Result<platform::Value> fromJson(const Json& json);

/// Replaces each dictionary of the one key "$uuid", "$data" (base64) or "$date" (ISO 8601) by the value that it
/// stands for: so a file format without that kind of value can spell it. An error when the text is none.
platform::Result<platform::Value> expandMarkers(const platform::Value& value);

/// The text of a date (ISO 8601, UTC) or of data (base64), as property lists in XML have it; the bare number of seconds
/// for a date beyond the calendar.
std::string plainText(const platform::Value& dateOrData);

} // namespace zbctl
