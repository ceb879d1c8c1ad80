#pragma once

#include "platform/PropertyList.h"

#include <cstddef>
#include <string_view>

namespace platform::linux_ {

struct DecodedMessage {
    Value content;
    std::size_t size; // bytes of memory that it takes, counted a little too high
};

/// As `decodeCompact` with UUIDs. Also refuses what takes more than `maximumSize` bytes of memory, before they are
/// taken.
Result<DecodedMessage> decodeMessage(std::string_view bytes, std::size_t maximumSize);

} // namespace platform::linux_
