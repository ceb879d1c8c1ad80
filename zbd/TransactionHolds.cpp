#include "Zembra/ZBLog.h"
#include "platform/Format.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

#include <unordered_set>

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
using platform::Array;
using platform::MutableArray;
using platform::URL;

void Transaction::lockDownPlugIns() {
    if (const auto tokens = _request.array(key::uuids)) return releaseHolds(*tokens);

    const std::uint64_t flags = _request.uint64(key::flags).value_or(0);
    std::vector<ZBDPlugInRef> plugIns;
    if (!collectPlugInsToHold(flags, plugIns)) return;
    log::ops().info("processing hold request for plug-ins:%@", plugIns);

    if ((flags & zembra::ZBLockRefuseWhenBusy) != 0) {
        std::vector<ZBDPlugInRef> busy;
        MutableArray conflicts;
        for (const auto& plugIn : plugIns) {
            if (const auto conflict = plugIn->checkBusy()) {
                busy.push_back(plugIn);
                conflicts.append(*conflict);
            }
        }
        if (!busy.empty()) {
            log::ops().debug("hold refused. Busy plug-ins:%@", busy);
            reply().set(key::conflicts, conflicts);
            return fail(code::busy, "plug-ins are busy");
        }
    }

    const auto hold = ZBDPlugInHold::initWithPlugIns(server()->platform().transport, plugIns, _client);
    server()->addHold(hold);
    if (!_client->acceptWork()) return server()->unholdClient(_client); // its death found no hold to release
    reply().set(key::uuids, hold->uuid());
    if ((flags & zembra::ZBLockTerminate) == 0) {
        log::ops().info("hold request granted uuid:%{public}@", hold->uuid());
        return done();
    }
    std::vector<platform::PlugInProxyRef> proxies;
    for (const auto& plugIn : plugIns) {
        // The instances of one that is gone by now are ended because it was uninstalled.
        if (auto proxy = plugIn->getProxy()) proxies.push_back(std::move(proxy));
    }
    server()->terminatePlugIns(proxies, [self = shared_from_this(), token = hold->uuid()] {
        log::ops().info("forced termination complete; hold request granted uuid:%{public}@", token);
        self->done();
    });
}

void Transaction::releaseHolds(const Array& tokens) {
    for (const auto& element : tokens) {
        if (const auto token = element.uuid()) server()->unholdToken(*token);
    }
    done();
}

bool Transaction::collectPlugInsToHold(std::uint64_t flags, std::vector<ZBDPlugInRef>& plugIns) {
    // Each once, however often it is named: checking and terminating cost more than naming.
    ZBDPlugInSet known;
    std::unordered_set<std::string> paths;
    const auto collect = [&](const ZBDPlugInRef& plugIn) {
        if (known.insert(plugIn).second) plugIns.push_back(plugIn);
    };
    return marshalPaths([&](const std::string& path, bool resolved) {
        if (!resolved) {
            fail(code::badPath, platform::format("invalid path: %@", path));
            return false;
        }
        if (!paths.insert(path).second) return true;
        if ((flags & zembra::ZBLockPlugInPaths) == 0) {
            const auto within = server()->plugInsWithinApplication(URL::file(path));
            for (const ZBDPlugInRef& plugIn : within.value_or(std::vector<ZBDPlugInRef>())) collect(plugIn);
            return true;
        }
        const auto plugIn = server()->findPlugInAtPath(URL::file(path));
        if (!plugIn) {
            fail(code::badPath, platform::format("no plug-in at path:%@", path));
            return false;
        }
        collect(plugIn);
        return true;
    });
}

} // namespace zbd
