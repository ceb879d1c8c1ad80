#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBSandboxExtension.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/Sandbox.h"
#include "tools/zbctl/Command.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <iostream>

namespace zbctl {

namespace key = zembra::key;
namespace linux_ = platform::linux_;
using platform::Array;
using platform::Dictionary;
using platform::MutableArray;
using platform::MutableDictionary;
using platform::UUID;
using zembra::ZBDaemonClient;

namespace {

struct Activation {
    std::vector<std::string> plugIns;
    std::vector<std::string> environment; // NAME=VALUE
    bool consume = false;
};

/// All values are texts here: "true" is what the variable is to hold.
std::optional<Dictionary> environmentOf(const std::vector<std::string>& words) {
    MutableDictionary environment;
    for (const auto& word : words) {
        const std::size_t separator = word.find('=');
        if (separator == std::string::npos) {
            complain('"' + word + "\" is not NAME=VALUE");
            return std::nullopt;
        }
        if (!settingOf(word)) return std::nullopt;
        environment.set(word.substr(0, separator), word.substr(separator + 1));
    }
    return environment;
}

ExitStatus ready(const Invocation& invocation, const Activation& activation) {
    std::optional<Dictionary> environment;
    if (!activation.environment.empty()) {
        environment = environmentOf(activation.environment);
        if (!environment) return ExitStatus::usage;
    }
    Session session(invocation.service);
    const auto uuids = uuidsOf(session, activation.plugIns);
    if (const auto* status = std::get_if<ExitStatus>(&uuids)) return *status;
    const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        auto message = client.request(zembra::requestType::ready);
        if (environment) message.set(key::environment, *environment);
        ZBDaemonClient::set(message, std::get<std::vector<UUID>>(uuids));
        client.send(message, std::move(callback));
    });
    if (invocation.command.empty()) return finish(invocation.json, answer);
    const ExitStatus status = report(answer);
    return status == ExitStatus::success ? static_cast<ExitStatus>(runCommand(invocation.command)) : status;
}

/// The names in the directory that the token opens, directories with a separator behind them; none when it opens none.
std::optional<Array> namesThrough(linux_::Sandbox& sandbox, const std::string& token) {
    const auto extension = zembra::ZBSandboxExtension::initWithExtension(sandbox, token);
    extension->consume();
    const int directory = extension->handle() < 0 ? -1 : sandbox.descriptor(extension->handle());
    const auto listing = directory < 0 ? std::nullopt : linux_::listDirectory(directory);
    if (!listing) return std::nullopt;
    MutableArray names;
    for (const auto& name : listing->directories) names.append(name + '/');
    for (const auto& name : listing->others) names.append(name);
    return names;
}

ExitStatus access(const Invocation& invocation, const Activation& activation) {
    Session session(invocation.service);
    const auto uuids = uuidsOf(session, activation.plugIns);
    if (const auto* status = std::get_if<ExitStatus>(&uuids)) return *status;
    const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        auto message = client.request(zembra::requestType::access);
        ZBDaemonClient::set(message, std::get<std::vector<UUID>>(uuids));
        client.send(message, std::move(callback));
    });
    ExitStatus status = report(answer);
    if (status != ExitStatus::success) return status;
    const auto tokens = std::get<Dictionary>(answer).array(key::extensions);
    if (!tokens || tokens->size() != activation.plugIns.size()) {
        complain("the reply holds no token for each plug-in");
        return ExitStatus::failure;
    }
    linux_::Sandbox sandbox(linux_::Root::ofProcess(), linux_::SandboxRole::consumer);
    MutableArray shown;
    for (std::size_t i = 0; i < tokens->size(); ++i) {
        const std::string token((*tokens)[i].string().value_or(""));
        MutableDictionary entry{{"plugIn", activation.plugIns[i]}, {"token", token}};
        if (activation.consume) {
            const auto names = namesThrough(sandbox, token);
            if (!names) {
                complain(activation.plugIns[i] + ": the token opens nothing");
                status = ExitStatus::failure;
            }
            entry.set("names", names.value_or(Array()));
        }
        shown.append(entry);
    }
    if (invocation.json)
        printJson(std::cout, shown);
    else
        printTree(std::cout, shown);
    return status;
}

CLI::App* addVerb(CLI::App& app, const char* name, const char* description, Activation& activation) {
    auto* verb = app.add_subcommand(name, description);
    verb->add_option("PLUG-IN", activation.plugIns, "UUIDs, or paths of bundles")->required();
    return verb;
}

} // namespace

void addActivation(CLI::App& app, Invocation& invocation) {
    const auto readying = std::make_shared<Activation>();
    auto* readyVerb = addVerb(app, "ready", "Prepare plug-ins for being launched by this process", *readying);
    readyVerb->add_option("-e", readying->environment, "A variable for them (needs an entitlement)")
        ->type_name("NAME=VALUE")
        ->allow_extra_args(false);
    readyVerb->footer(
        "Only this process may launch them, and only while it runs:\n"
        "  zbctl ready PLUG-IN... -- zbignite IDENTIFIER ARGUMENT...\n"
        "ends with the exit status of the plug-in. Without a command it tells whether the daemon agrees.");
    readyVerb->callback([=, &invocation] { invocation.status = ready(invocation, *readying); });

    const auto accessing = std::make_shared<Activation>();
    auto* accessVerb = addVerb(app, "access", "Get tokens that open the bundles of plug-ins", *accessing);
    accessVerb->add_flag("--consume", accessing->consume, "Use them, and list what is in the bundles");
    accessVerb->callback([=, &invocation] { invocation.status = access(invocation, *accessing); });
}

} // namespace zbctl
