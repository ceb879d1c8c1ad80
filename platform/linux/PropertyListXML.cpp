#include "platform/PropertyList.h"

#include "platform/linux/PropertyListCoding.h"
#include "platform/linux/Utf8.h"

#include <charconv>
#include <chrono>
#include <climits>
#include <cmath>
#include <expat.h>
#include <limits>
#include <openssl/evp.h>

namespace platform {

namespace {

using linux_::CodingError;
using linux_::codingError;

// Base64.

std::string base64(std::string_view bytes) {
    std::string text((bytes.size() + 2) / 3 * 4 + 1, '\0'); // the library also writes a NUL
    const int length =
        EVP_EncodeBlock(reinterpret_cast<unsigned char*>(text.data()),
                        reinterpret_cast<const unsigned char*>(bytes.data()), static_cast<int>(bytes.size()));
    text.resize(static_cast<std::size_t>(length));
    return text;
}

/// `text` without blanks. None unless it is exactly what `base64` writes for the bytes.
std::optional<std::string> base64Decoded(const std::string& text) {
    if (text.size() % 4 != 0) return std::nullopt;
    std::string bytes(text.size() / 4 * 3, '\0');
    const int length =
        EVP_DecodeBlock(reinterpret_cast<unsigned char*>(bytes.data()),
                        reinterpret_cast<const unsigned char*>(text.data()), static_cast<int>(text.size()));
    if (length < 0) return std::nullopt;
    // The library counts padding as bytes.
    std::size_t padding = 0;
    while (padding < 2 && padding < text.size() && text[text.size() - 1 - padding] == '=') ++padding;
    bytes.resize(static_cast<std::size_t>(length) - padding);
    if (base64(bytes) != text) return std::nullopt; // the library lets misplaced padding and stray bits pass
    return bytes;
}

// Dates: ISO 8601 in UTC, with as many decimals of a second as the number has in its shortest decimal form. Whole
// seconds and decimals are handled as digits, so that not even the last bit changes on the way there and back.

/// Turns the decimals of a number into those of the distance to the next whole number: 25 becomes 75.
void complement(std::string& decimals) {
    std::size_t last = decimals.find_last_not_of('0');
    if (last == std::string::npos) return;
    for (std::size_t i = 0; i < last; ++i) decimals[i] = static_cast<char>('9' - (decimals[i] - '0'));
    decimals[last] = static_cast<char>('9' + 1 - (decimals[last] - '0'));
}

void appendPadded(std::string& out, std::int64_t number, std::size_t width) {
    const std::string digits = std::to_string(number);
    if (digits.size() < width) out.append(width - digits.size(), '0');
    out += digits;
}

/// `date` lies in the encodable range.
std::string dateText(Date date) {
    char buffer[512]; // the smallest number has 324 leading zeros
    const char* end =
        std::to_chars(buffer, buffer + sizeof buffer, std::abs(date.seconds), std::chars_format::fixed).ptr;
    const std::string_view number(buffer, static_cast<std::size_t>(end - buffer));
    const std::size_t point = number.find('.');
    std::int64_t seconds = 0;
    std::from_chars(buffer, end, seconds); // stops at the point
    std::string decimals(point == std::string_view::npos ? "" : number.substr(point + 1));
    if (date.seconds < 0) {
        seconds = -seconds;
        if (!decimals.empty()) {
            --seconds;
            complement(decimals);
        }
    }

    const std::chrono::sys_seconds moment{std::chrono::seconds(seconds)};
    const auto day = std::chrono::floor<std::chrono::days>(moment);
    const std::chrono::year_month_day calendar(day);
    const std::chrono::hh_mm_ss time(moment - day);
    std::string text;
    appendPadded(text, static_cast<int>(calendar.year()), 4);
    text += '-';
    appendPadded(text, static_cast<unsigned>(calendar.month()), 2);
    text += '-';
    appendPadded(text, static_cast<unsigned>(calendar.day()), 2);
    text += 'T';
    appendPadded(text, time.hours().count(), 2);
    text += ':';
    appendPadded(text, time.minutes().count(), 2);
    text += ':';
    appendPadded(text, time.seconds().count(), 2);
    if (!decimals.empty()) text += '.' + decimals;
    text += 'Z';
    return text;
}

bool isDigit(char c) { return c >= '0' && c <= '9'; }

std::optional<Date> dateFromText(std::string_view text) {
    constexpr std::string_view pattern = "dddd-dd-ddTdd:dd:dd";
    if (text.size() < pattern.size() + 1 || text.back() != 'Z') return std::nullopt;
    for (std::size_t i = 0; i < pattern.size(); ++i)
        if (pattern[i] == 'd' ? !isDigit(text[i]) : text[i] != pattern[i]) return std::nullopt;
    const auto field = [text](std::size_t start, std::size_t length) {
        int number = 0;
        for (const char c : text.substr(start, length)) number = number * 10 + (c - '0');
        return number;
    };
    std::string decimals(text.substr(pattern.size(), text.size() - pattern.size() - 1));
    if (!decimals.empty()) {
        if (decimals.size() < 2 || decimals[0] != '.') return std::nullopt;
        decimals.erase(0, 1);
        for (const char c : decimals)
            if (!isDigit(c)) return std::nullopt;
    }
    const std::chrono::year_month_day calendar(std::chrono::year(field(0, 4)),
                                               std::chrono::month(static_cast<unsigned>(field(5, 2))),
                                               std::chrono::day(static_cast<unsigned>(field(8, 2))));
    const int hour = field(11, 2);
    const int minute = field(14, 2);
    const int second = field(17, 2);
    if (!calendar.ok() || hour > 23 || minute > 59 || second > 59) return std::nullopt;
    const auto day = std::chrono::sys_days(calendar).time_since_epoch();
    std::int64_t seconds = std::chrono::seconds(day).count() + hour * 3600 + minute * 60 + second;

    std::string number;
    if (seconds < 0) {
        number = '-';
        if (decimals.find_first_not_of('0') != std::string::npos) {
            ++seconds;
            complement(decimals);
        }
        seconds = -seconds;
    }
    number += std::to_string(seconds) + '.' + decimals;
    Date date;
    const auto parsed = std::from_chars(number.data(), number.data() + number.size(), date.seconds);
    if (parsed.ec != std::errc() || !linux_::isEncodableDate(date)) return std::nullopt;
    return date;
}

class XMLWriter {
public:
    Result<std::string> write(const Value& value) {
        _out = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vlist version=\"1.0\">\n";
        if (!append(value, 0)) {
            std::string text = "cannot be written as XML: " + _problem;
            if (!_place.empty()) text += " at " + Value(_place).description();
            return codingError(CodingError::notEncodable, std::move(text));
        }
        _out += "</vlist>\n";
        return std::move(_out);
    }

private:
    /// Always false, for a caller to pass on.
    bool fail(std::string_view what) {
        _problem = what;
        return false;
    }

