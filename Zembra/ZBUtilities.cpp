#include "Zembra/ZBUtilities.h"

#include "Zembra/ZBLog.h"

#include <algorithm>
#include <cstdlib>

namespace zembra {

using platform::Dictionary;
using platform::MutableDictionary;
using platform::Value;

std::optional<MutableDictionary> dictionaryChanging(const std::optional<Dictionary>& dictionary, std::string_view key,
                                                    const Value& value) {
    if (!dictionary) return std::nullopt;
    MutableDictionary changed = MutableDictionary::copyOf(*dictionary);
    if (value) {
        changed.set(key, value);
    } else {
        changed.remove(key);
    }
    return changed;
}

namespace {

bool isDigit(char character) { return character >= '0' && character <= '9'; }

/// Takes the run of digits off the front of `text`; answers it without its leading zeros.
std::string_view takeNumber(std::string_view& text) {
    const auto length = static_cast<std::size_t>(std::find_if_not(text.begin(), text.end(), isDigit) - text.begin());
    std::string_view number = text.substr(0, length);
    text.remove_prefix(length);
    number.remove_prefix(std::min(number.find_first_not_of('0'), number.size()));
    return number;
}

} // namespace

std::weak_ordering compareVersionString(std::string_view left, std::string_view right) {
    while (!left.empty() && !right.empty()) {
        if (isDigit(left.front()) && isDigit(right.front())) {
            const std::string_view leftNumber = takeNumber(left);
            const std::string_view rightNumber = takeNumber(right);
            // Without leading zeros the longer number is the larger one, so no number is too long to compare.
            if (const auto order = leftNumber.size() <=> rightNumber.size(); order != 0) return order;
            if (const auto order = leftNumber <=> rightNumber; order != 0) return order;
        } else {
            const auto order = static_cast<unsigned char>(left.front()) <=> static_cast<unsigned char>(right.front());
            if (order != 0) return order;
            left.remove_prefix(1);
            right.remove_prefix(1);
        }
    }
    return left.size() <=> right.size();
}

std::string comparableVersion(std::string_view version) {
    std::string text;
    text.reserve(version.size());
    while (!version.empty()) {
        if (isDigit(version.front())) {
            const std::string_view number = takeNumber(version);
            text.append(number.empty() ? "0" : number);
        } else {
            text.push_back(version.front());
            version.remove_prefix(1);
        }
    }
    return text;
}

platform::Error errorWithCode(std::int64_t code, std::optional<std::string> description) {
    return {errorDomain, code, std::move(description)};
}

void fatalInternalError(std::string_view text) {
    log::ops().error("%{public}s", text);
    std::abort();
}

} // namespace zembra
