#pragma once

#include "platform/Preferences.h"

namespace zbd {

/// Reads the user's preferences that the daemon heeds.
class ZBDUserPrefs {
public:
    /// Adds the daemon's domain to those that `preferences` reads.
    explicit ZBDUserPrefs(platform::Preferences& preferences);

    /// The user's exclusions as stored now: by convention an array of rules dictionaries. Absent when there are none.
    platform::Value exclusions() const;

private:
    platform::Preferences& _preferences;
};

} // namespace zbd
