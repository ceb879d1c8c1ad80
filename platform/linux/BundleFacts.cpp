#include "platform/linux/BundleFacts.h"

#include <cstddef>
#include <vector>

namespace platform::linux_ {

namespace {

/// What a hostile bundle makes up shall not stay for ever.
constexpr std::size_t maximumKeys = 4096;

} // namespace

Dictionary SharedKeys::share(const Dictionary& dictionary) {
    std::vector<Dictionary::Entry> entries;
    entries.reserve(dictionary.size());
    for (const auto& [key, value] : dictionary) {
        const auto inner = value.dictionary();
        entries.push_back({key, inner ? Value(share(*inner)) : value});
    }
    {
        const std::lock_guard lock(_mutex);
        for (auto& entry : entries) {
            if (const auto known = _keys.find(entry.name()); known != _keys.end())
                entry.key = known->second;
            else if (_keys.size() < maximumKeys)
                _keys.emplace(entry.name(), entry.key);
        }
    }
    return *Dictionary::fromUniqueEntries(std::move(entries));
}

StoredDictionary::StoredDictionary(const Dictionary& dictionary, SharedKeys& keys)
    : _keys(keys), _dictionary(keys.share(dictionary)) {
    std::call_once(_decoding, [] {});
}

const Dictionary& StoredDictionary::dictionary() const {
    std::call_once(_decoding, [&] {
        if (auto value = decodeCompact(_encoded, UUIDs::refused, maximumManifestNesting)) {
            if (auto dictionary = value->dictionary()) _dictionary = _keys.share(*dictionary);
        }
        _encoded = std::string();
    });
    return _dictionary;
}

std::string StoredDictionary::encoded() const {
    std::string bytes;
    appendCompact(bytes, dictionary());
    return bytes;
}

} // namespace platform::linux_
