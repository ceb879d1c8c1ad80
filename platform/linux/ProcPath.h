#pragma once

#include <string>

namespace platform::linux_ {

/// The path under which the kernel offers an open descriptor of this process once more: to be opened anew with other
/// rights, or for calls that take no O_PATH descriptor.
inline std::string procPath(int descriptor) { return "/proc/self/fd/" + std::to_string(descriptor); }

} // namespace platform::linux_
