#include "platform/Url.h"

#include <cstddef>
#include <utility>

namespace platform {

namespace {

bool isLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
bool isDigit(char c) { return c >= '0' && c <= '9'; }

int hexDigit(char c) {
    if (isDigit(c)) return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

bool equalsIgnoringCase(std::string_view text, std::string_view lowerCase) {
    if (text.size() != lowerCase.size()) return false;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i] >= 'A' && text[i] <= 'Z' ? static_cast<char>(text[i] - 'A' + 'a') : text[i];
        if (c != lowerCase[i]) return false;
    }
    return true;
}

std::string_view withoutTrailingSeparators(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
    return path;
}

/// Everything but unreserved characters and separators is escaped; a colon too, so that a relative path never
/// reads as a scheme.
void appendEscaped(std::string& out, std::string_view path) {
    static constexpr char digits[] = "0123456789ABCDEF";
    for (const char c : path) {
        if (isLetter(c) || isDigit(c) || c == '-' || c == '.' || c == '_' || c == '~' || c == '/') {
            out += c;
            continue;
        }
        const auto byte = static_cast<unsigned char>(c);
        out += '%';
        out += digits[byte >> 4U];
        out += digits[byte & 0x0FU];
    }
}

/// None for a broken escape and for an escaped NUL, which no path can hold.
std::optional<std::string> unescaped(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            out += text[i];
            continue;
        }
        if (text.size() - i < 3) return std::nullopt;
        const int high = hexDigit(text[i + 1]);
        const int low = hexDigit(text[i + 2]);
        if (high < 0 || low < 0 || high + low == 0) return std::nullopt;
        out += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return out;
}

/// The length of the scheme at the start of `text`, without its colon; 0 when there is none.
std::size_t schemeLength(std::string_view text) {
    if (text.empty() || !isLetter(text.front())) return 0;
    for (std::size_t i = 1; i < text.size(); ++i) {
        if (text[i] == ':') return i;
        if (!isLetter(text[i]) && !isDigit(text[i]) && text[i] != '+' && text[i] != '-' && text[i] != '.') return 0;
    }
    return 0;
}

/// The text of the URL of a path.
std::string textOf(std::string_view path) {
    std::string text = path.starts_with('/') ? "file://" : "";
    appendEscaped(text, path);
    return text;
}

/// What stands before a query or fragment.
std::string_view withoutQuery(std::string_view text) { return text.substr(0, text.find_first_of("?#")); }

} // namespace

URL::URL(std::string text, std::string path, bool isFile)
    : _text(text.empty() || text == textOf(path) ? std::string() : std::move(text)),
      _path(std::move(path)),
      _isFile(isFile) {}

std::string URL::absoluteString() const { return _text.empty() ? textOf(_path) : _text; }

URL URL::file(std::string_view path) {
    path = withoutTrailingSeparators(path);
    return URL({}, std::string(path), path.starts_with('/'));
}

std::optional<URL> URL::parse(std::string_view text) {
    if (text.empty()) return std::nullopt;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (byte <= 0x20 || byte == 0x7F) return std::nullopt;
    }
    if (!unescaped(text)) return std::nullopt;

    std::string_view rest = withoutQuery(text);
    const std::size_t length = schemeLength(rest);
    const std::string_view scheme = rest.substr(0, length);
    if (length > 0) rest.remove_prefix(length + 1);
    std::string_view host;
    if (rest.starts_with("//")) {
        rest.remove_prefix(2);
        host = rest.substr(0, rest.find('/'));
        rest.remove_prefix(host.size());
    }
    const bool isFile = equalsIgnoringCase(scheme, "file") && rest.starts_with('/') &&
                        (host.empty() || equalsIgnoringCase(host, "localhost"));
    std::string path = *unescaped(rest);
    path.resize(withoutTrailingSeparators(path).size());
    return URL(std::string(text), std::move(path), isFile);
}

URL URL::appending(std::string_view component) const {
    const std::string whole = absoluteString();
    const std::string_view base = withoutQuery(whole);
    std::string text(base);
    if (!text.ends_with('/')) text += '/';
    appendEscaped(text, component);
    text += std::string_view(whole).substr(base.size());

    std::string path = _path;
    if (!path.ends_with('/')) path += '/';
    path += component;
    path.resize(withoutTrailingSeparators(path).size());
    return URL(std::move(text), std::move(path), _isFile);
}

} // namespace platform
