#pragma once

#include "platform/Error.h"
#include "platform/linux/Landlock.h"

#include <span>
#include <string_view>

namespace platform::linux_ {

/// What a service may do beyond its own places and the run-time libraries.
struct ConfinementProfile {
    std::string_view name;
    Network network;
    bool showsDocuments; // fonts and file types, to draw what others wrote
};

/// Null for a name that no profile has.
const ConfinementProfile* findConfinementProfile(std::string_view name);

/// A place of one service's own: an open file or directory (O_PATH is enough), and its `FileRights`.
struct OwnPlace {
    int place;
    unsigned rights;
};

/// Confines the calling thread and all its children for good: no new privileges, Landlock rules, a system call filter.
/// `landlock` is the version to use; with 0 the files stay open, so that is for development only. What was open before
/// stays open.
Failure confine(const ConfinementProfile& profile, std::span<const OwnPlace> own, int landlock = landlockVersion());

} // namespace platform::linux_
