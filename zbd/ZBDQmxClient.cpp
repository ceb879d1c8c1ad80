#include "zbd/ZBDQmxClient.h"

#include "Zembra/ZBLog.h"
#include "platform/TracePoints.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDServer.h"

#include <utility>

namespace zbd {

namespace log = zembra::log;
using platform::Connection;
using platform::ConnectionEvent;
using platform::ReceivedMessage;
using platform::TransportError;
using platform::TransportErrorKind;
using platform::Value;

namespace {

constexpr std::size_t pathBufferSize = 2048; // longer paths of hosts are not learnt
constexpr std::uint32_t requestCountInterval = 1000;

} // namespace

ZBDQmxClient::ZBDQmxClient(const std::shared_ptr<Connection>& connection, std::shared_ptr<ZBDServer> server)
    : _connection(connection), _server(std::move(server)), _auditToken(connection->peerAuditToken()) {}

std::shared_ptr<ZBDQmxClient> ZBDQmxClient::initWithConnection(const std::shared_ptr<Connection>& connection,
                                                               const std::shared_ptr<ZBDServer>& server) {
    std::shared_ptr<ZBDQmxClient> self(new ZBDQmxClient(connection, server));
    platform::Platform& platform = server->platform();
    const platform::AuditToken& token = self->_auditToken;

    // By the token, not the pid: the pid may be another process's by now.
    if (auto path = platform.processes.executablePath(token, pathBufferSize)) {
        self->_bundle = zembra::ZBBundle::initWithExecutableURL(platform.bundles, platform::URL::file(*path));
        self->_path = *std::move(path);
    }
    log::ops().debug("new client %d %s", self->pid(), self->_path);
    platform::trace::clientNew(self->pid());
    self->_task = platform.codeSigning.taskFromAuditToken(token);

    connection->setContext(self, [](std::shared_ptr<void> context) { context.reset(); });
    connection->setEventHandler([self](const ConnectionEvent& event) { self->handleEvent(event); });
    connection->resume();
    return self;
}

std::int32_t ZBDQmxClient::pid() const {
    const auto peer = connection();
    return peer ? peer->peerPid() : -1;
}

void ZBDQmxClient::handleEvent(const ConnectionEvent& event) {
    if (const auto* error = std::get_if<TransportError>(&event)) {
        switch (error->kind) {
        case TransportErrorKind::terminationImminent: return dying();
        case TransportErrorKind::connectionInvalid: return dead();
        case TransportErrorKind::other:
            log::ops().error("unexpected error type from qmx: %{public}@", error->description);
        }
        return;
    }
    const auto& message = std::get<ReceivedMessage>(event);
    if (message.content.kind() == platform::Kind::dictionary) return handleRequest(message);
    log::ops().error("unexpected message: %{public}@ from: %d", message.content, pid());
}

void ZBDQmxClient::handleRequest(const ReceivedMessage& message) {
    if (platform::trace::requestInputEnabled()) {
        platform::trace::requestInput(pid(), message.content.description().c_str());
    }
    const auto transaction = Transaction::initWithRequest(message, shared_from_this());
    const auto serve = [self = shared_from_this(), transaction] {
        if (++self->_requestCount % requestCountInterval == 0) {
            log::ops().debug("client %d used %u requests so far", self->pid(), self->_requestCount);
        }
        transaction->dispatch();
    };
    _server->submitWork(serve, [transaction] { return transaction->isBrief(); });
}

void ZBDQmxClient::dying() { log::ops().debug("client %d termination imminent", pid()); }

void ZBDQmxClient::dead() {
    _server->unholdClient(shared_from_this());
    log::ops().debug("client %d is dead", pid());
    _acceptWork.store(false, std::memory_order_relaxed);
    // A request that is being served may have added a hold since; later ones see that nobody waits for them.
    _server->unholdClient(shared_from_this());
    platform::trace::clientDone(pid());
}

Value ZBDQmxClient::entitlementValueForKey(std::string_view name) const {
    const auto found = _server->platform().codeSigning.copyEntitlement(_task, std::string(name));
    if (found.error) log::ops().error("error retrieving entitlements for client %d", pid());
    return found.value;
}

bool ZBDQmxClient::hasEntitlement(std::string_view name) const {
    const Value value = entitlementValueForKey(name);
    return value && !(value == Value(false));
}

std::string ZBDQmxClient::description() const {
    const auto peer = connection();
    if (!peer) return platform::format("<ZBDQmxClient %p NO CONNECTION>", this);
    return platform::format("<ZBDQmxClient %p con=%@ pid=%d path=%@>", this, peer, peer->peerPid(), _path);
}

} // namespace zbd
