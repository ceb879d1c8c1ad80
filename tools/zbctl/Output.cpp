#include "tools/zbctl/Output.h"

#include "Zembra/ZBProtocol.h"
#include "tools/zbctl/Json.h"

#include <algorithm>
#include <array>
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

using TableLine = std::array<std::string, 5>;
using TableWidths = std::array<std::size_t, 4>; // nothing follows the last column

/// In characters.
std::size_t width(const std::string& text) {
    return static_cast<std::size_t>(std::count_if(
        text.begin(), text.end(), [](char byte) { return (static_cast<unsigned char>(byte) & 0xc0U) != 0x80U; }));
}

std::string electionName(const Dictionary& form) {
    const auto annotations = form.dictionary(zembra::formKey::annotations);
    const Value election = annotations ? (*annotations)[zembra::annotationKey::election] : Value();
    if (!election || election == Value(electionNone)) return "-";
    if (election == Value(electionUse)) return "use";
    return election == Value(electionIgnore) ? "ignore" : printable(line(election));
}

TableLine tableLine(const Dictionary& form) {
    const auto text = [&](std::string_view key) { return printable(form.string(key).value_or("-")); };
    std::string path = text(zembra::formKey::path);
    if (form.contains(zembra::formKey::overriding)) path += "  (replaces " + text(zembra::formKey::overriding) + ')';
    if (form.contains(zembra::formKey::overrider)) path += "  (replaced by " + text(zembra::formKey::overrider) + ')';
    return {text(zembra::formKey::identifier), text(zembra::formKey::version), text(zembra::formKey::uuid),
            electionName(form), path};
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

void printPlugIns(std::ostream& out, const Array& forms) {
    if (forms.empty()) {
        out << "no plug-in matches\n";
        return;
    }
    std::vector<TableLine> lines{{"IDENTIFIER", "VERSION", "UUID", "ELECTION", "PATH"}};
    for (const Value& form : forms) lines.push_back(tableLine(form.dictionary().value_or(Dictionary())));
    TableWidths widths{};
    for (const auto& line : lines) {
        for (std::size_t i = 0; i < widths.size(); ++i) widths[i] = std::max(widths[i], width(line[i]));
    }
    for (const auto& line : lines) {
        for (std::size_t i = 0; i < widths.size(); ++i) {
            out << line[i] << std::string(widths[i] - width(line[i]) + indentation, ' ');
        }
        out << line.back() << '\n';
    }
}

ExitStatus finish(bool json, const platform::ReplyOrError& answer) {
    const ExitStatus status = report(answer);
    if (status == ExitStatus::success && json) printJson(std::cout, std::get<Dictionary>(answer));
    return status;
}

bool flushOutput() {
    std::cout.flush();
    if (!std::cout) complain("the output cannot be written");
    return static_cast<bool>(std::cout);
}

void complain(std::string_view text) { std::cerr << "zbctl: " << printable(text) << '\n'; }

} // namespace zbctl
