#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <optional>

namespace support {

/// Collects what arrives on other threads for the one that waits for it.
template <class T> class Mailbox {
public:
    void put(T item) {
        const std::lock_guard lock(_mutex);
        _items.push_back(std::move(item));
        _arrived.notify_all();
    }
    /// The next item; none after half a minute, which only a failing test waits for.
    std::optional<T> take() {
        std::unique_lock lock(_mutex);
        if (!_arrived.wait_for(lock, std::chrono::seconds(30), [this] { return !_items.empty(); })) return std::nullopt;
        std::optional<T> item(std::move(_items.front()));
        _items.pop_front();
        return item;
    }
    std::size_t size() const {
        const std::lock_guard lock(_mutex);
        return _items.size();
    }

private:
    mutable std::mutex _mutex;
    std::condition_variable _arrived;
    std::deque<T> _items;
};

} // namespace support
