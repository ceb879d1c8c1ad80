// The annotation file: whatever it holds, the store opens, takes a change, and the file can be read back.
#include "tests/support/FakePlatform.h"
#include "zbd/ZBDAnnotationStore.h"
#include "zbd/ZBDPlugIn.h"

#include <cstdint>
#include <cstdlib>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    constexpr const char* path = "/var/db/Zembra-Annotations";
    support::FakePlatform fake;
    fake.files.files[path] = std::string(reinterpret_cast<const char*>(data), size);
    const auto plugIn = zbd::ZBDPlugIn::initWithCXData(fake.platform, fake.registry.install(support::dataPlugIn("a")));
    const auto store = zbd::ZBDAnnotationStore::initWithDatabase(fake.platform, std::nullopt);
    store->setAnnotation(platform::Dictionary{{"election", 1}}, *plugIn);
    const auto reopened = zbd::ZBDAnnotationStore::initWithDatabase(fake.platform, std::nullopt);
    // What came in the compact encoding may be more than XML can hold; then the old file stays, and nothing else is
    // lost.
    if (!support::processLog.messages("ops").empty()) return 0;
    if (reopened->annotations() != store->annotations()) std::abort();
    return 0;
}
