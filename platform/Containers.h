#pragma once

#include "platform/Error.h"

#include <string>

namespace platform {

/// Data containers: one private directory per user and identifier.
class Containers {
public:
    virtual ~Containers() = default;
    /// The path of the current user's container, made (mode 0700) when missing. An existing one of another owner or
    /// with an open mode is refused. The error carries the service's error number.
    virtual Result<std::string> userContainer(const std::string& identifier) = 0;
    /// Removes the current user's container if there is one and nothing is in it.
    virtual void discardEmpty(const std::string& identifier) = 0;
};

} // namespace platform
