#include "zbd/ZBDServer.h"

#include "Zembra/ZBLog.h"
#include "zbd/ZBDQmxClient.h"

namespace zbd {

namespace log = zembra::log;
using platform::Connection;
using platform::TransportError;
using platform::TransportErrorKind;
using platform::Value;

namespace {

/// Never destroyed: at exit other threads may still be using the server.
std::shared_ptr<ZBDServer>& singleton() {
    static auto& server = *new std::shared_ptr<ZBDServer>;
    return server;
}

} // namespace

ZBDServer::ZBDServer(platform::Platform& platform) : ZBDatabase(platform) {}

std::shared_ptr<ZBDServer> ZBDServer::initForService(platform::Platform& platform, const std::string& serviceName,
                                                     const std::optional<std::string>& annotationDatabasePath) {
    std::shared_ptr<ZBDServer> self(new ZBDServer(platform));
    self->initWithDatabase(annotationDatabasePath);
    self->_qmxQueue = platform.queues.makeSerial("qmx");
    self->_mainQueue = platform.queues.makeSerial("service", platform::QualityOfService::userInitiated);
    self->_syncQueue = platform.queues.makeSerial("serverSync");
    self->_service = platform.transport.createListener(serviceName, self->_qmxQueue);
    if (const auto refusal = self->_service->refusal()) {
        log::ops().error("unable to listen for %{public}s: %{public}s", serviceName, *refusal);
        return nullptr;
    }
    singleton() = self;
    self->setDelegate(self);
    // The handler keeps the server alive for as long as connections may come.
    self->_service->setEventHandler(
        [self](const platform::Listener::Event& event) { self->handleListenerEvent(event); });
    self->_userPrefs = std::make_unique<ZBDUserPrefs>(platform.preferences);
    return self;
}

std::shared_ptr<ZBDServer> ZBDServer::server() { return singleton(); }

void ZBDServer::handleListenerEvent(const platform::Listener::Event& event) {
    if (const auto* connection = std::get_if<std::shared_ptr<Connection>>(&event)) {
        // Kept alive by its connection, not by the server.
        ZBDQmxClient::initWithConnection(*connection, std::static_pointer_cast<ZBDServer>(shared_from_this()));
    } else if (const auto* error = std::get_if<TransportError>(&event)) {
        if (error->kind == TransportErrorKind::connectionInvalid) {
            log::ops().notice("potentially unexpected error from qmx: %{public}@", error->description);
        } else {
            log::ops().error("unexpected error from qmx: %{public}@", error->description);
        }
    } else {
        log::ops().error("unexpected message: %{public}@", std::get<Value>(event));
    }
}

void ZBDServer::run() {
    _service->resume();
    platform().runLoop.run();
}

void ZBDServer::submitWork(platform::WorkQueue::Item item, std::function<bool()> isBrief) {
    _mainQueue->asyncOnCaller(std::move(item), std::move(isBrief));
}

void ZBDServer::stop() {
    _service->cancel();
    releaseAllHolds();
}

void ZBDServer::removedPlugIns(const std::vector<platform::PlugInProxyRef>& proxies) {
    terminatePlugIns(proxies, [proxies] { log::ops().debug("removal complete for %@", proxies); });
}

} // namespace zbd
