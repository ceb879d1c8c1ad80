#include "platform/linux/TransportFrame.h"

#include <cstdlib>
#include <string>
#include <string_view>

// Walks a stream of frames as a connection does. A well-formed frame comes out again byte for byte, and a stream is
// judged alike whether it comes at once or ends earlier.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace platform;
    using namespace platform::linux_::qmx;
    std::string_view bytes(reinterpret_cast<const char*>(data), size);
    while (true) {
        const FrameScan scan = scanFrame(bytes);
        if (scan.outcome != FrameScan::Outcome::complete) return 0;
        if (scanFrame(bytes.substr(0, scan.size - 1)).outcome != FrameScan::Outcome::incomplete) std::abort();
        const auto content = decodeCompact(scan.frame.body, UUIDs::allowed);
        if (!content) return 0;
        std::string again;
        if (!appendFrame(again, scan.frame.type, scan.frame.id, *content)) std::abort();
        if (again != bytes.substr(0, scan.size)) std::abort();
        bytes.remove_prefix(scan.size);
    }
}
