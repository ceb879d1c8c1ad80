#include "samples/host/Host.h"

#include "Zembra/ZBProtocol.h"

#include <future>
#include <iostream>

namespace host {

using platform::Dictionary;
using platform::ReplyOrError;
using platform::Value;
using zembra::ZBDaemonClient;

Daemon::Daemon() : _client(ZBDaemonClient::initWithServiceName(_transport, _queues, std::nullopt)) {}

std::optional<Dictionary> Daemon::ask(const Request& request) {
    const auto answer = std::make_shared<std::promise<ReplyOrError>>();
    request(*_client, [answer](const ReplyOrError& reply) { answer->set_value(reply); });
    const ReplyOrError reply = answer->get_future().get();
    if (const auto error = ZBDaemonClient::errorInReply(reply)) {
        complain("error " + std::to_string(error->code) + ": " + error->text());
        return std::nullopt;
    }
    return std::get<Dictionary>(reply);
}

Value Daemon::matches(const Dictionary& reply) const { return _client->convertFromQMX(reply[zembra::key::matches]); }

std::optional<Dictionary> Daemon::find(const std::string& location) {
    const auto reply = ask([&](ZBDaemonClient& client, const ZBDaemonClient::Callback& callback) {
        if (const auto uuid = platform::UUID::parse(location))
            client.findPlugInByUUID(*uuid, callback);
        else
            client.findPlugInByPathURL(platform::URL::file(location), callback);
    });
    return reply ? matches(*reply).dictionary() : std::nullopt;
}

std::string textOf(std::optional<std::string_view> text) { return std::string(text.value_or("(none)")); }

void complain(const std::string& text) { std::cerr << "Host: " << text << '\n'; }

} // namespace host
