#include "Zembra/ZBProtocol.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <iostream>

namespace zbctl {

using platform::Dictionary;
using platform::Value;
using zembra::ZBDaemonClient;

namespace {

/// Sends what the file holds, as it stands. Prints the reply, also one that reports an error.
ExitStatus raw(const Invocation& invocation, const std::string& file) {
    const auto request = dictionaryOf(file);
    if (!request) return ExitStatus::usage;
    Session session(invocation.service);
    const auto answer = session.ask(
        [&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) { client.send(*request, std::move(callback)); });
    const ExitStatus status = report(answer);
    if (status == ExitStatus::noDaemon) return status;

    auto reply = platform::MutableDictionary::copyOf(std::get<Dictionary>(answer));
    if (const Value matches = session.matches(answer)) reply.set(zembra::key::matches, matches);
    if (invocation.json)
        printJson(std::cout, reply);
    else
        printTree(std::cout, reply);
    return status;
}

} // namespace

void addRaw(CLI::App& app, Invocation& invocation) {
    auto* verb = app.add_subcommand("raw", "Send a request written by hand, and print the reply");
    const auto file = std::make_shared<std::string>();
    verb->add_option("FILE", *file, "A property list (XML or compact) or JSON; - is standard input")->required();
    verb->footer("A dictionary of the one key $uuid, $data (base64) or $date (ISO 8601) stands for such a value:\n"
                 "  {\"request\": \"find\", \"version\": 3, \"uuids\": {\"$uuid\": \"...\"}}");
    verb->callback([=, &invocation] { invocation.status = raw(invocation, *file); });
}

} // namespace zbctl
