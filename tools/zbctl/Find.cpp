#include "tools/zbctl/Input.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <iostream>

namespace zbctl {

using zembra::ZBDaemonClient;

namespace {

/// One of them is given.
struct Location {
    std::optional<std::string> uuid;
    std::optional<std::string> url;
    std::optional<std::string> path;
};

ExitStatus find(const Invocation& invocation, const Location& location) {
    std::optional<platform::UUID> uuid;
    std::optional<platform::URL> url;
    if (location.uuid) {
        uuid = uuidOf(*location.uuid);
    } else if (location.url) {
        url = platform::URL::parse(*location.url);
        if (!url) complain('"' + *location.url + "\" is not a URL");
    } else if (const auto path = absolutePath(location.path.value_or(""))) {
        url = platform::URL::file(*path);
    }
    if (!uuid && !url) return ExitStatus::usage;
    Session session(invocation.service);
    const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        if (uuid)
            client.findPlugInByUUID(*uuid, std::move(callback));
        else
            client.findPlugInByPathURL(*url, std::move(callback));
    });
    if (const ExitStatus status = report(answer); status != ExitStatus::success) return status;
    const auto form = session.matches(answer).dictionary();
    if (!form) {
        complain("the reply describes no plug-in"); // "matches" is absent or not decodable
        return ExitStatus::failure;
    }
    if (invocation.json)
        printJson(std::cout, *form);
    else
        printForm(std::cout, *form);
    return ExitStatus::success;
}

} // namespace

void addFind(CLI::App& app, Invocation& invocation) {
    auto* verb = app.add_subcommand("find", "Show one plug-in");
    const auto location = std::make_shared<Location>();
    addText(verb, "--uuid", location->uuid, "The plug-in's UUID")->type_name("UUID");
    addText(verb, "--url", location->url, "A file URL of its bundle")->type_name("URL");
    addText(verb, "PATH", location->path, "The path of its bundle");
    verb->require_option(1);
    verb->callback([=, &invocation] { invocation.status = find(invocation, *location); });
}

} // namespace zbctl
