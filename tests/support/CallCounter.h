#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace support {

/// Counts calls from any thread, and lets a test wait for them.
class CallCounter {
public:
    void call() {
        const std::lock_guard lock(_mutex);
        ++_count;
        _called.notify_all();
    }
    int count() const {
        const std::lock_guard lock(_mutex);
        return _count;
    }
    /// False when there were fewer than `count` calls at the end of a generous time.
    bool waitFor(int count) const {
        std::unique_lock lock(_mutex);
        return _called.wait_for(lock, std::chrono::seconds(30), [&] { return _count >= count; });
    }

private:
    mutable std::mutex _mutex;
    mutable std::condition_variable _called;
    int _count = 0;
};

} // namespace support
