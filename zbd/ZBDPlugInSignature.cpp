#include "zbd/ZBDPlugInSignature.h"

#include "platform/Hashing.h"
#include "platform/Uuid.h"

namespace zbd {

ZBDPlugInSignature::ZBDPlugInSignature()
    : _cdhash(platform::sha1(platform::UUID::random().text())), _requirement("dummy requirement") {}

std::shared_ptr<ZBDPlugInSignature> ZBDPlugInSignature::initWithURL(const platform::URL&, platform::Failure*) {
    return std::shared_ptr<ZBDPlugInSignature>(new ZBDPlugInSignature());
}

} // namespace zbd
