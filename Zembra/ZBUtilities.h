#pragma once

#include "Zembra/ZBProtocol.h"
#include "platform/Error.h"
#include "platform/Format.h"
#include "platform/PropertyList.h"

#include <compare>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

/// Small operations on values, and the makers of errors.
namespace zembra {

/// A copy of `dictionary` with `value` under `key`, or without the key when `value` is absent. None of none.
std::optional<platform::MutableDictionary> dictionaryChanging(const std::optional<platform::Dictionary>& dictionary,
                                                              std::string_view key, const platform::Value& value);

/// What `callback` makes of the elements, in their order, without the absent ones.
template <class Range, class Callback> platform::Array arrayWithValues(const Range& collection, Callback&& callback) {
    std::vector<platform::Value> values;
    for (const auto& element : collection) {
        if (platform::Value value = callback(element)) values.push_back(std::move(value));
    }
    return platform::Array(std::move(values));
}

/// The optional as a value: absent for none.
template <class T> platform::Value valueOrAbsent(const std::optional<T>& value) {
    return value ? platform::Value(*value) : platform::Value();
}

/// Orders version texts: runs of ASCII digits by their number, however long and whatever their leading zeros, other
/// characters by their code. So "1.9" comes before "1.10", and "1.01" is as good as "1.1".
std::weak_ordering compareVersionString(std::string_view left, std::string_view right);

/// A text that is the same for exactly the versions that compare as equal: without the leading zeros of numbers.
std::string comparableVersion(std::string_view version);

/// An error of the system's own domain.
platform::Error errorWithCode(std::int64_t code, std::optional<std::string> description = std::nullopt);

/// The same with a description made from a format text.
template <class First, class... Rest>
platform::Error errorWithCode(std::int64_t code,
                              platform::FormatString<std::type_identity_t<First>, std::type_identity_t<Rest>...> text,
                              const First& first, const Rest&... rest) {
    return errorWithCode(code, platform::format<First, Rest...>(text, first, rest...));
}

/// Logs the text of a broken invariant and stops the process.
[[noreturn]] void fatalInternalError(std::string_view text);

} // namespace zembra
