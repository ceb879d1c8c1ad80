#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"

#include <cstdint>

namespace platform::linux_ {

/// The version of the kernel's Landlock interface; 0 when it has none or it is switched off.
int landlockVersion();

/// What a Landlock domain lets through, in rising order: connections to anywhere; serving others as well. Only TCP is
/// told apart, and only by version 4 and later.
enum class Network { none, client, server };

/// Rights on files below a place; they add up.
enum FileRights : unsigned {
    readFiles = 1,    // and list directories
    writeFiles = 2,   // that exist
    executeFiles = 4, // also as the loader of another program
    changeFiles = 8,  // write, make, rename and remove anything but devices
};

/// A set of Landlock rules: everything that has no rule is forbidden, and so are signals to processes outside and
/// sockets with abstract names of theirs, as far as the kernel's version goes (landlock(7)).
class LandlockRules {
public:
    /// Uses what version `version` offers, which must be at least 1.
    explicit LandlockRules(int version) : _version(version) {}

    Failure begin(Network network);
    /// `place` is an open file or directory; O_PATH is enough.
    Failure allow(int place, unsigned rights);
    /// The same by path. A place that does not exist is no failure.
    Failure allow(const char* path, unsigned rights);
    /// Confines the calling thread and all its children for good. It must have given up gaining privileges before.
    Failure enforce();

private:
    const int _version;
    std::uint64_t _handled = 0;
    Descriptor _rules;
};

} // namespace platform::linux_
