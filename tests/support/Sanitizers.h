#pragma once

namespace support {

/// The undefined-behaviour checker looks at objects through a pipe of its own, so it takes every object for broken in a
/// process that has no descriptors left.
#if defined(__SANITIZE_ADDRESS__)
inline constexpr bool checkerNeedsDescriptors = true;
#else
inline constexpr bool checkerNeedsDescriptors = false;
#endif

} // namespace support
