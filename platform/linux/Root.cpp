#include "platform/linux/Root.h"

#include <cstdlib>
#include <filesystem>

namespace platform::linux_ {

Root Root::ofProcess() {
    // A privileged program started by somebody else must not be led to a root of theirs.
    const char* named = secure_getenv("NORDANE_ROOT");
    if (named == nullptr || *named == '\0') return Root("/");
    std::error_code error;
    auto resolved = std::filesystem::weakly_canonical(std::filesystem::absolute(named), error);
    return Root(error ? named : resolved.string());
}

} // namespace platform::linux_
