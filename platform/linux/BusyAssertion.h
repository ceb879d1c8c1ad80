#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/Root.h"

#include <memory>
#include <string>

namespace platform::linux_ {

/// For plug-ins: while one exists, the calling process is a busy instance of the plug-in, and nobody who asks politely
/// replaces the plug-in under it. Ends with the process at the latest; a forked child does not have it. Several, of one
/// plug-in too, may exist at a time. Any thread.
class BusyAssertion {
public:
    BusyAssertion(const Root& root, const std::string& bundleIdentifier);
    ~BusyAssertion();
    BusyAssertion(const BusyAssertion&) = delete;
    BusyAssertion& operator=(const BusyAssertion&) = delete;

    /// Why the process does not count as busy; none when it does. Errors carry errno: EINVAL and ENAMETOOLONG for
    /// identifiers that cannot be a file name, EPERM and EACCES for directories of others, else what the system gave.
    const Failure& failure() const { return _failure; }

private:
    Failure hold(const Root& root, const std::string& bundleIdentifier);

    std::shared_ptr<Descriptor> _file; // shared by all of one plug-in in this process
    Failure _failure;
};

} // namespace platform::linux_
