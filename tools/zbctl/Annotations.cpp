#include "Zembra/ZBProtocol.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

namespace zbctl {

namespace annotationKey = zembra::annotationKey;
using platform::MutableDictionary;
using platform::UUID;
using zembra::ZBDaemonClient;

namespace {

struct Annotation {
    std::optional<std::uint64_t> election;
    std::optional<std::string> extension; // a file
    std::vector<std::string> plugIns;
};

ExitStatus annotate(const Invocation& invocation, const Annotation& annotation) {
    MutableDictionary annotations;
    if (annotation.election) annotations.set(annotationKey::election, *annotation.election);
    if (annotation.extension) {
        const auto extension = dictionaryOf(*annotation.extension);
        if (!extension) return ExitStatus::usage;
        annotations.set(annotationKey::extension, *extension);
    }
    Session session(invocation.service);
    const auto uuids = uuidsOf(session, annotation.plugIns);
    if (const auto* status = std::get_if<ExitStatus>(&uuids)) return *status;
    return finish(invocation.json, session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.setPluginAnnotations(std::get<std::vector<UUID>>(uuids), annotations, std::move(callback));
    }));
}

ExitStatus bulkAnnotate(const Invocation& invocation, const std::string& file) {
    const auto annotations = dictionaryOf(file);
    if (!annotations) return ExitStatus::usage;
    Session session(invocation.service);
    return finish(invocation.json, session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.bulkSetPluginAnnotations(*annotations, std::move(callback));
    }));
}

void addPlugIns(CLI::App* verb, Annotation& annotation) {
    verb->add_option("PLUG-IN", annotation.plugIns, "UUIDs, or paths of bundles")->required();
}

} // namespace

void addAnnotations(CLI::App& app, Invocation& invocation) {
    auto* annotateVerb = app.add_subcommand("annotate", "Set what is stored about plug-ins");
    const auto annotation = std::make_shared<Annotation>();
    addPlugIns(annotateVerb, *annotation);
    auto* what = annotateVerb->add_option_group("what");
    addNumber(
        what, "--election", [=](std::uint64_t number) { annotation->election = number; },
        "0 none, 1 use, 2 ignore; hosts may have further ones");
    addText(what, "--extension", annotation->extension, "A file with a dictionary of settings; - is standard input")
        ->type_name("FILE");
    what->require_option(1, 0);
    annotateVerb->callback([=, &invocation] { invocation.status = annotate(invocation, *annotation); });

    auto* electVerb = app.add_subcommand("elect", "Decide that plug-ins are to be used");
    const auto election = std::make_shared<Annotation>();
    election->election = electionUse;
    addPlugIns(electVerb, *election);
    auto* ignore = electVerb->add_flag_callback(
        "--ignore", [=] { election->election = electionIgnore; }, "Decide that they are not to be used");
    electVerb->add_flag_callback(
                 "--reset", [=] { election->election = electionNone; }, "Take the decision back")
        ->excludes(ignore);
    electVerb->callback([=, &invocation] { invocation.status = annotate(invocation, *election); });

    auto* bulkVerb = app.add_subcommand("bulk-annotate", "Set the settings of many plug-ins");
    const auto file = std::make_shared<std::string>();
    bulkVerb->add_option("FILE", *file, "A dictionary of UUID to dictionary; - is standard input")->required();
    bulkVerb->callback([=, &invocation] { invocation.status = bulkAnnotate(invocation, *file); });
}

} // namespace zbctl
