#include "platform/linux/Entitlements.h"
#include "platform/linux/Files.h"
#include "platform/linux/Utf8.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <iostream>

namespace zbctl {

using platform::Dictionary;
using platform::Failure;
using platform::MutableDictionary;
using platform::Result;
using platform::Value;

namespace {

ExitStatus finish(const std::string& file, const Failure& failure) {
    if (!failure) return ExitStatus::success;
    complain(file + ": " + failure->text());
    return ExitStatus::failure;
}

/// An entitlement without a name, or one that would be written as another text than was given, helps nobody.
bool isSetting(const std::string& setting) {
    return !setting.empty() && setting.front() != '=' && !platform::linux_::firstBadByte(setting);
}

/// "KEY" sets true, "KEY=true" and "KEY=false" booleans, "KEY=TEXT" a string.
void apply(const std::string& setting, MutableDictionary& entitlements) {
    const std::size_t separator = setting.find('=');
    const std::string text = separator == std::string::npos ? "true" : setting.substr(separator + 1);
    const Value value = text == "true" || text == "false" ? Value(text == "true") : Value(text);
    entitlements.set(setting.substr(0, separator), value);
}

Result<MutableDictionary> entitlementsOf(const Signing& signing) {
    MutableDictionary entitlements;
    if (signing.entitlements) {
        platform::linux_::Files files(platform::linux_::Root::ofProcess());
        const auto bytes = files.read(*signing.entitlements, platform::linux_::maximumEntitlementsSize);
        if (!bytes) return bytes.error();
        const auto value = platform::decodePropertyList(*bytes);
        if (!value) return value.error();
        const auto dictionary = value->dictionary();
        if (!dictionary)
            return platform::Error{platform::propertyListErrorDomain, 0, *signing.entitlements + ": not a dictionary"};
        entitlements.merge(*dictionary);
    }
    for (const auto& setting : signing.settings) apply(setting, entitlements);
    return entitlements;
}

ExitStatus show(const Common& common, const std::string& file) {
    const auto entitlements = platform::linux_::readEntitlements(file);
    if (!entitlements) return finish(file, entitlements.error());
    const Dictionary shown = entitlements->value_or(Dictionary());
    if (common.json)
        printJson(std::cout, shown);
    else
        printTree(std::cout, shown);
    return ExitStatus::success;
}

} // namespace

ExitStatus sign(const Common& common, const Signing& signing) {
    if (signing.show) return show(common, signing.file);
    if (signing.remove) return finish(signing.file, platform::linux_::removeEntitlements(signing.file));
    for (const auto& setting : signing.settings) {
        if (isSetting(setting)) continue;
        complain('"' + setting + "\" is not KEY or KEY=VALUE in UTF-8");
        return ExitStatus::usage;
    }
    const auto entitlements = entitlementsOf(signing);
    if (!entitlements) return finish(signing.file, entitlements.error());
    return finish(signing.file, platform::linux_::writeEntitlements(signing.file, *entitlements));
}

} // namespace zbctl
