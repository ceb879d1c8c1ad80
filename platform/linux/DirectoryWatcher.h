#pragma once

#include "platform/linux/Descriptor.h"

#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

namespace platform::linux_ {

/// Watches the entries of one directory, which may be removed, renamed and made anew meanwhile, on a thread of its own
/// (inotify(7)). The callbacks run one at a time, on that thread or inside `start` and `drain`, with a lock held: they
/// must not call back.
class DirectoryWatcher {
public:
    struct Callbacks {
        /// Makes the directory when it is missing; a failure shows when the directory is watched.
        std::function<void()> makeDirectory;
        /// An entry changed. `mask` is inotify's.
        std::function<void(std::uint32_t mask, std::string_view name)> changed;
        /// Changes may have been lost (too many at once, or another directory stands in the place): anything may be
        /// different now.
        std::function<void()> missed;
    };

    /// `events` are inotify's for entries. Nothing is watched before `start`.
    DirectoryWatcher(std::string directory, std::uint32_t events, Callbacks callbacks);
    ~DirectoryWatcher();
    DirectoryWatcher(const DirectoryWatcher&) = delete;
    DirectoryWatcher& operator=(const DirectoryWatcher&) = delete;

    /// True when changes from now on will be heard of. When the directory cannot be watched the thread tries again
    /// each second, and `missed` tells when it succeeded. Any thread, any number of times.
    bool start();

    /// Returns after the callbacks for every change made before the call.
    void drain();

private:
    void run();
    void watch();
    void drainLocked();

    const std::string _directory;
    const std::string _parent;
    const std::string _name; // of the directory in its parent
    const std::uint32_t _events;
    const Callbacks _callbacks;

    std::mutex _mutex;
    Descriptor _inotify;
    Descriptor _wakeUp; // an eventfd: look at `_isStopping` and at the time-out again
    int _watch = -1;
    int _parentWatch = -1; // tells when another directory takes the place; the old one may live on while it is open
    bool _isStopping = false;
    std::optional<std::thread> _thread;
};

} // namespace platform::linux_
