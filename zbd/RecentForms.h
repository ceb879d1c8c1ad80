#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

namespace zbd {

/// Keeps alive what the forms last asked for again and again are made of; the records themselves hold it weakly. So
/// memory is spent on the plug-ins in use, not on each that is installed. Any thread.
class RecentForms {
public:
    /// What a form is made of takes about four kilobytes: this many take no more than a small daemon does, and no user
    /// has so many plug-ins in use at once.
    static constexpr std::size_t capacity = 2048;

    /// Counts a form that had to be made; `previous` is the answer for the same plug-in before, or 0. What was made is
    /// worth keeping when no more others than fit were made since: an answer that shows thousands displaces nothing.
    std::pair<std::uint64_t, bool> countMade(std::uint64_t previous) {
        const std::lock_guard lock(_mutex);
        ++_made;
        return {_made, previous != 0 && _made - previous <= capacity};
    }

    /// Lets go of what was kept first when there is no room.
    void keep(std::shared_ptr<const void> kept) {
        const std::lock_guard lock(_mutex);
        if (_kept.size() < capacity) {
            _kept.push_back(std::move(kept));
            return;
        }
        _kept[_oldest] = std::move(kept);
        _oldest = (_oldest + 1) % capacity;
    }

private:
    std::mutex _mutex;
    std::uint64_t _made = 0;
    std::vector<std::shared_ptr<const void>> _kept; // a ring
    std::size_t _oldest = 0;
};

} // namespace zbd
