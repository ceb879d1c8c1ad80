#include "platform/linux/RegistryQuery.h"

#include <algorithm>
#include <functional>
#include <optional>

namespace platform::linux_ {

namespace {

constexpr std::string_view identifierKey = "VKExtensionIdentifier";
constexpr std::string_view uuidKey = "com.nordane.uuid";

/// Keys of manifests are words. What is longer shall not be kept with an index.
constexpr std::size_t maximumKeyLength = 256;

/// Keys whose values the registry does not have, or that no host asks for often enough to keep an index.
bool isLeftToFullMatch(std::string_view key) {
    return key.size() > maximumKeyLength || key == "VKUserElection" || key == "VKExtensionContainingApp" ||
           key.starts_with("ENTITLEMENT:");
}

/// Entries of one query that are tested. More would make a host's query dear without making its answer much smaller.
constexpr std::size_t maximumTests = 8;

bool isDigit(char byte) { return byte >= '0' && byte <= '9'; }

/// The operand of a plain equality pattern.
std::optional<std::string_view> equalityOperand(const Value& pattern) {
    auto text = pattern.string();
    if (!text) return std::nullopt;
    if (text->starts_with('=')) return text->substr(1);
    if (text->starts_with('?') || text->starts_with('<') || text->starts_with('>')) return std::nullopt;
    return text;
}

} // namespace

std::string normalizedForEquality(std::string_view text) {
    std::string normalized;
    normalized.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        const bool isInRun = !normalized.empty() && i > 0 && isDigit(text[i - 1]);
        const bool isFollowed = i + 1 < text.size() && isDigit(text[i + 1]);
        // A zero is leading when nothing of its run was kept so far; the last digit of a run always stays.
        const bool isKeptRun = isInRun && isDigit(normalized.back());
        if (text[i] == '0' && !isKeptRun && isFollowed) continue;
        normalized.push_back(text[i]);
    }
    return normalized;
}

std::vector<EqualityTest> equalityTests(const Dictionary& query) {
    std::vector<EqualityTest> tests;
    for (const auto& [key, pattern] : query) {
        if (tests.size() == maximumTests) break;
        if (isLeftToFullMatch(*key.string())) continue;
        EqualityTest test{std::string(*key.string()), {}};
        const auto alternatives = pattern.array().value_or(Array{pattern});
        const bool isPlain = std::ranges::all_of(alternatives, [&](const Value& alternative) {
            const auto operand = equalityOperand(alternative);
            if (operand) test.values.push_back(normalizedForEquality(*operand));
            return operand.has_value();
        });
        if (!isPlain) continue;
        std::ranges::sort(test.values);
        const auto doubles = std::ranges::unique(test.values);
        test.values.erase(doubles.begin(), doubles.end());
        tests.push_back(std::move(test));
    }
    return tests;
}

std::uint32_t hashForEquality(std::string_view text) {
    const std::hash<std::string_view> hash;
    // Few texts have zeros that could be dropped.
    const bool isNormal = text.find('0') == std::string_view::npos;
    return static_cast<std::uint32_t>(isNormal ? hash(text) : hash(normalizedForEquality(text)));
}

void visitForEquality(const InstalledPlugIn& plugIn, const std::string& key, const StoredDictionary::Visit& visit) {
    if (key == identifierKey && plugIn.identifier) return visit(*plugIn.identifier);
    if (key == uuidKey) return visit(plugIn.uuid.text());
    const StoredDictionary& info = *plugIn.facts->info;
    if (!info.visitTexts({"VKExtension", "VKExtensionAttributes", key}, visit)) info.visitTexts({key}, visit);
}

} // namespace platform::linux_
