#include "Zembra/ZBLog.h"
#include "platform/Format.h"
#include "platform/TracePoints.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
using platform::URL;

void Transaction::addPlugIns() {
    processPaths([this](const std::string& path, bool resolved) {
        if (!resolved) {
            fail(code::badPath, platform::format("invalid plugin path: %@", path));
            return false;
        }
        platform::trace::pluginAdd(path.c_str());
        if (!mayRegister(URL::file(path)) || server()->addPlugIn(URL::file(path))) {
            log::ops().notice("failed to register plug-in at %@", path);
            fail(code::registrationFailed, platform::format("unable to register plug-in at %@", path));
            return false;
        }
        return true;
    });
}

bool Transaction::mayRegister(const URL& url) const {
    return server()->platform().registry.mayRegister(url, _client->auditToken());
}

void Transaction::removePlugIns() {
    processPaths([this](const std::string& path, bool resolved) {
        platform::trace::pluginRemove(path.c_str(), resolved);
        if (!_client->hasEntitlement(zembra::entitlement::manager)) {
            platform::systemLog().defaultHandle().notice(
                "refused request from pid=%d to remove plug-in at %@ - client lacks required entitlement",
                _client->pid(), path);
            fail(code::notPermitted, "caller lacks entitlement for this operation");
            return false;
        }
        if (server()->removePlugIn(URL::file(path))) {
            fail(code::badPath, platform::format("no plugin at %@", path));
            return false;
        }
        return true;
    });
}

void Transaction::bulkPlugIns() {
    log::ops().info("bulk options 0x%lx not supported", _request.uint64(key::flags).value_or(0));
    done();
}

} // namespace zbd
