#include "Zembra/ZBProtocol.h"
#include "samples/host/Host.h"

#include <iostream>

namespace host {

namespace formKey = zembra::formKey;
using platform::Array;
using platform::Dictionary;
using zembra::ZBDaemonClient;

int discover(Daemon& daemon, const Words& words) {
    const Dictionary rules{{"VKExtensionPointName", words.front()}, {zembra::ruleKey::userElection, "<>2"}};
    const auto reply = daemon.ask([&](ZBDaemonClient& client, ZBDaemonClient::Callback callback) {
        client.matchPlugIns(rules, 0, std::move(callback));
    });
    if (!reply) return 1;
    for (const auto& match : daemon.matches(*reply).array().value_or(Array())) {
        const auto form = match.dictionary().value_or(Dictionary());
        const auto election = form.dictionary(formKey::annotations).value_or(Dictionary());
        std::cout << textOf(form.string(formKey::localizedName)) << ' ' << textOf(form.string(formKey::version))
                  << (election[zembra::annotationKey::election] == platform::Value(1) ? ", chosen by the user" : "")
                  << (form.contains(formKey::overrider) ? ", replaced" : "") << '\n';
    }
    return 0;
}

} // namespace host
