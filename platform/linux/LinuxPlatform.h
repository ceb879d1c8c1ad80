#pragma once

#include "platform/Platform.h"

#include <memory>

namespace platform::linux_ {

/// Every Linux service of one daemon process, constructed in order on the main thread before any other thread exists.
/// Installs the process's log, and blocks SIGTERM until a signal source takes it.
class LinuxPlatform {
public:
    LinuxPlatform();
    ~LinuxPlatform();
    LinuxPlatform(const LinuxPlatform&) = delete;
    LinuxPlatform& operator=(const LinuxPlatform&) = delete;

    /// Constructs the services: reads the registry and starts their threads. Once. The log works before.
    Platform& start();

    /// For the end of the process, which comes while threads still use the services: takes its other sockets out of
    /// the runtime directory (a listener takes its own when it is cancelled), and leaves to the next process what is
    /// known.
    void leave();

private:
    struct Services;
    std::unique_ptr<Services> _services;
};

} // namespace platform::linux_
