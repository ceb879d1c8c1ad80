#include "platform/linux/HeapGrowth.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <malloc.h>
#include <sys/mman.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

constexpr std::size_t largePage = std::size_t{2} << 20U;
constexpr std::size_t maximumGrowth = std::size_t{1} << 30U;
constexpr int usualPadding = 128 << 10; // the allocator's own

} // namespace

HeapGrowth::HeapGrowth(std::size_t size) {
    size = std::min(size, maximumGrowth) / largePage * largePage;
    if (size == 0) return;
    // With the next piece that it takes from the system the allocator takes as much more, and keeps it.
    mallopt(M_TOP_PAD, static_cast<int>(size));
    void* volatile piece = std::malloc(std::size_t{1} << 20U); // volatile: compilers leave out what seems to be no use
    std::free(piece);
    const auto end = reinterpret_cast<std::uintptr_t>(sbrk(0));
    const std::uintptr_t begin = (end - size + largePage - 1) / largePage * largePage;
    // Advice on what the heap is not long enough for is refused.
    (void)madvise(reinterpret_cast<void*>(begin), end - begin, MADV_HUGEPAGE);
}

HeapGrowth::~HeapGrowth() { mallopt(M_TOP_PAD, usualPadding); }

} // namespace platform::linux_
