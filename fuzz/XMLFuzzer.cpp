#include "platform/PropertyList.h"

#include <cstdlib>
#include <string>
#include <string_view>

// Files in either encoding. What was read from XML can be written as XML; what was written is read as the same value.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view bytes(reinterpret_cast<const char*>(data), size);
    const auto value = platform::decodePropertyList(bytes);
    if (!value) return 0;
    const auto written = platform::encodeXML(*value);
    if (!written) {
        if (!bytes.starts_with(platform::compactMagic)) std::abort();
        return 0;
    }
    const auto again = platform::decodePropertyList(*written);
    if (!again || *platform::encodeXML(*again) != *written) std::abort();
    // A real that is not a number equals nothing.
    if (*again != *value && written->find("<real>nan</real>") == std::string::npos) std::abort();
    return 0;
}
