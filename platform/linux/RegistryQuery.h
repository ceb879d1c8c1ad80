#pragma once

#include "platform/PropertyList.h"
#include "platform/linux/RegistryRecord.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

/// The share of the match-pattern language that an index can answer: plain equality with a plug-in's identifier,
/// UUID, attribute or manifest key. Everything else is left to the full match.
namespace platform::linux_ {

/// The text with leading zeros of its runs of decimal digits dropped. Equality in the language takes such runs by
/// their numeric value, so two texts are equal there only if these forms are.
std::string normalizedForEquality(std::string_view text);

/// One entry of a query: the value under `key`, or one of its elements, must be one of `values`.
struct EqualityTest {
    std::string key;
    std::vector<std::string> values; // normalized; may be empty, which nothing passes
    friend bool operator==(const EqualityTest&, const EqualityTest&) = default;
};

/// The entries of a query that are plain equality.
std::vector<EqualityTest> equalityTests(const Dictionary& query);

/// The same for two texts whose normalized forms are.
std::uint32_t hashForEquality(std::string_view text);

/// Calls `visit` with the texts of a plug-in with which a test of `key` compares. Nothing of its manifest is kept
/// decoded.
void visitForEquality(const InstalledPlugIn& plugIn, const std::string& key, const StoredDictionary::Visit& visit);

} // namespace platform::linux_
