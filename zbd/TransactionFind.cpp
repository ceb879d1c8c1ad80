#include "Zembra/ZBDaemonClient.h"
#include "Zembra/ZBLog.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDServer.h"

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;

ZBDPlugInRef Transaction::findPlugInByUUID(const UUID& uuid) { return server()->findPlugIn(uuid); }

ZBDPlugInRef Transaction::findPlugInByPathURL(std::string_view text) {
    return server()->findPlugInAtPath(URL::parse(text));
}

void Transaction::findPlugIn() {
    ZBDPlugInRef plugIn;
    if (const auto uuid = _request.uuid(key::uuids)) plugIn = findPlugInByUUID(*uuid);
    if (const auto url = _request.string(key::paths)) plugIn = findPlugInByPathURL(*url); // the path decides
    if (!plugIn) {
        log::ops().notice("plugin not found");
        return fail(code::notFound, "Cannot locate PlugIn");
    }
    log::ops().notice("plugin found %{public}@", plugIn);

    platform::Failure error;
    const auto kept = plugIn->keptForm();
    MutableDictionary form = plugIn->currentForm(&error, kept);
    if (error) {
        log::ops().error("failed to export matching plug-in %{public}@: %{public}@", plugIn->uuid(), *error);
    }
    completeForm(*plugIn, form, kept, std::chrono::steady_clock::now());
    if (const auto matches = zembra::ZBDaemonClient::convertToQMX(form, _version)) reply().set(key::matches, *matches);
    done();
}

} // namespace zbd
