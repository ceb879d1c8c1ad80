#pragma once

#include "platform/Error.h"
#include "platform/PropertyList.h"
#include "platform/Url.h"
#include "platform/Uuid.h"

#include <array>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <ranges>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>

/// The format language of the system log, parsed and checked against its arguments when the program is compiled:
///
///   %d %i %u %x   an integer of any width; the length marks h hh l ll z j t are read and mean nothing
///   %s            a text
///   %@            an object: a text, UUID, URL, Error or property-list value, anything with `description()`, a range
///   of
///                 these, or a pointer or optional to one
///   %p            the address of the argument (of what it points to, when it is a pointer)
///   %.16P         the 16 bytes of a UUID
///   %%            a percent sign
///
/// Options stand in braces behind the percent sign, separated by commas: "public" and "private" say who may read the
/// argument, "errno" prints an error number with its text, "uuid_t" stands with %.16P.
/// Null pointers and empty optionals print "(null)".
namespace platform {

/// Where lists stop being printed, in bytes of one argument's text.
inline constexpr std::size_t maximumListDescription = 4096; // a log line is for people; what is longer is cut anyway

enum class FormatFault {
    none,
    unknownConversion,
    unknownOption,
    tooFewArguments,
    tooManyArguments,
    wrongKindOfArgument,
    unprintableArgument,
};

namespace detail {

enum class ArgumentKind : std::uint8_t { integer, text, object, uuid, bytes, pointer, unprintable };

/// One step through a format text: the plain text before a directive, and the directive.
struct Directive {
    std::string_view plain;
    char conversion = 0; // one of d u x s @ p P; '%' for a percent sign; 0 at the end of the text
    bool isPublic = false;
    bool isPrivate = false;
    bool isErrno = false;
    bool isUUID = false;
    FormatFault fault = FormatFault::none;
};

/// Takes the next step off the front of `rest`.
constexpr Directive nextDirective(std::string_view& rest) {
    Directive directive;
    const std::size_t percent = rest.find('%');
    directive.plain = rest.substr(0, percent);
    if (percent == std::string_view::npos) {
        rest = {};
        return directive;
    }
    rest.remove_prefix(percent + 1);

    if (rest.starts_with('{')) {
        const std::size_t end = rest.find('}');
        if (end == std::string_view::npos) {
            directive.fault = FormatFault::unknownOption;
            return directive;
        }
        std::string_view options = rest.substr(1, end - 1);
        rest.remove_prefix(end + 1);
        while (!options.empty()) {
            const std::size_t comma = options.find(',');
            std::string_view option = options.substr(0, comma);
            while (option.starts_with(' ')) option.remove_prefix(1);
            if (option == "public")
                directive.isPublic = true;
            else if (option == "private")
                directive.isPrivate = true;
            else if (option == "errno")
                directive.isErrno = true;
            else if (option == "uuid_t")
                directive.isUUID = true;
            else
                directive.fault = FormatFault::unknownOption;
            options = comma == std::string_view::npos ? std::string_view() : options.substr(comma + 1);
        }
    }

    const bool isSixteenBytes = rest.starts_with(".16");
    if (isSixteenBytes) rest.remove_prefix(3);
    bool hasLength = false;
    while (!rest.empty() && std::string_view("hlzjt").find(rest.front()) != std::string_view::npos) {
        hasLength = true;
        rest.remove_prefix(1);
    }

    directive.conversion = rest.empty() ? '\0' : rest.front();
    if (!rest.empty()) rest.remove_prefix(1);
    if (directive.conversion == 'i') directive.conversion = 'd';
    const bool isInteger =
        directive.conversion != 0 && std::string_view("dux").find(directive.conversion) != std::string_view::npos;
    const bool isKnown = isInteger || (directive.conversion != 0 &&
                                       std::string_view("s@pP%").find(directive.conversion) != std::string_view::npos);
    if (directive.fault != FormatFault::none) return directive;
    if (!isKnown || (hasLength && !isInteger) || isSixteenBytes != (directive.conversion == 'P'))
        directive.fault = FormatFault::unknownConversion;
    else if (directive.isUUID != (directive.conversion == 'P') || (directive.isErrno && directive.conversion != 'd'))
        directive.fault = FormatFault::unknownOption;
    return directive;
}

constexpr bool fits(char conversion, ArgumentKind kind) {
    switch (conversion) {
    case 's': return kind == ArgumentKind::text;
    case '@': return kind == ArgumentKind::text || kind == ArgumentKind::object || kind == ArgumentKind::uuid;
    case 'p': return kind != ArgumentKind::integer;
    case 'P': return kind == ArgumentKind::uuid || kind == ArgumentKind::bytes;
    default: return kind == ArgumentKind::integer;
    }
}

constexpr FormatFault findFault(std::string_view text, std::span<const ArgumentKind> kinds) {
    std::size_t used = 0;
    while (!text.empty()) {
        const Directive directive = nextDirective(text);
        if (directive.fault != FormatFault::none) return directive.fault;
        if (directive.conversion == 0 || directive.conversion == '%') continue;
        if (used == kinds.size()) return FormatFault::tooFewArguments;
        if (kinds[used] == ArgumentKind::unprintable) return FormatFault::unprintableArgument;
        if (!fits(directive.conversion, kinds[used])) return FormatFault::wrongKindOfArgument;
        ++used;
    }
    return used == kinds.size() ? FormatFault::none : FormatFault::tooManyArguments;
}

template <class T>
concept Text = std::convertible_to<const T&, std::string_view> && !std::same_as<T, std::nullptr_t>;

template <class T>
concept SelfDescribing = requires(const T& object) {
    { object.description() } -> std::convertible_to<std::string>;
};

template <class T>
concept PropertyListValue = std::same_as<T, Value> || std::derived_from<T, Array> || std::derived_from<T, Dictionary>;

template <class T> struct Pointee {
    using Type = void;
};
template <class T> struct Pointee<T*> {
    using Type = std::remove_cv_t<T>;
};
template <class T> struct Pointee<std::shared_ptr<T>> {
    using Type = std::remove_cv_t<T>;
};
template <class T, class Deleter> struct Pointee<std::unique_ptr<T, Deleter>> {
    using Type = std::remove_cv_t<T>;
};
template <class T> struct Pointee<std::optional<T>> {
    using Type = std::remove_cv_t<T>;
};

template <class T> consteval ArgumentKind argumentKind() {
    if constexpr (std::integral<T> || std::is_enum_v<T>)
        return ArgumentKind::integer;
    else if constexpr (std::same_as<T, UUID>)
        return ArgumentKind::uuid;
    else if constexpr (std::same_as<T, std::array<std::uint8_t, 16>>)
        return ArgumentKind::bytes;
    else if constexpr (std::same_as<T, std::nullptr_t>)
        return ArgumentKind::object;
    else if constexpr (Text<T>)
        return ArgumentKind::text;
    else if constexpr (!std::is_void_v<typename Pointee<T>::Type>) {
        constexpr ArgumentKind kind = argumentKind<typename Pointee<T>::Type>();
        if constexpr (kind == ArgumentKind::text)
            return ArgumentKind::text;
        else if constexpr (kind == ArgumentKind::object || kind == ArgumentKind::uuid)
            return ArgumentKind::object;
        else
            return std::is_pointer_v<T> ? ArgumentKind::pointer : ArgumentKind::unprintable;
    } else if constexpr (std::is_pointer_v<T>)
        return ArgumentKind::pointer;
    else if constexpr (PropertyListValue<T> || std::same_as<T, URL> || std::same_as<T, Error> || SelfDescribing<T>)
        return ArgumentKind::object;
    else if constexpr (std::ranges::input_range<const T>) {
        constexpr ArgumentKind kind = argumentKind<std::remove_cvref_t<std::ranges::range_reference_t<const T>>>();
        const bool isPrintable =
            kind == ArgumentKind::text || kind == ArgumentKind::object || kind == ArgumentKind::uuid;
        return isPrintable ? ArgumentKind::object : ArgumentKind::unprintable;
    } else
        return ArgumentKind::unprintable;
}

/// Appends the text that %@ and %s print. Lists stop once `out` is `end` bytes long.
template <class T> void appendDescription(std::string& out, const T& value, std::size_t end) {
    if constexpr (std::same_as<T, std::nullptr_t>) {
        out += "(null)";
    } else if constexpr (std::same_as<T, UUID>) {
        out += value.text();
    } else if constexpr (Text<T>) {
        if constexpr (std::is_pointer_v<T>) {
            if (!value) {
                out += "(null)";
                return;
            }
        }
        out += std::string_view(value);
    } else if constexpr (!std::is_void_v<typename Pointee<T>::Type>) {
        if (value)
            appendDescription(out, *value, end);
        else
            out += "(null)";
    } else if constexpr (std::same_as<T, Value>) {
        value.describeTo(out);
    } else if constexpr (PropertyListValue<T>) {
        Value(value).describeTo(out);
    } else if constexpr (std::same_as<T, URL>) {
        out += value.absoluteString();
    } else if constexpr (std::same_as<T, Error>) {
        out += value.text();
    } else if constexpr (SelfDescribing<T>) {
        out += value.description();
    } else {
        out += '(';
        bool isFirst = true;
        for (const auto& element : value) {
            if (!isFirst) out += ", ";
            isFirst = false;
            if (out.size() >= end) {
                out += "...";
                break;
            }
            appendDescription(out, element, end);
        }
        out += ')';
    }
}

template <class T> const void* addressForLog(const T& value) {
    if constexpr (std::same_as<T, std::nullptr_t>)
        return nullptr;
    else if constexpr (std::is_pointer_v<T>)
        return value;
    else if constexpr (std::is_array_v<T>)
        return &value[0];
    else if constexpr (!std::is_void_v<typename Pointee<T>::Type>)
        return value ? std::addressof(*value) : nullptr;
    else
        return std::addressof(value);
}

// Never defined: calling one while compiling is the error message.
void formatTextHasAnUnknownConversion();
void formatTextHasAnUnknownOption();
void formatTextHasTooFewArguments();
void formatTextHasTooManyArguments();
void formatTextDoesNotFitTheKindOfAnArgument();
void formatTextCannotPrintAnArgumentOfThisType();

} // namespace detail

/// What is wrong with `text` for arguments of these types.
template <class... Args> constexpr FormatFault formatFault(std::string_view text) {
    constexpr std::array<detail::ArgumentKind, sizeof...(Args)> kinds{detail::argumentKind<Args>()...};
    return detail::findFault(text, kinds);
}

/// A format text that fits arguments of these types: one that does not is an error when compiled.
template <class... Args> class FormatString {
public:
    template <std::size_t Size>
    consteval FormatString(const char (&text)[Size]) : _text(text, Size - 1) { // NOLINT(google-explicit-constructor)
        switch (formatFault<Args...>(_text)) {
        case FormatFault::none: break;
        case FormatFault::unknownConversion: detail::formatTextHasAnUnknownConversion(); break;
        case FormatFault::unknownOption: detail::formatTextHasAnUnknownOption(); break;
        case FormatFault::tooFewArguments: detail::formatTextHasTooFewArguments(); break;
        case FormatFault::tooManyArguments: detail::formatTextHasTooManyArguments(); break;
        case FormatFault::wrongKindOfArgument: detail::formatTextDoesNotFitTheKindOfAnArgument(); break;
        case FormatFault::unprintableArgument: detail::formatTextCannotPrintAnArgumentOfThisType(); break;
        }
    }

    constexpr std::string_view text() const { return _text; }

private:
    std::string_view _text;
};

/// One argument without its type. Refers to the argument; good as long as that is.
class FormatArgument {
public:
    template <class T> explicit FormatArgument(const T& value) {
        if constexpr (std::is_enum_v<T>) {
            setInteger(static_cast<std::underlying_type_t<T>>(value));
        } else if constexpr (std::integral<T>) {
            setInteger(value);
        } else {
            _object = std::addressof(value);
            _address = detail::addressForLog(value);
            if constexpr (constexpr auto kind = detail::argumentKind<T>();
                          kind != detail::ArgumentKind::pointer && kind != detail::ArgumentKind::bytes)
                _append = [](std::string& out, const void* object, std::size_t end) {
                    detail::appendDescription(out, *static_cast<const T*>(object), end);
                };
        }
    }