    void indent(std::size_t depth) { _out.append(depth, '\t'); }

    bool append(const Value& value, std::size_t depth) {
        indent(depth);
        switch (value.kind()) {
        case Kind::none: return fail("an absent value");
        case Kind::uuid: return fail("a UUID");
        case Kind::boolean: _out += *value.boolean() ? "<true/>\n" : "<false/>\n"; return true;
        case Kind::integer:
            if (const auto number = value.int64())
                appendElement("integer", std::to_string(*number));
            else
                appendElement("integer", std::to_string(*value.uint64()));
            return true;
        case Kind::real: appendElement("real", realText(*value.real())); return true;
        case Kind::date:
            if (!linux_::isEncodableDate(*value.date())) return fail("a date outside the years 1 to 9999");
            appendElement("date", dateText(*value.date()));
            return true;
        case Kind::string: return appendText("string", *value.string());
        case Kind::data:
            // The library counts in int and the text is a third longer.
            if (value.data()->size() > INT_MAX / 2) return fail("data of 1 GiB or more");
            appendElement("data", base64(*value.data()));
            return true;
        case Kind::array: return appendArray(*value.array(), depth);
        case Kind::dictionary: return appendDictionary(*value.dictionary(), depth);
        }
        return false;
    }

    void appendElement(std::string_view name, std::string_view text) {
        _out.append("<").append(name).append(">").append(text).append("</").append(name).append(">\n");
    }

