#include "Zembra/ZBProtocol.h"
#include "tools/zbctl/Input.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <array>
#include <iostream>

namespace zbctl {

using platform::Dictionary;
using platform::Kind;
using platform::MutableArray;
using platform::MutableDictionary;
using platform::Value;
using zembra::ZBDaemonClient;

namespace {

struct Question {
    std::optional<std::string> file;
    std::vector<std::string> rules; // KEY or KEY=PATTERN
    std::uint64_t flags = 0;
};

struct Flag {
    const char* name;
    zembra::DiscoveryFlags bit;
    const char* description;
};
constexpr std::array flags{
    Flag{"--all-versions", zembra::ZBDiscoverAllVersions, "Every version of an identifier, not the newest alone"},
    Flag{"--duplicates", zembra::ZBDiscoverDuplicates, "With --all-versions: equal versions too"},
    Flag{"--system-only", zembra::ZBDiscoverSystemOnly, "Only plug-ins on the system volume"},
    Flag{"--all", zembra::ZBDiscoverAll,
         "Also what hosts do not get: held, dedicated, forbidden (needs an entitlement)"},
};

/// None, and a complaint, when a word is none or a boolean shares its key with others: as one of several alternatives
/// it would never match.
std::optional<Dictionary> rulesOf(const std::vector<std::string>& words) {
    MutableDictionary rules;
    for (const auto& word : words) {
        const auto rule = settingOf(word);
        if (!rule) return std::nullopt;
        const Value earlier = rules[rule->key];
        if (!earlier) {
            rules.set(rule->key, rule->value);
            continue;
        }
        if (earlier.kind() == Kind::boolean || rule->value.kind() == Kind::boolean) {
            complain(rule->key + ": true and false are no alternatives to other patterns");
            return std::nullopt;
        }
        MutableArray alternatives;
        if (const auto array = earlier.array())
            alternatives = MutableArray::copyOf(*array);
        else
            alternatives.append(earlier);
        alternatives.append(rule->value);
        rules.set(rule->key, alternatives);
    }
    return rules;
}

ExitStatus match(const Invocation& invocation, const Question& question) {
    std::optional<Dictionary> rules;
    if (question.file || !question.rules.empty()) {
        rules = question.file ? dictionaryOf(*question.file) : rulesOf(question.rules);
        if (!rules) return ExitStatus::usage;
    }
    Session session(invocation.service);
    const auto answer = session.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.matchPlugIns(rules, question.flags, std::move(callback));
    });
    if (const ExitStatus status = report(answer); status != ExitStatus::success) return status;
    const auto forms = session.matches(answer).array();
    if (!forms) {
        complain("the reply holds no list of plug-ins");
        return ExitStatus::failure;
    }
    if (invocation.json)
        printJson(std::cout, *forms);
    else
        printPlugIns(std::cout, *forms);
    return ExitStatus::success;
}

} // namespace

void addMatch(CLI::App& app, Invocation& invocation) {
    auto* verb = app.add_subcommand("match", "List the plug-ins that fulfil rules");
    const auto question = std::make_shared<Question>();
    auto* file =
        addText(verb, "--rules", question->file, "A file with the rules; - is standard input")->type_name("FILE");
    verb->add_option("-r,--rule", question->rules, "One rule; several patterns for one key are alternatives")
        ->type_name("KEY[=PATTERN]")
        ->allow_extra_args(false)
        ->excludes(file);
    for (const Flag& flag : flags) {
        verb->add_flag_callback(flag.name, [question, bit = flag.bit] { question->flags |= bit; }, flag.description);
    }
    verb->footer(
        "KEY and KEY=true ask for plug-ins that have it, KEY=false for those that do not. Everything else is a\n"
        "pattern, which an operator may begin: =  <>  <  <=  >  >=  ?KT-CONFORMS:  ?KT-IS:\n"
        "  zbctl match -r VKExtensionPointName=org.example.text-service -r 'VKExtensionVersion=>=2'\n"
        "The texts true and false are asked for with the operator \"=\": -r Mode==true");
    verb->callback([=, &invocation] { invocation.status = match(invocation, *question); });
}

} // namespace zbctl
