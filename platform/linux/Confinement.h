#pragma once

#include <sys/types.h>

namespace platform::linux_ {

/// True when the process sees the same tree of files as this one or as the machine's first process: same mount
/// namespace, same root directory. A process that cannot be examined does not.
bool seesCommonFileTree(pid_t pid);

/// True when the process runs under a seccomp filter, in a foreign user namespace, or sees another tree of files, or
/// when it cannot be examined.
bool isConfined(pid_t pid);

} // namespace platform::linux_
