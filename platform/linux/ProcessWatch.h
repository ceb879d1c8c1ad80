#pragma once

#include "platform/linux/Descriptor.h"

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace platform::linux_ {

/// Tells which of many processes have ended, at a cost that does not grow with those that live on. Callable from any
/// thread.
class ProcessWatch {
public:
    ProcessWatch();

    /// Watches a pidfd; `name` comes back when its process has ended, once. Zero, or an errno value.
    int add(Descriptor process, std::string name);
    /// Readable while `takeEnded` has something to tell.
    int descriptor() const { return _epoll.get(); }
    std::vector<std::string> takeEnded();

private:
    struct Watched {
        Descriptor process;
        std::string name;
    };
    std::mutex _mutex;
    Descriptor _epoll;
    std::map<std::uint64_t, Watched> _watched; // guarded by _mutex
    std::uint64_t _next = 0;                   // guarded by _mutex
};

} // namespace platform::linux_