    static std::string realText(double number) {
        if (std::isnan(number)) return "nan"; // without the sign that some have
        char digits[32];
        return {digits, std::to_chars(digits, digits + sizeof digits, number).ptr};
    }

    /// The two that XML excludes besides control characters.
    static bool isNoncharacter(std::string_view character) { return character == "\uFFFE" || character == "\uFFFF"; }

    bool appendText(std::string_view element, std::string_view text) {
        _out.append("<").append(element).append(">");
        for (std::size_t at = 0; at < text.size(); ++at) {
            const char c = text[at];
            switch (c) {
            case '&': _out += "&amp;"; break;
            case '<': _out += "&lt;"; break;
            case '>': _out += "&gt;"; break;   // else "]]>" could come out
            case '\r': _out += "&#13;"; break; // a bare one would be read as a newline
            default:
                if (static_cast<unsigned char>(c) < 0x20 && c != '\t' && c != '\n') return fail("a control character");
                if (c == '\xEF' && isNoncharacter(text.substr(at, 3))) return fail("a noncharacter");
                _out += c;
            }
        }
        _out.append("</").append(element).append(">\n");
        return true;
    }

    bool appendArray(const Array& array, std::size_t depth) {
        if (depth == maximumNesting) return fail("containers nested too deep");
        if (array.empty()) {
            _out += "<array/>\n";
            return true;
        }
        _out += "<array>\n";
        for (std::size_t i = 0; i < array.size(); ++i) {
            if (append(array[i], depth + 1)) continue;
            _place.insert(0, "/" + std::to_string(i));
            return false;
        }
        indent(depth);
        _out += "</array>\n";
        return true;
    }

    bool appendDictionary(const Dictionary& dictionary, std::size_t depth) {
        if (depth == maximumNesting) return fail("containers nested too deep");
        if (dictionary.empty()) {
            _out += "<dict/>\n";
            return true;
        }
        _out += "<dict>\n";
        for (const auto& entry : dictionary) {
            indent(depth + 1);
            if (appendText("key", entry.name()) && append(entry.value, depth + 1)) continue;
            _place.insert(0, "/" + std::string(entry.name()));
            return false;
        }
        indent(depth);
        _out += "</dict>\n";
        return true;
    }

    std::string _out;
    std::string _problem;
    std::string _place; // keys and indexes that lead to the problem
};

enum class Element { vlist, dictionary, array, key, string, integer, real, yes, no, data, date };

constexpr std::pair<std::string_view, Element> elements[] = {
    {"vlist", Element::vlist},   {"dict", Element::dictionary}, {"array", Element::array}, {"key", Element::key},
    {"string", Element::string}, {"integer", Element::integer}, {"real", Element::real},   {"true", Element::yes},
    {"false", Element::no},      {"data", Element::data},       {"date", Element::date},
};

bool isBlank(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
    while (!text.empty() && isBlank(text.back())) text.remove_suffix(1);
    return text;
}

class XMLReader {
public:
    explicit XMLReader(std::size_t maximum) : _parser(XML_ParserCreate("UTF-8")), _maximumNesting(maximum) {}
    ~XMLReader() { XML_ParserFree(_parser); }
    XMLReader(const XMLReader&) = delete;
    XMLReader& operator=(const XMLReader&) = delete;

