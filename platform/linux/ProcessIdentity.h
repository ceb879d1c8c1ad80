#pragma once

#include "platform/linux/Descriptor.h"

#include <compare>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace platform::linux_ {

/// One process for good: a pid that is used again comes with another start time.
struct ProcessIdentity {
    pid_t pid = 0;
    std::string startTime; // clock ticks since boot, as /proc shows them

    /// The process now running under `pid`. None when there is none.
    static std::optional<ProcessIdentity> of(pid_t pid);
    /// From what `name` gave.
    static std::optional<ProcessIdentity> named(std::string_view name);
    /// As the name of a file.
    std::string name() const { return std::to_string(pid) + '-' + startTime; }
    friend auto operator<=>(const ProcessIdentity&, const ProcessIdentity&) = default;
};

/// The parent of the process, in the same moment. None when one of them is gone.
std::optional<ProcessIdentity> parentOf(const ProcessIdentity& process);

/// The user whom the process belongs to, now. None when it is gone, or is between users: its real, effective and saved
/// one differ while it runs, or did run, a set-user-id program.
std::optional<uid_t> ownerOf(pid_t pid);

/// A pidfd; not open, with errno set, on failure. Unlike the library's wrapper it is declared for C++ everywhere.
Descriptor openProcess(pid_t pid);
/// A pidfd of this very process. ESRCH when it has ended.
Descriptor openProcess(const ProcessIdentity& process);

/// True from the end of the process on, also before anyone has waited for it.
bool hasEnded(const Descriptor& process);

} // namespace platform::linux_
