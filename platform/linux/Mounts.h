#pragma once

#include <string>

namespace platform::linux_ {

/// What is mounted at and below `path`, as text that differs when anything else is (proc_pid_mountinfo(5)).
std::string mountsAtAndBelow(const std::string& path);

} // namespace platform::linux_
