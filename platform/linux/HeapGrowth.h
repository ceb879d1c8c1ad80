#pragma once

#include <cstddef>

namespace platform::linux_ {

/// While it exists, the heap has room for what somebody is about to make, in large pages where the system gives them:
/// taking thousands of small pages costs more time than what is written into them. One at a time.
class HeapGrowth {
public:
    /// `size` in bytes is an estimate, and nothing but time depends on it. What was not used goes back to the system.
    explicit HeapGrowth(std::size_t size);
    ~HeapGrowth();
    HeapGrowth(const HeapGrowth&) = delete;
    HeapGrowth& operator=(const HeapGrowth&) = delete;
};

} // namespace platform::linux_
