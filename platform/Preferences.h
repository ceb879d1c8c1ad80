#pragma once

#include "platform/PropertyList.h"

#include <string>

namespace platform {

/// The user's preferences: one property-list file per domain, of the current user on the current host.
class Preferences {
public:
    virtual ~Preferences() = default;
    /// Adds the domain to those that may be read.
    virtual void addDomain(const std::string& domain) = 0;
    /// Takes over what is stored now. False when it could not be read; the values then are as before.
    virtual bool synchronize(const std::string& domain) = 0;
    /// The value as of the last `synchronize`; absent when there is none.
    virtual Value value(const std::string& domain, const std::string& key) = 0;
};

} // namespace platform
