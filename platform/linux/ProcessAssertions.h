#pragma once

#include "platform/ProcessAssertions.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/Root.h"

#include <mutex>
#include <set>
#include <string>
#include <sys/types.h>
#include <vector>

namespace platform::linux_ {

/// What else is reported of a busy instance, for the administrator who looks for it: integers.
inline constexpr std::string_view instanceProcessKey = "process"; // pid; absent for one in an unrelated pid namespace
inline constexpr std::string_view instanceUserKey = "user";       // user id

/// The directory of the busy files below the runtime directory: `<user id>/<bundle identifier>`.
std::string busyDirectory(const Root& root);

/// "vigild": an instance is busy while its process holds a lock (POSIX, of any byte) on the file
/// `<root>/run/nordane/vigild/<user id>/<bundle identifier>`; see BusyAssertion. The kernel says which process it is
/// and ends the lock with it, so nothing that stands in a file is believed and nothing can be left behind. Each user's
/// directory must belong to that user and be closed to others. The superuser's process counts the instances of every
/// user, any other those of its own user alone. Any thread; locks of this very process do not show.
class ProcessAssertions final : public platform::ProcessAssertions {
public:
    /// Makes the directory, if it can.
    explicit ProcessAssertions(const Root& root);

    /// In the order of the identifiers. One that cannot be a file name has no busy instances. What cannot be looked at
    /// is logged, in one line, and counts as not busy.
    std::vector<Dictionary> busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) override;

private:
    /// Brings `_users` up to date.
    void readUsers(int directory);
    /// False when what is in the directory must be listed.
    bool readChanges(int directory);
    /// False for a directory that stands in the name of somebody who does not own it.
    bool note(int directory, const std::string& name);

    const std::string _directory;
    std::mutex _lock;       // guards what follows
    std::set<uid_t> _users; // who may have instances
    Descriptor _changes;    // of the directory around theirs, as the kernel tells them
    dev_t _device = 0;      // that directory's
    ino_t _inode = 0;
    bool _toldOfOthers = false;
};

} // namespace platform::linux_
