#include "Zembra/ZBLog.h"
#include "Zembra/ZBSandboxExtension.h"
#include "platform/Format.h"
#include "platform/TracePoints.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
namespace entitlement = zembra::entitlement;

void Transaction::readyPlugIns() {
    const auto environment = _request.dictionary(key::environment);
    if (environment) {
        if (!_client->hasEntitlement(entitlement::provideEnvironment)) {
            return fail(code::notPermitted,
                        platform::format("Transmission of environment variables requires the %@ host entitlement",
                                         entitlement::provideEnvironment));
        }
        log::ops().debug("pid %d provided %d environment entries", _client->pid(), environment->size());
    }

    // Nothing is enabled before everything is allowed.
    ZBDPlugInSet plugIns;
    const bool isAllowed = processUuidList([&](const ZBDPlugInRef& plugIn) {
        if (platform::trace::pluginReadyEnabled()) platform::trace::pluginReady(plugIn->uuid()->text().c_str());
        if (server()->holdOnPlugIn(plugIn)) {
            log::ops().notice("denied access to %d for plugin %{public}@(%{public}@): the plug-in is on hold",
                              _client->pid(), plugIn->identifier(), plugIn->uuidText());
            fail(code::notPermitted,
                 platform::format("access to plugin %@ denied: the plug-in is on hold", plugIn->identifier()));
            return false;
        }
        if (plugIn->isData()) return true; // nothing of it runs
        if (const auto reason = plugIn->allowForClient(*_client)) {
            log::ops().notice("denied access to %d for plugin %@(%{public}@): %{public}@", _client->pid(),
                              plugIn->identifier(), plugIn->uuidText(), *reason);
            fail(code::notPermitted, platform::format("access to plugin %@ denied: %@", plugIn->identifier(), *reason));
            return false;
        }
        plugIns.insert(plugIn);
        return true;
    });
    if (!isAllowed) return;

    platform::Failure firstFailure;
    for (const ZBDPlugInRef& plugIn : plugIns) {
        auto failure = plugIn->enableForClient(*_client, environment);
        if (failure && !firstFailure) firstFailure = std::move(failure);
    }
    if (firstFailure) return fail(code::malformed, *firstFailure);
    done();
}

void Transaction::accessPlugIns() {
    platform::MutableArray tokens;
    const bool isComplete = processUuidList([&](const ZBDPlugInRef& plugIn) {
        const auto token = zembra::issueFileReadToken(server()->platform().sandbox, *plugIn->url());
        if (!token) {
            fail(code::malformed,
                 platform::format("cannot create file extension to %@: %d", plugIn->path(), token.error().code));
            return false;
        }
        tokens.append(*token);
        return true;
    });
    if (!isComplete) return;
    reply().set(key::extensions, tokens);
    done();
}

} // namespace zbd
