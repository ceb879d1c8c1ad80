#pragma once

#include "Zembra/AtomicField.h"
#include "platform/Error.h"
#include "platform/Url.h"

#include <memory>
#include <string>

namespace zbd {

/// The code-signature facts of a plug-in bundle. This platform reads no signatures: the facts are placeholders, and the
/// hash differs from record to record, so that nobody can take it for a measurement of the bundle.
class ZBDPlugInSignature {
public:
    /// Never fails; `error`, which may be null, is not touched.
    static std::shared_ptr<ZBDPlugInSignature> initWithURL(const platform::URL& url, platform::Failure* error);

    /// 20 bytes.
    std::string cdhash() const { return _cdhash.get(); }
    std::string requirement() const { return _requirement.get(); }

private:
    ZBDPlugInSignature();

    zembra::AtomicField<std::string> _cdhash;
    zembra::AtomicField<std::string> _requirement;
};

} // namespace zbd
