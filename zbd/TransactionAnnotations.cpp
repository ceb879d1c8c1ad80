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

/// Bytes of one extension as it is stored. Hosts keep settings there, and every answer that names the plug-in carries
/// them: once for each of the versions that share them.
constexpr std::size_t maximumExtension = std::size_t{64} << 10U;

/// Annotations are kept in XML, which holds neither UUIDs nor control characters, some containers deep.
bool canBeStored(const Value& extension) {
    Value stored = extension;
    for (int container = 0; container < 3; ++container) stored = Dictionary{{"", stored}};
    const auto text = platform::encodeXML(stored);
    return text && text->size() <= maximumExtension;
}

} // namespace

void Transaction::addAnnotationForPlugIn(const ZBDPlugIn& plugIn, MutableDictionary& form) {
    form.set(zembra::formKey::annotations, server()->annotationForPlugIn(plugIn).value_or(Dictionary()));
}

bool Transaction::isComplete(const ZBDPlugIn& plugIn, const KeptForm& kept,
                             std::chrono::steady_clock::time_point now) const {
    return plugIn.isComplete(kept, {server()->annotationsVersion(), now});
}

void Transaction::completeForm(const ZBDPlugIn& plugIn, MutableDictionary& form, const KeptFormRef& kept,
                               std::chrono::steady_clock::time_point now) {
    if (kept && isComplete(plugIn, *kept, now)) return;
    const FormCompletion completion{server()->annotationsVersion(), now};
    addAnnotationForPlugIn(plugIn, form);
    plugIn.augmentForm(form, kept, completion);
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

    const bool isComplete = processUuidList([&](const ZBDPlugInRef& plugIn) {
        log::ops().debug("client %d plug-in %{public}@(%{public}@) annotation change: %@", _client->pid(),
                         plugIn->identifier(), plugIn->uuidText(), annotation);
        if (election) {
            log::ops().info("client %d plug-in %{public}@(%{public}@) election := %@", _client->pid(),
                            plugIn->identifier(), plugIn->uuidText(), election);
        }
        _changes.push_back({annotation, plugIn});
        return true;
    });
    if (isComplete) finishAnnotating();
}

void Transaction::bulkAnnotatePlugIns() {
    const auto requested = _request.dictionary(key::annotations);
    if (!requested) return fail(code::malformed, "invalid request format (bad annotations dictionary)");
    log::ops().debug("bulk change requested for %u plug-ins", requested->size());
    for (const auto& entry : *requested) {
        if (!annotateInBulk(entry)) return;
    }
    finishAnnotating();
}

void Transaction::finishAnnotating() {
    saveChanges(); // first, so that those who are told find them
    server()->notifyAnnotationChange();
    done();
}

bool Transaction::annotateInBulk(const Dictionary::Entry& entry) {
    const auto refuse = [this](std::uint64_t errorCode, std::string_view text) {
        fail(errorCode, text);
        return false;
    };
    const auto extension = entry.value.dictionary();
    if (!extension) return refuse(code::bulkAnnotation, "annotations values must be dictionaries");
    const auto uuid = UUID::parse(entry.name());
    if (!uuid) return refuse(code::bulkAnnotation, "invalid plug-in UUID value");
    const auto plugIn = server()->findPlugIn(*uuid);
    if (!plugIn) return refuse(code::registrationFailed, "no plug-in with the requested uuid");
    if (!canBeStored(*extension)) return refuse(code::bulkAnnotation, "the extension cannot be stored");
    // The missing brace is part of the text: those who search logs for it find it so.
    log::ops().debug("client %d bulk plug-in %{public}@(%public}@) annotation change: %@", _client->pid(),
                     plugIn->identifier(), plugIn->uuid(), *extension);
    _changes.push_back({Dictionary{{annotationKey::extension, *extension}}, plugIn});
    return true;
}

/// Saving costs as much for one change as for hundreds: the file is written as a whole.
void Transaction::saveChanges() {
    if (_changes.empty()) return;
    server()->setAnnotations(_changes);
    _changes.clear();
}

} // namespace zbd
