#include "platform/linux/BundleFacts.h"

#include "platform/linux/EncodedDictionary.h"

#include <algorithm>
#include <functional>
#include <vector>

namespace platform::linux_ {

namespace {

/// What is longer is a text for people, and stands in one manifest only.
constexpr std::size_t maximumSharedString = 64;
/// What is no longer met is gone after as many others.
constexpr unsigned maximumCount = 16;

} // namespace

Dictionary SharedStrings::share(const Dictionary& dictionary) {
    const std::lock_guard lock(_mutex);
    return shareLocked(dictionary);
}

Dictionary SharedStrings::shareLocked(const Dictionary& dictionary) {
    std::vector<Dictionary::Entry> entries;
    entries.reserve(dictionary.size());
    for (const auto& [key, value] : dictionary) entries.push_back({shareLocked(key), shareLocked(value)});
    return *Dictionary::fromUniqueEntries(std::move(entries));
}

// NOLINTNEXTLINE(misc-no-recursion): decoders bound the nesting.
Value SharedStrings::shareLocked(const Value& value) {
    if (const auto dictionary = value.dictionary()) return shareLocked(*dictionary);
    if (const auto array = value.array()) {
        std::vector<Value> values;
        values.reserve(array->size());
        for (const auto& element : *array) values.push_back(shareLocked(element));
        return Array(std::move(values));
    }
    const auto text = value.string();
    if (!text || text->size() > maximumSharedString) return value;
    auto& [known, count] = _strings[std::hash<std::string_view>()(*text) % _strings.size()];
    if (known.string() == text) {
        count = std::min(count + 1, maximumCount);
        return known;
    }
    if (count > 0)
        --count;
    else
        known = value;
    return value;
}

Value StoredDictionary::content() const {
    if (_isDecoded.load(std::memory_order_acquire)) return _content;
    const std::lock_guard lock(_strings._mutex);
    return _content;
}

Dictionary StoredDictionary::dictionary() const {
    const Value content = this->content();
    if (const auto dictionary = content.dictionary()) return *dictionary;
    const auto value = decodeCompact(*content.data(), UUIDs::refused, maximumManifestNesting);
    const auto decoded = value ? value->dictionary() : std::nullopt;
    if (!decoded) return {};
    if (_keeps == Keeps::encoding) return *decoded;
    const std::lock_guard lock(_strings._mutex);
    // Another thread may have been first.
    if (!_isDecoded.load(std::memory_order_relaxed)) {
        _content = _strings.shareLocked(*decoded);
        _isDecoded.store(true, std::memory_order_release);
    }
    return *_content.dictionary();
}

std::string StoredDictionary::encoded() const {
    const Value content = this->content();
    if (const auto bytes = content.data()) return std::string(*bytes);
    std::string bytes;
    appendCompact(bytes, content);
    return bytes;
}

std::optional<std::string_view> StoredDictionary::findIn(const Value& encoded,
                                                         std::initializer_list<std::string_view> names) {
    auto found = encoded.data();
    for (const auto name : names) {
        if (found) found = findEncoded(*found, name);
    }
    return found;
}

Value StoredDictionary::find(std::initializer_list<std::string_view> names) const {
    Value value = content();
    if (!value.data()) {
        for (const auto name : names) {
            const auto dictionary = value.dictionary();
            value = dictionary ? (*dictionary)[name] : Value();
        }
        return value;
    }
    const auto encoded = findIn(value, names);
    if (!encoded) return {};
    auto decoded = decodeCompact(*encoded, UUIDs::refused, maximumManifestNesting);
    return decoded ? *std::move(decoded) : Value();
}

bool StoredDictionary::visitTexts(std::initializer_list<std::string_view> names, const Visit& visit) const {
    const Value content = this->content();
    const auto encoded = findIn(content, names);
    const auto encodedText = encoded ? encodedString(*encoded) : std::nullopt;
    if (encodedText) {
        visit(*encodedText);
        return true;
    }
    if (content.data() && !encoded) return false;
    const Value value = find(names);
    if (const auto text = value.string()) visit(*text);
    for (const Value& element : value.array().value_or(Array())) {
        if (const auto text = element.string()) visit(*text);
    }
    return static_cast<bool>(value);
}

} // namespace platform::linux_
