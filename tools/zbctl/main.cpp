#include "Zembra/ZBProtocol.h"
#include "platform/linux/SystemLog.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <CLI/Config.hpp>
#include <CLI/Formatter.hpp>
#include <csignal>
#include <cstdlib>
#include <optional>
#include <string>

#ifndef ZBD_VERSION
#define ZBD_VERSION "unknown"
#endif

int main(int argc, char** argv) {
    using zbctl::addNumber;
    using zbctl::addText;
    using zbctl::ExitStatus;
    // The client's own log lines would only stand between a person and the answer.
    if (std::getenv(platform::linux_::logEnvironmentVariable) != nullptr)
        platform::setSystemLog(platform::linux_::SystemLog::ofProcess());
    (void)std::signal(SIGPIPE, SIG_IGN);

    CLI::App app("Asks zbd, the plug-in daemon. Set NORDANE_ROOT to ask the one of a scratch platform.", "zbctl");
    app.set_version_flag("--version", "zbctl " ZBD_VERSION);
    app.require_subcommand(1);
    app.fallthrough();
    app.footer("Exit status: 0 success, 1 an error reply or lost output, 2 wrong usage, 3 no daemon.");

    zbctl::Common common;
    ExitStatus status = ExitStatus::success;
    addText(&app, "--service", common.service, "Name of the daemon's service")->type_name("NAME");
    app.add_flag("--json", common.json, "Print JSON");

    std::vector<std::string> paths;
    auto* add = app.add_subcommand("add", "Register plug-in bundles");
    add->add_option("PATH", paths, "Plug-in bundles")->required();
    add->callback([&] { status = changeRegistration(common, zbctl::Registration::add, paths); });
    auto* remove = app.add_subcommand("remove", "Take plug-in bundles out of the registry (needs an entitlement)");
    remove->add_option("PATH", paths, "Plug-in bundles")->required();
    remove->callback([&] { status = changeRegistration(common, zbctl::Registration::remove, paths); });

    std::uint64_t flags = 0;
    auto* bulk = app.add_subcommand("bulk", "Send the bulk request, which changes nothing");
    addNumber(bulk, "--flags", [&](std::uint64_t number) { flags = number; }, "Options, decimal or 0x...");
    bulk->callback([&] { status = zbctl::bulk(common, flags); });

    zbctl::Location location;
    auto* find = app.add_subcommand("find", "Show one plug-in");
    addText(find, "--uuid", location.uuid, "The plug-in's UUID")->type_name("UUID");
    addText(find, "--url", location.url, "A file URL of its bundle")->type_name("URL");
    addText(find, "PATH", location.path, "The path of its bundle");
    find->require_option(1);
    find->callback([&] { status = zbctl::find(common, location); });

    std::string requestFile;
    auto* raw = app.add_subcommand("raw", "Send a request written by hand, and print the reply");
    raw->add_option("FILE", requestFile, "A property list (XML or compact) or JSON; - is standard input")->required();
    raw->footer("A dictionary of the one key $uuid, $data (base64) or $date (ISO 8601) stands for such a value:\n"
                "  {\"request\": \"find\", \"version\": 3, \"uuids\": {\"$uuid\": \"...\"}}");
    raw->callback([&] { status = zbctl::raw(common, requestFile); });

    zbctl::Signing signing;
    auto* sign = app.add_subcommand("sign", "Write the entitlements of a program");
    sign->add_option("FILE", signing.file, "The program, or a bundle's executable")->required();
    auto* what = sign->add_option_group("what");
    auto* file = addText(what, "--entitlements", signing.entitlements, "A property list with all of them");
    auto* setting = what->add_option("-e", signing.settings, "One entitlement: KEY, KEY=true, KEY=false or KEY=TEXT")
                        ->type_name("KEY[=VALUE]")
                        ->allow_extra_args(false);
    auto* show = what->add_flag("--show", signing.show, "Print them")->excludes(file)->excludes(setting);
    what->add_flag("--remove", signing.remove, "Remove them all")->excludes(file)->excludes(setting)->excludes(show);
    what->require_option(1, 0);
    sign->callback([&] { status = zbctl::sign(common, signing); });

    std::string notification = zembra::annotationChangeNotification;
    std::optional<std::uint64_t> count;
    auto* watch = app.add_subcommand("watch", "Print a line for each notification");
    watch->add_option("NAME", notification, "The notification")->capture_default_str();
    addNumber(watch, "--count", [&](std::uint64_t number) { count = number; }, "End after so many");
    watch->callback([&] { status = zbctl::watch(notification, count); });

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        status = app.exit(error) == 0 ? ExitStatus::success : ExitStatus::usage;
    }
    if (!zbctl::flushOutput() && status == ExitStatus::success) status = ExitStatus::failure;
    return static_cast<int>(status);
}
