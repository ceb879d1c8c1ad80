#include "tools/zbctl/Session.h"

#include "Zembra/ZBProtocol.h"
#include "tools/zbctl/Output.h"

#include <future>

namespace zbctl {

using platform::ConnectionEvent;
using platform::Dictionary;
using platform::ReplyOrError;
using platform::TransportError;
using platform::Value;
using zembra::ZBDaemonClient;

Session::Session(const std::optional<std::string>& service)
    : _service(service.value_or(zembra::serviceName)),
      _transport(platform::linux_::Root::ofProcess()),
      _client(ZBDaemonClient::initWithServiceName(_transport, _queues, _service)) {}

Session::~Session() {
    if (!_watch) return;
    _watch->setEventHandler([](const ConnectionEvent&) {}); // it was not the daemon that went
    _watch->cancel();
}

ReplyOrError Session::ask(const std::function<void(ZBDaemonClient&, ZBDaemonClient::Callback)>& request) {
    const auto answer = std::make_shared<std::promise<ReplyOrError>>();
    request(*_client, [answer](const ReplyOrError& reply) { answer->set_value(reply); });
    return answer->get_future().get();
}

Value Session::matches(const ReplyOrError& answer) const {
    const auto* reply = std::get_if<Dictionary>(&answer);
    return reply ? _client->convertFromQMX((*reply)[zembra::key::matches]) : Value();
}

void Session::whenGone(std::function<void()> handler) {
    const auto queue = _queues.makeSerial("zbctl_watch", platform::QualityOfService::standard);
    _watch = _transport.connect(_service, queue);
    _watch->setEventHandler([handler = std::move(handler)](const ConnectionEvent& event) {
        const auto* error = std::get_if<TransportError>(&event);
        if (error && error->kind == platform::TransportErrorKind::connectionInvalid) handler();
    });
    _watch->resume();
    // It connects with the first request only.
    _watch->sendWithReply(_client->request(zembra::requestType::bulk), queue, [](const ReplyOrError&) {});
}

ExitStatus report(const ReplyOrError& answer, std::string_view subject) {
    const std::string prefix = subject.empty() ? std::string() : std::string(subject) + ": ";
    if (const auto* error = std::get_if<TransportError>(&answer)) {
        complain(prefix + "no answer from the daemon: " + error->description);
        return ExitStatus::noDaemon;
    }
    const auto error = ZBDaemonClient::errorInReply(answer);
    if (!error) return ExitStatus::success;
    complain(prefix + "error " + std::to_string(error->code) + ": " + error->text());
    return ExitStatus::failure;
}

} // namespace zbctl
