#include "platform/linux/Entitlements.h"
#include "platform/linux/Files.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <iostream>

namespace zbctl {

using platform::Dictionary;
using platform::Failure;
using platform::MutableDictionary;
using platform::Result;

namespace {

struct Signing {
    std::string file;
    std::optional<std::string> entitlements; // a property-list file
    std::vector<std::string> settings;       // KEY or KEY=VALUE
    bool show = false;
    bool remove = false;
};

ExitStatus finish(const std::string& file, const Failure& failure) {
    if (!failure) return ExitStatus::success;
    complain(file + ": " + failure->text());
    return ExitStatus::failure;
}

Result<MutableDictionary> entitlementsOf(const Signing& signing, const std::vector<Setting>& settings) {
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
    for (const auto& setting : settings) entitlements.set(setting.key, setting.value);
    return entitlements;
}

ExitStatus show(const Invocation& invocation, const std::string& file) {
    const auto entitlements = platform::linux_::readEntitlements(file);
    if (!entitlements) return finish(file, entitlements.error());
    const Dictionary shown = entitlements->value_or(Dictionary());
    if (invocation.json)
        printJson(std::cout, shown);
    else
        printTree(std::cout, shown);
    return ExitStatus::success;
}

ExitStatus sign(const Invocation& invocation, const Signing& signing) {
    if (signing.show) return show(invocation, signing.file);
    if (signing.remove) return finish(signing.file, platform::linux_::removeEntitlements(signing.file));
    std::vector<Setting> settings;
    for (const auto& text : signing.settings) {
        auto setting = settingOf(text);
        if (!setting) return ExitStatus::usage;
        settings.push_back(*std::move(setting));
    }
    const auto entitlements = entitlementsOf(signing, settings);
    if (!entitlements) return finish(signing.file, entitlements.error());
    return finish(signing.file, platform::linux_::writeEntitlements(signing.file, *entitlements));
}

} // namespace

void addSign(CLI::App& app, Invocation& invocation) {
    auto* verb = app.add_subcommand("sign", "Write the entitlements of a program");
    const auto signing = std::make_shared<Signing>();
    verb->add_option("FILE", signing->file, "The program, or a bundle's executable")->required();
    auto* what = verb->add_option_group("what");
    auto* file = addText(what, "--entitlements", signing->entitlements, "A property list with all of them");
    auto* setting = what->add_option("-e", signing->settings, "One entitlement: KEY, KEY=true, KEY=false or KEY=TEXT")
                        ->type_name("KEY[=VALUE]")
                        ->allow_extra_args(false);
    auto* show = what->add_flag("--show", signing->show, "Print them")->excludes(file)->excludes(setting);
    what->add_flag("--remove", signing->remove, "Remove them all")->excludes(file)->excludes(setting)->excludes(show);
    what->require_option(1, 0);
    verb->callback([=, &invocation] { invocation.status = sign(invocation, *signing); });
}

} // namespace zbctl
