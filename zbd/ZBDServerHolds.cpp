#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

namespace zbd {

namespace log = zembra::log;
using platform::PlugInProxyRef;
using platform::UUID;

ZBDServer::Holds ZBDServer::holds() const {
    return _syncQueue->sync([&] { return _holds; });
}

bool ZBDServer::hasHolds() const {
    return _syncQueue->sync([&] { return !_holds.empty(); });
}

bool ZBDServer::holdOnPlugIn(const ZBDPlugInRef& plugIn) {
    return _syncQueue->sync([&] { return _holdCounts.contains(plugIn); });
}

void ZBDServer::addHold(const std::shared_ptr<ZBDPlugInHold>& hold) {
    _syncQueue->sync([&] {
        Holds& ofClient = _holdsByClient[hold->clientReference()];
        _holdsByToken.emplace(hold->uuid(),
                              Place{_holds.insert(_holds.end(), hold), ofClient.insert(ofClient.end(), hold)});
        for (const ZBDPlugInRef& plugIn : hold->blocked()) ++_holdCounts[plugIn];
    });
    notifyAnnotationChange();
}

void ZBDServer::removeHold(const UUID& token) {
    const Place place = _holdsByToken.extract(token).mapped();
    const auto hold = *place.amongAll;
    for (const ZBDPlugInRef& plugIn : hold->blocked()) {
        const auto count = _holdCounts.find(plugIn);
        if (--count->second == 0) _holdCounts.erase(count);
    }
    const auto ofClient = _holdsByClient.find(hold->clientReference());
    ofClient->second.erase(place.amongItsClients);
    if (ofClient->second.empty()) _holdsByClient.erase(ofClient);
    _holds.erase(place.amongAll);
    notifyAnnotationChange();
}

void ZBDServer::unholdToken(const UUID& token) {
    _syncQueue->sync([&] {
        if (!_holdsByToken.contains(token)) return;
        log::ops().debug("releasing plug-in hold %{public}@ at client's request", token);
        removeHold(token);
    });
}

void ZBDServer::unholdClient(const std::shared_ptr<ZBDQmxClient>& client) {
    _syncQueue->sync([&] {
        const auto found = _holdsByClient.find(client);
        if (found == _holdsByClient.end()) return;
        const std::int32_t pid = client->auditToken().pid; // the connection may be gone
        for (const auto& hold : Holds(found->second)) {    // a copy: the list goes with its last hold
            log::ops().debug("releasing plug-in hold %{public}@ for dead client pid %d", hold->uuid(), pid);
            removeHold(hold->uuid());
        }
    });
}

void ZBDServer::releaseAllHolds() {
    _syncQueue->sync([&] {
        for (const auto& hold : _holds) {
            log::ops().debug("releasing plug-in hold %{public}@ because server is stopping", hold->uuid());
        }
        _holds.clear();
        _holdsByClient.clear();
        _holdsByToken.clear();
        _holdCounts.clear();
        notifyAnnotationChange();
    });
}

namespace {

/// Counts the service manager's answers. Its steps run on "killer-waiter", one for each answer, so that a service
/// manager that never answers costs no thread.
class TerminationWait : public std::enable_shared_from_this<TerminationWait> {
public:
    TerminationWait(std::size_t count, std::shared_ptr<platform::WorkQueue> queue, std::function<void()> reply)
        : _count(count), _queue(std::move(queue)), _reply(std::move(reply)) {}

    void begin() {
        _queue->async([self = shared_from_this()] {
            log::ops().debug("waiting for %d termination replies", self->_count);
            self->_waiting = true;
            self->step();
        });
    }

    /// One answer came. Any thread.
    void signal() {
        _queue->async([self = shared_from_this()] {
            ++self->_answers;
            if (self->_waiting) self->step();
        });
    }

private:
    void step() {
        while (_awaited < _count) {
            if (!_announced) log::ops().debug("awaiting termination reply #%d", _awaited);
            _announced = true;
            if (_answers == 0) return;
            --_answers;
            ++_awaited;
            _announced = false;
        }
        log::ops().debug("sending termination reply");
        _waiting = false;
        _reply();
    }

    const std::size_t _count;
    const std::shared_ptr<platform::WorkQueue> _queue;
    const std::function<void()> _reply;
    // On _queue only.
    std::size_t _answers = 0;
    std::size_t _awaited = 0;
    bool _waiting = false;
    bool _announced = false;
};

void logTermination(int result, const std::optional<UUID>& uuid) {
    switch (result) {
    case platform::serviceInstancesTerminated:
        log::ops().info("one or more plug-ins have been terminated for uuid=%@", uuid);
        break;
    case platform::serviceHasNoInstances:
        log::ops().debug("ignitd reported no plug-ins on record for uuid=%@", uuid);
        break;
    default: log::ops().error("ignitd error attempting to terminate plug-ins: error=%d for uuid=%@", result, uuid);
    }
}

} // namespace

void ZBDServer::terminatePlugIns(const std::vector<PlugInProxyRef>& proxies, std::function<void()> reply) {
    const auto killer = platform().queues.makeSerial("killer");
    const auto wait = std::make_shared<TerminationWait>(proxies.size(), platform().queues.makeSerial("killer-waiter"),
                                                        std::move(reply));
    for (const PlugInProxyRef& proxy : proxies) {
        const auto version =
            proxy->infoDictionary ? proxy->infoDictionary->string(zembra::manifest::bundleVersion) : std::nullopt;
        const std::string serviceVersion(version.value_or("1"));
        log::ops().debug("requesting termination for %@(%@) ignitd:%@ %@", proxy->bundleIdentifier,
                         proxy->bundleVersion, serviceVersion, proxy->uuid);
        platform().serviceManager.removeExternalService(proxy->bundleIdentifier.value_or(""), serviceVersion, killer,
                                                        [wait, uuid = proxy->uuid](int result) {
                                                            logTermination(result, uuid);
                                                            wait->signal();
                                                        });
    }
    wait->begin();
}

} // namespace zbd
