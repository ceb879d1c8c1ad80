#pragma once

#include "Zembra/ZBProtocol.h"
#include "tests/support/FakePlatform.h"
#include "zbd/ZBDServer.h"

namespace support {

/// A real server on the in-memory platform, listening, and ways to ask it things as a host does.
struct FakeDaemon {
    FakePlatform fake;
    std::shared_ptr<zbd::ZBDServer> server;
    platform::AuditToken peer;

    FakeDaemon() {
        peer.pid = 77;
        fake.processes.paths[77] = "/Applications/Host.app/host";
        fake.transport.allowService(zembra::serviceName);
        server = zbd::ZBDServer::initForService(fake.platform, zembra::serviceName, std::nullopt);
        server->service()->resume();
        fake.transport.setPeer(peer);
        fake.files.allowPeers(peer.uid);
        processLog.clear();
    }

    /// The record of a data plug-in that is installed now.
    zbd::ZBDPlugInRef plugIn(const std::string& name) {
        return server->findPlugIn(*fake.registry.install(dataPlugIn(name))->uuid);
    }

    /// A host's end of a new connection.
    std::shared_ptr<platform::Connection> connect() {
        auto connection = fake.transport.connect(zembra::serviceName, fake.queues.makeSerial("host"));
        connection->setEventHandler([](const platform::ConnectionEvent&) {});
        connection->resume();
        fake.transport.deliver();
        return connection;
    }

    /// The reply to `message` over `connection`; none when there was none.
    std::optional<platform::Dictionary> ask(const std::shared_ptr<platform::Connection>& connection,
                                            const platform::Dictionary& message) {
        auto answer = std::make_shared<std::optional<platform::Dictionary>>();
        connection->sendWithReply(message, fake.queues.makeSerial("replies"), [answer](const auto& reply) {
            if (const auto* content = std::get_if<platform::Dictionary>(&reply)) *answer = *content;
        });
        fake.transport.deliver();
        return *answer;
    }

    /// The same over a connection of its own, in the current version.
    platform::Dictionary ask(std::string_view type, platform::MutableDictionary message = {}) {
        message.set(zembra::key::request, type);
        message.set(zembra::key::version, zembra::currentVersion);
        const auto connection = connect();
        const auto reply = ask(connection, message);
        connection->cancel();
        fake.transport.deliver();
        return reply.value_or(platform::Dictionary{{"no", "reply"}});
    }
};

/// What an error reply holds, and nothing else.
inline platform::Dictionary errorReply(unsigned code, const std::string& text) {
    return {{"errorcode", code}, {"error", text}};
}

} // namespace support
