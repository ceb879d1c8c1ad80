#include "tools/zbctl/Output.h"

#include "Zembra/ZBProtocol.h"
#include "tools/zbctl/Json.h"

#include <algorithm>
#include <iostream>

namespace zbctl {

using platform::Array;
using platform::Dictionary;
using platform::Kind;
using platform::Value;

namespace {

constexpr std::size_t indentation = 2;
constexpr std::size_t widestColumn = 32; // longer keys stand out rather than push all values aside

bool isContainer(const Value& value) { return value.kind() == Kind::array || value.kind() == Kind::dictionary; }

bool isEmptyContainer(const Value& value) {
    if (const auto array = value.array()) return array->empty();
    const auto dictionary = value.dictionary();
    return dictionary && dictionary->empty();
}

/// Containers without content fit a line as well.
bool fitsLine(const Value& value) { return !isContainer(value) || isEmptyContainer(value); }

std::string line(const Value& value) {
    switch (value.kind()) {
    case Kind::boolean: return *value.boolean() ? "true" : "false";
    case Kind::integer:
        if (const auto number = value.int64()) return std::to_string(*number);
        return std::to_string(*value.uint64());
    case Kind::real: return Json(*value.real()).dump(); // the shortest text that reads back as the same number
    case Kind::date: return plainText(value);
    case Kind::string: return printable(*value.string());
    case Kind::data: return "<" + std::to_string(value.data()->size()) + " bytes> " + plainText(value);
    case Kind::uuid: return value.uuid()->text();
    case Kind::array: return "(none)";
    case Kind::dictionary: return "{none}";
    case Kind::none: break;
    }
    return "";
}

void print(std::ostream& out, const Value& value, std::size_t indent);

void print(std::ostream& out, const Dictionary& dictionary, std::size_t indent) {
    const std::string margin(indent, ' ');
    std::size_t column = 0;
    for (const auto& entry : dictionary) {
        if (fitsLine(entry.value)) column = std::max(column, std::min(entry.name().size(), widestColumn));
    }
    for (const auto& entry : dictionary) {
        if (!fitsLine(entry.value)) continue;
        const std::string name = printable(entry.name());
        const std::size_t gap = name.size() < column ? column - name.size() : 0;
        out << margin << name << std::string(gap + indentation, ' ') << line(entry.value) << '\n';
    }
    for (const auto& entry : dictionary) {
        if (fitsLine(entry.value)) continue;
        out << margin << printable(entry.name()) << ":\n";
        print(out, entry.value, indent + indentation);
    }
}

void print(std::ostream& out, const Array& array, std::size_t indent) {
    const std::string margin(indent, ' ');
    for (const auto& element : array) {
        if (fitsLine(element)) {
            out << margin << "- " << line(element) << '\n';
        } else {
            out << margin << "-\n";
            print(out, element, indent + indentation);
        }
    }
}

void print(std::ostream& out, const Value& value, std::size_t indent) {
    if (fitsLine(value)) {
        out << std::string(indent, ' ') << line(value) << '\n';
    } else if (const auto array = value.array()) {
        print(out, *array, indent);
    } else if (const auto dictionary = value.dictionary()) {
        print(out, *dictionary, indent);
    }
}

} // namespace

std::string printable(std::string_view text) {
    constexpr std::string_view digits = "0123456789abcdef";
    std::string result;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (c == '\\') {
            result += "\\\\";
        } else if (byte < 0x20 || byte == 0x7f) {
            result += "\\x";
            result += digits[byte >> 4U];
            result += digits[byte & 0xfU];
        } else {
            result += c;
        }
    }
    // U+0080 to U+009F: some terminals obey these too. In UTF-8 they are C2 80 to C2 9F.
    for (std::size_t at = result.find('\xc2'); at != std::string::npos; at = result.find('\xc2', at + 1)) {
        if (at + 1 < result.size() && static_cast<unsigned char>(result[at + 1]) < 0xa0) result.replace(at, 2, "?");
    }
    return result;
}

void printJson(std::ostream& out, const Value& value) { out << toJson(value).dump(indentation) << '\n'; }

void printTree(std::ostream& out, const Value& value) { print(out, value, 0); }

void printForm(std::ostream& out, const Dictionary& form) {
    const auto name = form.string(zembra::formKey::localizedName);
    const auto identifier = form.string(zembra::formKey::identifier);
    out << printable(name.value_or(identifier.value_or("(unnamed plug-in)")));
    if (const auto version = form.string(zembra::formKey::version)) out << ' ' << printable(*version);
    out << '\n';
    print(out, form, indentation);
}

bool flushOutput() {
    std::cout.flush();
    if (!std::cout) complain("the output cannot be written");
    return static_cast<bool>(std::cout);
}

void complain(std::string_view text) { std::cerr << "zbctl: " << printable(text) << '\n'; }

} // namespace zbctl
