#include "tools/zbctl/Session.h"

#include "tools/zbctl/Output.h"

#include <future>

namespace zbctl {

using platform::ReplyOrError;
using platform::TransportError;
using zembra::ZBDaemonClient;

Session::Session(const std::optional<std::string>& service)
    : _transport(platform::linux_::Root::ofProcess()),
      _client(ZBDaemonClient::initWithServiceName(_transport, _queues, service)) {}

ReplyOrError Session::ask(const std::function<void(ZBDaemonClient&, ZBDaemonClient::Callback)>& request) {
    const auto answer = std::make_shared<std::promise<ReplyOrError>>();
    request(*_client, [answer](const ReplyOrError& reply) { answer->set_value(reply); });
    return answer->get_future().get();
}

ExitStatus report(const ReplyOrError& answer) {
    if (const auto* error = std::get_if<TransportError>(&answer)) {
        complain("no answer from the daemon: " + error->description);
        return ExitStatus::noDaemon;
    }
    const auto error = ZBDaemonClient::errorInReply(answer);
    if (!error) return ExitStatus::success;
    complain("error " + std::to_string(error->code) + ": " + error->text());
    return ExitStatus::failure;
}

} // namespace zbctl
