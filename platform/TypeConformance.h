#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace platform {

/// Knows which kind of content is a special case of which other. Any thread.
class TypeConformance {
public:
    virtual ~TypeConformance() = default;
    /// True when `type` is `super` or, however deep, a subtype of it. Unknown types conform to themselves alone.
    virtual bool conforms(std::string_view type, std::string_view super) = 0;
    /// Every type that `type` conforms to, itself first; for judging it against many types at once.
    virtual std::vector<std::string> supertypes(std::string_view type) = 0;
};

} // namespace platform
