#include "Zembra/ZBProtocol.h"
#include "zbd/ZBDatabase.h"

namespace zbd {

using platform::Dictionary;
using platform::MutableDictionary;

std::optional<Dictionary> ZBDatabase::annotationForPlugIn(const ZBDPlugIn& plugIn) {
    return _sync->sync([&] { return _annotations->annotationForPlugIn(plugIn); });
}

void ZBDatabase::setAnnotation(const std::optional<Dictionary>& annotation, const ZBDPlugIn& plugIn) {
    _sync->sync([&] { _annotations->setAnnotation(annotation, plugIn); });
}

void ZBDatabase::setAnnotations(std::span<const AnnotationChange> changes) {
    _sync->sync([&] { _annotations->setAnnotations(changes); });
}

void ZBDatabase::notifyAnnotationChange() { _platform.notifications.post(zembra::annotationChangeNotification); }

void ZBDatabase::autoElect(const ZBDPlugIn& plugIn) {
    _sync->assertCurrent();
    auto annotation = MutableDictionary::copyOf(_annotations->annotationForPlugIn(plugIn).value_or(Dictionary()));
    const auto election = annotation[zembra::annotationKey::election].integerValue();
    if (election && *election != 0) return;
    annotation.set(zembra::annotationKey::election, 1);
    _annotations->setAnnotation(annotation, plugIn);
}

} // namespace zbd
