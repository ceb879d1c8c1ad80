#pragma once

#include "platform/linux/Root.h"

#include <string>
#include <vector>

namespace platform::linux_ {

/// In the launcher's environment: start services also where the kernel cannot confine them. For development.
inline constexpr const char* allowUnconfinedVariable = "NORDANE_ALLOW_UNCONFINED";

/// Exit statuses of a launcher; below them are the service's own.
enum class LaunchStatus : int {
    usage = 120,
    noManager = 121,     // "ignitd" cannot be asked
    notRegistered = 122, // for the process that started the launcher
    refused = 123,       // the registration, the environment or the container is not good, or the bundle was replaced
    notConfined = 124,
    notExecuted = 125,
};

struct LaunchRefusal {
    LaunchStatus status;
    std::string reason;
};

/// Becomes the service that `name` (a path of an executable, or a bundle identifier) is registered as for the parent of
/// this process: asks "ignitd", which records this process as an instance; checks that bundle and executable are what
/// was registered; gives up all privileges, confines the process, and executes. The service keeps the standard
/// descriptors, starts in its data container, and gets `arguments` after its path. Returns only when it cannot. To be
/// called before any other thread exists.
LaunchRefusal becomeService(const Root& root, const std::string& name, const std::vector<std::string>& arguments);

} // namespace platform::linux_