    Result<Value> read(std::string_view bytes) {
        if (bytes.size() > INT_MAX) return codingError(CodingError::malformed, "the file is too large");
        XML_SetUserData(_parser, this);
        XML_SetXmlDeclHandler(_parser, [](void* self, const XML_Char*, const XML_Char* encoding, int) {
            static_cast<XMLReader*>(self)->declaration(encoding);
        });
        // A document type could define entities, and entities could grow without bound.
        XML_SetDoctypeDeclHandler(
            _parser,
            [](void* self, const XML_Char*, const XML_Char*, const XML_Char*, int) {
                static_cast<XMLReader*>(self)->fail("a document type");
            },
            [](void*) {});
        XML_SetElementHandler(
            _parser,
            [](void* self, const XML_Char* name, const XML_Char** attributes) {
                static_cast<XMLReader*>(self)->start(name, attributes);
            },
            [](void* self, const XML_Char*) { static_cast<XMLReader*>(self)->end(); });
        XML_SetCharacterDataHandler(_parser, [](void* self, const XML_Char* text, int length) {
            static_cast<XMLReader*>(self)->text({text, static_cast<std::size_t>(length)});
        });
        if (XML_Parse(_parser, bytes.data(), static_cast<int>(bytes.size()), XML_TRUE) != XML_STATUS_OK)
            fail(XML_ErrorString(XML_GetErrorCode(_parser)));
        if (_problem) return codingError(CodingError::malformed, std::move(*_problem));
        return std::move(_frames.front().values.front());
    }

private:
    /// An element that has begun. That of the document stays, with the one value in it.
    struct Frame {
        Element element;
        std::vector<Value> values;              // of vlist and array
        std::vector<Dictionary::Entry> entries; // of dict; the value of the last one is absent when only its key came
        std::string text;                       // of the others

        bool awaitsValue() const { return !entries.empty() && !entries.back().value; }
    };

    static bool isContainer(Element element) { return element == Element::array || element == Element::dictionary; }

    void fail(std::string_view what) {
        if (_problem) return; // the first one is the cause of those that follow
        _problem = std::string(what) + " in line " + std::to_string(XML_GetCurrentLineNumber(_parser));
        XML_StopParser(_parser, XML_FALSE);
    }

    void declaration(const char* encoding) {
        if (encoding == nullptr) return;
        std::string name(encoding);
        for (char& c : name)
            if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
        if (name != "utf-8") fail("an encoding other than UTF-8");
    }

    void start(std::string_view name, const char** attributes) {
        if (_problem) return;
        const auto* known = std::begin(elements);
        while (known != std::end(elements) && known->first != name) ++known;
        if (known == std::end(elements)) return fail("an unknown element");
        const Element element = known->second;
        for (; *attributes != nullptr; attributes += 2)
            if (element != Element::vlist || std::string_view(*attributes) != "version")
                return fail("an unknown attribute");

        if (_frames.empty()) {
            if (element != Element::vlist) return fail("another root element than vlist");
        } else if (!accept(element)) {
            return;
        }
        if (isContainer(element) && _nesting++ == _maximumNesting) return fail("containers nested too deep");
        _frames.push_back({element, {}, {}, {}});
    }

    /// Whether `element` may stand where the reader is; fails otherwise.
    bool accept(Element element) {
        const Frame& parent = _frames.back();
        const char* problem = nullptr;
        switch (parent.element) {
        case Element::vlist:
            if (!parent.values.empty())
                problem = "a second value";
            else if (element == Element::key)
                problem = "a key outside a dictionary";
            break;
        case Element::array:
            if (element == Element::key) problem = "a key outside a dictionary";
            break;
        case Element::dictionary:
            if (element == Element::key && parent.awaitsValue())
                problem = "a key without a value";
            else if (element != Element::key && !parent.awaitsValue())
                problem = "a value without a key";
            break;
        default: problem = "an element inside text";
        }
        if (element == Element::vlist) problem = "a vlist inside another";
        if (problem != nullptr) fail(problem);
        return problem == nullptr;
    }

