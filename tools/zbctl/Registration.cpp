#include "tools/zbctl/Input.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

namespace zbctl {

using zembra::ZBDaemonClient;

namespace {

using Operation = void (ZBDaemonClient::*)(const std::vector<std::string>&, ZBDaemonClient::Callback);

ExitStatus changeRegistration(const Invocation& invocation, Operation operation,
                              const std::vector<std::string>& paths) {
    const auto absolute = absolutePaths(paths);
    if (!absolute) return ExitStatus::usage;
    Session session(invocation.service);
    return finish(invocation.json, session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        (client.*operation)(*absolute, std::move(callback));
    }));
}

void addChange(CLI::App& app, Invocation& invocation, const char* name, const char* description, Operation operation) {
    auto* verb = app.add_subcommand(name, description);
    const auto paths = std::make_shared<std::vector<std::string>>();
    verb->add_option("PATH", *paths, "Plug-in bundles")->required();
    verb->callback([=, &invocation] { invocation.status = changeRegistration(invocation, operation, *paths); });
}

ExitStatus bulk(const Invocation& invocation, std::uint64_t flags) {
    Session session(invocation.service);
    return finish(invocation.json, session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.bulkPlugins(flags, std::move(callback));
    }));
}

} // namespace

void addRegistration(CLI::App& app, Invocation& invocation) {
    addChange(app, invocation, "add", "Register plug-in bundles", &ZBDaemonClient::addPlugIns);
    addChange(app, invocation, "remove", "Take plug-in bundles out of the registry (needs an entitlement)",
              &ZBDaemonClient::removePlugIns);

    auto* verb = app.add_subcommand("bulk", "Send the bulk request, which changes nothing");
    const auto flags = std::make_shared<std::uint64_t>(0);
    addNumber(verb, "--flags", [=](std::uint64_t number) { *flags = number; }, "Options, decimal or 0x...");
    verb->callback([=, &invocation] { invocation.status = bulk(invocation, *flags); });
}

} // namespace zbctl
