#pragma once

#include "platform/Error.h"
#include "platform/linux/Landlock.h"

namespace platform::linux_ {

/// Takes system calls from this thread and all its children for good: those that look into or steer other processes,
/// administer the machine, make namespaces, or act on a file by its path or by a descriptor for reading without
/// Landlock having a say (modes, owners, times, attributes, flags); and sockets beyond `network`. Sockets of the own
/// machine are left only where they carry packets: such are the broker's, and not those of session buses, displays and
/// service managers, which start programs for whoever asks. `landlock` is the version that will be, or is, in force (0:
/// none); what it does not cover is refused here. The thread must have given up gaining privileges before.
Failure filterSystemCalls(Network network, int landlock);

} // namespace platform::linux_
