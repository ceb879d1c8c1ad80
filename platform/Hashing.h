#pragma once

#include <string>
#include <string_view>

namespace platform {

/// The 20 bytes of the SHA-1 digest. For identifiers only: SHA-1 protects nothing.
std::string sha1(std::string_view bytes);

} // namespace platform
