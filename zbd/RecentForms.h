#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

namespace zbd {

class ZBDPlugIn;

/// Bounds how many records keep a form: those whose forms were last asked for again and again. So memory is spent on
/// the plug-ins in use, not on each that is installed. Any thread.
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

    /// Has the record that was first forget its form when there is no room for this one.
    void keep(std::weak_ptr<const ZBDPlugIn> plugIn);

private:
    std::mutex _mutex;
    std::uint64_t _made = 0;
    std::vector<std::weak_ptr<const ZBDPlugIn>> _keeping; // a ring
    std::size_t _oldest = 0;
};

} // namespace zbd
