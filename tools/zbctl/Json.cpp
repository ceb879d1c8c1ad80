#include "tools/zbctl/Json.h"

#include "platform/linux/Utf8.h"

#include <optional>
#include <set>
#include <vector>

namespace zbctl {

using platform::Array;
using platform::Error;
using platform::Kind;
using platform::Result;
using platform::UUID;
using platform::Value;

namespace {

constexpr const char* uuidMarker = "$uuid";
constexpr const char* dataMarker = "$data";
constexpr const char* dateMarker = "$date";

Error wrongInput(std::string text) { return {platform::propertyListErrorDomain, 0, std::move(text)}; }

// One definition of these texts is enough: the XML encoding's.

std::optional<Value> valueOfElement(std::string_view element, std::string_view text) {
    if (text.find_first_of("<&") != std::string_view::npos) return std::nullopt;
    const std::string name(element);
    auto value = platform::decodePropertyList("<vlist><" + name + '>' + std::string(text) + "</" + name + "></vlist>");
    if (!value) return std::nullopt;
    return *std::move(value);
}

std::optional<Value> valueOfMarker(std::string_view marker, std::string_view text) {
    if (marker == dataMarker) return valueOfElement("data", text);
    if (marker == dateMarker) return valueOfElement("date", text);
    if (const auto uuid = UUID::parse(text)) return Value(*uuid);
    return std::nullopt;
}

bool isMarker(std::string_view key) { return key == uuidMarker || key == dataMarker || key == dateMarker; }

Result<Value> fromJson(const Json& json, std::size_t depth) {
    if (json.is_structured() && depth >= platform::maximumNesting) return wrongInput("nested too deeply");
    switch (json.type()) {
    case Json::value_t::boolean: return Value(json.get<bool>());
    case Json::value_t::number_integer: return Value(json.get<std::int64_t>());
    case Json::value_t::number_unsigned: return Value(json.get<std::uint64_t>());
    case Json::value_t::number_float: return Value(json.get<double>());
    case Json::value_t::string: {
        const auto& text = json.get_ref<const std::string&>();
        if (platform::linux_::firstBadByte(text)) return wrongInput("a string holds NUL");
        return Value(text);
    }
    case Json::value_t::array: {
        std::vector<Value> values;
        for (const auto& element : json) {
            auto value = fromJson(element, depth + 1);
            if (!value) return value.error();
            values.push_back(*std::move(value));
        }
        return Value(Array(std::move(values)));
    }
    case Json::value_t::object: {
        platform::MutableDictionary dictionary;
        for (const auto& [name, element] : json.items()) {
            if (platform::linux_::firstBadByte(name)) return wrongInput("a key holds NUL");
            auto value = fromJson(element, depth + 1);
            if (!value) return value.error();
            dictionary.set(name, *std::move(value));
        }
        return Value(dictionary);
    }
    default: return wrongInput("null has no counterpart in a property list");
    }
}

} // namespace

std::string plainText(const Value& dateOrData) {
    const auto encoded = platform::encodeXML(dateOrData);
    if (!encoded) return dateOrData.date() ? std::to_string(dateOrData.date()->seconds) : std::string();
    const std::size_t end = encoded->find("</", encoded->find("<vlist")); // of the one element
    const std::size_t start = encoded->rfind('>', end) + 1;
    return encoded->substr(start, end - start);
}

Json toJson(const Value& value) {
    switch (value.kind()) {
    case Kind::none: return nullptr;
    case Kind::boolean: return *value.boolean();
    case Kind::integer:
        if (const auto number = value.int64()) return *number;
        return *value.uint64();
    case Kind::real: return *value.real();
    case Kind::date: return plainText(value);
    case Kind::string: return std::string(*value.string());
    case Kind::data: return Json{{dataMarker, plainText(value)}};
    case Kind::uuid: return value.uuid()->text();
    case Kind::array: {
        Json json = Json::array();
        const auto array = value.array();
        for (const auto& element : *array) json.push_back(toJson(element));
        return json;
    }
    case Kind::dictionary: {
        Json json = Json::object();
        const auto dictionary = value.dictionary();
        for (const auto& entry : *dictionary) json[std::string(entry.name())] = toJson(entry.value);
        return json;
    }
    }
    return nullptr;
}

Result<Json> parseJson(std::string_view text) {
    // The parser lets a later entry take the place of an earlier one with the same key, without a word.
    std::vector<std::set<std::string>> keysOfOpenObjects;
    std::optional<std::string> repeated;
    const auto watchKeys = [&](int, Json::parse_event_t event, const Json& parsed) {
        if (event == Json::parse_event_t::object_start) {
            keysOfOpenObjects.emplace_back();
        } else if (event == Json::parse_event_t::object_end) {
            keysOfOpenObjects.pop_back();
        } else if (event == Json::parse_event_t::key) {
            const auto& key = parsed.get_ref<const std::string&>();
            if (!keysOfOpenObjects.back().insert(key).second) repeated = key;
        }
        return true;
    };
    Json json = Json::parse(text, watchKeys, false);
    if (json.is_discarded()) return wrongInput("no valid JSON");
    if (repeated) return wrongInput("the key \"" + *repeated + "\" stands twice");
    return json;
}

Result<Value> fromJson(const Json& json) { return fromJson(json, 0); }

Result<Value> expandMarkers(const Value& value) {
    if (const auto array = value.array()) {
        std::vector<Value> values;
        for (const auto& element : *array) {
            auto expanded = expandMarkers(element);
            if (!expanded) return expanded.error();
            values.push_back(*std::move(expanded));
        }
        return Value(Array(std::move(values)));
    }
    const auto dictionary = value.dictionary();
    if (!dictionary) return value;
    if (dictionary->size() == 1 && isMarker(dictionary->begin()->name())) {
        const auto& entry = *dictionary->begin();
        const auto text = entry.value.string();
        auto marked = text ? valueOfMarker(entry.name(), *text) : std::nullopt;
        if (!marked) return wrongInput("no valid text under \"" + std::string(entry.name()) + "\"");
        return *std::move(marked);
    }
    platform::MutableDictionary expandedDictionary;
    for (const auto& entry : *dictionary) {
        auto expanded = expandMarkers(entry.value);
        if (!expanded) return expanded.error();
        expandedDictionary.set(entry.name(), *std::move(expanded));
    }
    return Value(expandedDictionary);
}

} // namespace zbctl
