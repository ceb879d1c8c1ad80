#include "platform/PropertyList.h"

#include <cstdlib>
#include <string>
#include <string_view>

// A value has one encoding, so whatever the decoder takes must come out again byte for byte.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view bytes(reinterpret_cast<const char*>(data), size);
    const auto value = platform::decodeCompact(bytes, platform::UUIDs::allowed);
    if (!value) return 0;
    std::string encoded;
    platform::appendCompact(encoded, *value);
    if (encoded != bytes) std::abort();
    (void)value->description();
    return 0;
}
