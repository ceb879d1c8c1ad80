#include "platform/Format.h"

#include <charconv>
#include <cstring>

namespace platform {

namespace {

template <class T> void appendNumber(std::string& out, T value, int base = 10) {
    std::array<char, 24> digits; // room for any 64-bit number in base 10 or 16
    const auto [end, error] = std::to_chars(digits.data(), digits.data() + digits.size(), value, base);
    out.append(digits.data(), end);
}

bool isHidden(const detail::Directive& directive) {
    if (directive.isPublic) return false;
    return directive.isPrivate || directive.conversion == 's' || directive.conversion == '@';
}

} // namespace

void FormatArgument::appendSigned(std::string& out) const {
    if (_isNegative)
        appendNumber(out, static_cast<std::int64_t>(_bits));
    else
        appendNumber(out, _bits);
}

void FormatArgument::appendUnsigned(std::string& out) const { appendNumber(out, ownBits()); }

void FormatArgument::appendHexadecimal(std::string& out) const { appendNumber(out, ownBits(), 16); }

void FormatArgument::appendErrorNumber(std::string& out) const {
    out += '[';
    appendSigned(out);
    out += ": ";
    std::array<char, 128> buffer;
    // The GNU variant: it answers the text, in the buffer only when the number is unknown.
    out += strerror_r(static_cast<int>(_bits), buffer.data(), buffer.size());
    out += ']';
}

void FormatArgument::appendAddress(std::string& out) const {
    if (!_address) {
        out += "(null)";
        return;
    }
    out += "0x";
    appendNumber(out, reinterpret_cast<std::uintptr_t>(_address), 16);
}

void FormatArgument::appendUUID(std::string& out) const {
    UUID uuid;
    std::memcpy(uuid.bytes.data(), _object, uuid.bytes.size());
    out += uuid.text();
}

std::string formatArguments(std::string_view text, std::span<const FormatArgument> arguments,
                            PrivateArguments privacy) {
    std::string out;
    out.reserve(256); // most lines; lists are longer
    auto argument = arguments.begin();
    while (!text.empty()) {
        const detail::Directive directive = detail::nextDirective(text);
        out += directive.plain;
        if (directive.conversion == '%') out += '%';
        if (directive.conversion == 0 || directive.conversion == '%') continue;
        const FormatArgument& current = *argument++;
        if (privacy == PrivateArguments::hidden && isHidden(directive)) {
            out += "<private>";
            continue;
        }
        switch (directive.conversion) {
        case 'd':
            if (directive.isErrno)
                current.appendErrorNumber(out);
            else
                current.appendSigned(out);
            break;
        case 'u': current.appendUnsigned(out); break;
        case 'x': current.appendHexadecimal(out); break;
        case 'p': current.appendAddress(out); break;
        case 'P': current.appendUUID(out); break;
        default: current.appendDescription(out); break;
        }
    }
    return out;
}

} // namespace platform
