#include "zbd/Transaction.h"
#include "zbd/ZBDServer.h"

namespace zbd {

void Transaction::addAnnotationForPlugIn(const ZBDPlugIn& plugIn, platform::MutableDictionary& form) {
    form.set(zembra::formKey::annotations, server()->annotationForPlugIn(plugIn).value_or(platform::Dictionary()));
}

void Transaction::annotatePlugIns() { fail(zembra::code::malformed, "\"annotate\" is not served by this version"); }

void Transaction::bulkAnnotatePlugIns() {
    fail(zembra::code::malformed, "\"bulk-annotate\" is not served by this version");
}

} // namespace zbd