    void text(std::string_view text) {
        if (_problem || _frames.empty()) return;
        Frame& frame = _frames.back();
        switch (frame.element) {
        case Element::vlist:
        case Element::array:
        case Element::dictionary:
        case Element::yes:
        case Element::no:
            if (!trimmed(text).empty()) fail("text where none belongs");
            break;
        default: frame.text += text;
        }
    }

    void end() {
        if (_problem) return;
        Frame& frame = _frames.back();
        if (frame.element == Element::vlist) {
            if (frame.values.empty()) fail("a vlist without a value");
            return;
        }
        Value value = valueOf(frame);
        if (_problem) return;
        if (isContainer(frame.element)) --_nesting;
        const bool isKey = frame.element == Element::key;
        _frames.pop_back();
        Frame& parent = _frames.back();
        if (isKey)
            parent.entries.push_back({std::move(value), {}});
        else if (parent.element == Element::dictionary)
            parent.entries.back().value = std::move(value);
        else
            parent.values.push_back(std::move(value));
    }

    /// The value of a finished element; absent after a failure.
    Value valueOf(Frame& frame) {
        switch (frame.element) {
        case Element::vlist: break;
        case Element::key:
        case Element::string: return frame.text;
        case Element::yes: return true;
        case Element::no: return false;
        case Element::integer: return integer(trimmed(frame.text));
        case Element::real: return real(trimmed(frame.text));
        case Element::data: {
            std::erase_if(frame.text, isBlank);
            if (const auto bytes = base64Decoded(frame.text)) return Value::data(*bytes);
            fail("data that is not base64");
            break;
        }
        case Element::date:
            if (const auto date = dateFromText(trimmed(frame.text))) return *date;
            fail("a date that is not of the form 2026-11-22T21:00:00Z");
            break;
        case Element::array: return Array(std::move(frame.values));
        case Element::dictionary: {
            if (frame.awaitsValue()) {
                fail("a key without a value");
                break;
            }
            if (auto dictionary = Dictionary::fromUniqueEntries(std::move(frame.entries))) return *dictionary;
            fail("a dictionary with equal keys that ends");
            break;
        }
        }
        return {};
    }

    Value integer(std::string_view text) {
        const char* end = text.data() + text.size();
        std::int64_t number = 0;
        if (const auto parsed = std::from_chars(text.data(), end, number);
            parsed.ec == std::errc() && parsed.ptr == end)
            return number;
        std::uint64_t large = 0;
        const auto parsed = std::from_chars(text.data(), end, large);
        if (parsed.ec == std::errc() && parsed.ptr == end) return large;
        fail(parsed.ec == std::errc::result_out_of_range ? "an integer out of range" : "an integer that is none");
        return {};
    }

    Value real(std::string_view text) {
        const char* end = text.data() + text.size();
        double number = 0;
        const auto parsed = std::from_chars(text.data(), end, number);
        if (parsed.ec == std::errc() && parsed.ptr == end)
            return std::isnan(number) ? std::numeric_limits<double>::quiet_NaN() : number;
        fail(parsed.ec == std::errc::result_out_of_range ? "a real out of range" : "a real that is none");
        return {};
    }

    const XML_Parser _parser;
    const std::size_t _maximumNesting;
    std::vector<Frame> _frames;
    std::size_t _nesting = 0;
    std::optional<std::string> _problem;
};

} // namespace

Result<std::string> encodeXML(const Value& value) { return XMLWriter().write(value); }

Result<Value> decodePropertyList(std::string_view bytes, std::size_t nesting) {
    if (bytes.starts_with(compactMagic)) return linux_::decodeCompactFile(bytes, nesting);
    return XMLReader(nesting).read(bytes);
}

} // namespace platform