    void appendSigned(std::string& out) const;
    void appendUnsigned(std::string& out) const;
    void appendHexadecimal(std::string& out) const;
    void appendErrorNumber(std::string& out) const;
    void appendDescription(std::string& out) const { _append(out, _object, out.size() + maximumListDescription); }
    void appendAddress(std::string& out) const;
    void appendUUID(std::string& out) const;

private:
    template <std::integral T> void setInteger(T value) {
        _isNegative = std::signed_integral<T> && value < T{};
        // Widened with its sign, so that %d prints it as it is; and cut to its own width for %u and %x.
        _bits = static_cast<std::uint64_t>(value);
        _width = sizeof(T);
    }
    std::uint64_t ownBits() const {
        return _width == sizeof _bits ? _bits : _bits & ((std::uint64_t{1} << (8U * _width)) - 1);
    }

    std::uint64_t _bits = 0;
    const void* _object = nullptr;
    const void* _address = nullptr;
    void (*_append)(std::string& out, const void* object, std::size_t end) = nullptr;
    std::uint8_t _width = 0;
    bool _isNegative = false;
};

enum class PrivateArguments { shown, hidden };

/// The engine below `format` and the log. `text` fits `arguments`. With `hidden`, texts and objects that are not
/// marked public, and whatever is marked private, print as "<private>" and are not asked for their description.
std::string formatArguments(std::string_view text, std::span<const FormatArgument> arguments, PrivateArguments privacy);

/// The text with its arguments, nothing hidden: for error texts and descriptions.
template <class... Args> std::string format(FormatString<std::type_identity_t<Args>...> text, const Args&... args) {
    const std::array<FormatArgument, sizeof...(Args)> arguments{FormatArgument(args)...};
    return formatArguments(text.text(), arguments, PrivateArguments::shown);
}

} // namespace platform
