#include "Zembra/ZBInterfaceUtilities.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBUtilities.h"

#include <algorithm>
#include <charconv>
#include <limits>
#include <set>
#include <utility>
#include <vector>

namespace zembra {

using platform::Failure;
using platform::Interface;
using platform::InterfaceDescription;
using platform::Interfaces;
using platform::InterfaceSide;
using platform::Value;

namespace {

/// The parts between separators: one more than there are separators.
std::vector<std::string_view> split(std::string_view text, char separator) {
    std::vector<std::string_view> parts;
    for (;;) {
        const std::size_t end = text.find(separator);
        parts.push_back(text.substr(0, end));
        if (end == std::string_view::npos) return parts;
        text.remove_prefix(end + 1);
    }
}

/// The decimal number at the front of `text`, after any blanks and one sign: 0 when there is none, the nearest
/// representable one when it is too large.
std::int64_t leadingNumber(std::string_view text) {
    using Limits = std::numeric_limits<std::int64_t>;
    text.remove_prefix(std::min(text.find_first_not_of(" \t\n\v\f\r"), text.size()));
    if (text.starts_with('+') && !text.starts_with("+-")) text.remove_prefix(1);
    std::int64_t number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error == std::errc::result_out_of_range) return text.starts_with('-') ? Limits::min() : Limits::max();
    return number;
}

platform::Error malformed(std::string_view quoted) {
    return errorWithCode(code::interfaceDescription, std::string(quoted));
}

Failure applyEntry(Interfaces& interfaces, InterfaceDescription& description, const std::string& operation,
                   std::string_view entry, std::string_view wholeText) {
    const auto parts = split(entry, ':');
    if (parts.size() != 3) return malformed(wholeText);
    const std::string_view side = parts[0];
    const std::string_view type = parts[2];
    if (side != "request" && side != "reply") return malformed(side);
    const InterfaceSide interfaceSide = side == "reply" ? InterfaceSide::reply : InterfaceSide::request;
    const std::int64_t argument = leadingNumber(parts[1]);

    if (!type.starts_with('{')) {
        auto interface = type.empty() ? nullptr : interfaceLookup(interfaces, std::string(type), nullptr);
        if (!interface) return malformed(type);
        description.setInterface(interfaces.describe(std::move(interface)), operation, argument, interfaceSide);
        return std::nullopt;
    }
    if (!type.ends_with('}')) return malformed(type);
    std::set<std::string> classes;
    for (const std::string_view name : split(type.substr(1, type.size() - 2), '+')) {
        if (!interfaces.isKnownClass(std::string(name))) return malformed(name);
        classes.emplace(name);
    }
    description.setClasses(classes, operation, argument, interfaceSide);
    return std::nullopt;
}

/// How an element of a compound's array names an interface. One that is no text goes by its printed form.
std::string nameOf(const Value& element) {
    const auto text = element.string();
    return text ? std::string(*text) : element.description();
}

} // namespace

std::shared_ptr<Interface> interfaceLookup(Interfaces& interfaces, const std::string& name, Failure* error) {
    if (auto found = interfaces.find(name)) return found;
    std::string text = platform::format(
        "unable to locate protocol \"%@\" - check that it is defined and not inadvertently optimized away", name);
    log::ops().notice("%@", text);
    if (error) *error = errorWithCode(code::configuration, std::move(text));
    return nullptr;
}

std::shared_ptr<Interface> compoundInterface(Interfaces& interfaces, const Value& nameOrNames, Failure* error) {
    if (const auto name = nameOrNames.string()) return interfaceLookup(interfaces, std::string(*name), error);
    const auto names = nameOrNames.array();
    if (!names) return nullptr;

    std::string compoundName = "__XX_COMPOUND";
    for (const Value& element : *names) compoundName += "__" + nameOf(element);

    if (auto compound = interfaces.create(compoundName)) {
        for (const Value& element : *names) {
            auto included = interfaceLookup(interfaces, nameOf(element), error);
            if (!included) return nullptr;
            compound->addIncluded(std::move(included));
        }
        return interfaces.registerInterface(std::move(compound)); // another thread's when that was faster
    }
    if (auto existing = interfaces.find(compoundName)) return existing;
    if (error) *error = errorWithCode(code::configuration, "unable to create compound protocol");
    return nullptr;
}

Failure interfaceClassSpecification(Interfaces& interfaces, InterfaceDescription& description,
                                    const std::string& operation, std::string_view classes) {
    if (classes.empty()) return std::nullopt;
    for (const std::string_view entry : split(classes, ',')) {
        if (auto error = applyEntry(interfaces, description, operation, entry, classes)) return error;
    }
    return std::nullopt;
}

} // namespace zembra
