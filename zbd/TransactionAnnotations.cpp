#include "Zembra/ZBLog.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
namespace annotationKey = zembra::annotationKey;
using platform::Dictionary;
using platform::MutableDictionary;
using platform::UUID;
using platform::Value;

namespace {

/// Annotations are kept in XML, which holds neither UUIDs nor control characters.
bool canBeStored(const Value& extension) { return static_cast<bool>(platform::encodeXML(extension)); }

} // namespace

void Transaction::addAnnotationForPlugIn(const ZBDPlugIn& plugIn, MutableDictionary& form) {
    form.set(zembra::formKey::annotations, server()->annotationForPlugIn(plugIn).value_or(Dictionary()));
}

void Transaction::annotatePlugIns() {
    const auto requested = _request.dictionary(key::annotations);
    if (!requested) return fail(code::malformed, "invalid request format (bad annotations dictionary)");
    MutableDictionary annotation;
    const Value election = (*requested)[annotationKey::election];
    if (election) {
        if (!election.isNumber()) return fail(code::malformed, "invalid request format (annotation election)");
        annotation.set(annotationKey::election, election);
    }
    if (const Value extension = (*requested)[annotationKey::extension]) {
        if (!extension.dictionary() || !canBeStored(extension)) {
            return fail(code::malformed, "invalid request format (annotation extension)");
        }
        annotation.set(annotationKey::extension, extension);
    }
    if (annotation.empty()) return done();

    const bool complete = processUuidList([&](const ZBDPlugInRef& plugIn) {
        log::ops().debug("client %d plug-in %{public}@(%{public}@) annotation change: %@", _client->pid(),
                         plugIn->identifier(), plugIn->uuid(), annotation);
        if (election) {
            log::ops().info("client %d plug-in %{public}@(%{public}@) election := %@", _client->pid(),
                            plugIn->identifier(), plugIn->uuid(), election);
        }
        server()->setAnnotation(annotation, *plugIn);
        return true;
    });
    if (!complete) return;
    server()->notifyAnnotationChange();
    done();
}

void Transaction::bulkAnnotatePlugIns() {
    const auto requested = _request.dictionary(key::annotations);
    if (!requested) return fail(code::malformed, "invalid request format (bad annotations dictionary)");
    log::ops().debug("bulk change requested for %u plug-ins", requested->size());
    for (const auto& entry : *requested) {
        const auto extension = entry.value.dictionary();
        if (!extension || !canBeStored(*extension)) {
            return fail(code::bulkAnnotation, "annotations values must be dictionaries");
        }
        const auto uuid = UUID::parse(entry.name());
        if (!uuid) return fail(code::bulkAnnotation, "invalid plug-in UUID value");
        const auto plugIn = server()->findPlugIn(*uuid);
        if (!plugIn) return fail(code::registrationFailed, "no plug-in with the requested uuid");
        log::ops().debug("client %d bulk plug-in %{public}@(%public}@) annotation change: %@", _client->pid(),
                         plugIn->identifier(), plugIn->uuid(), *extension);
        server()->setAnnotation(Dictionary{{annotationKey::extension, *extension}}, *plugIn);
    }
    server()->notifyAnnotationChange();
    done();
}

} // namespace zbd
