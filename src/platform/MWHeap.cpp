#include "platform/MWHeap.h"

#include <malloc.h>
#include <sys/mman.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>

namespace {

constexpr size_t kLargePage = 2U << 20U;
constexpr int kMostKept = 32 << 20;

// Allocations from this size on are mapped on their own, and given back to the kernel when they are freed:
// only the few processes of very many mappings need any, and what one thread keeps free no other one can use.
constexpr int kLargeAllocation = 2 << 20;

}  // namespace

// Much of what a process's gathering takes is free again when the next one begins. Given back to the kernel
// in between, it would have to be cleared each time.
void MWPrepareHeap() {
    constexpr int kStep = 256 << 10;
    mallopt(M_TRIM_THRESHOLD, kMostKept);
    mallopt(M_MMAP_THRESHOLD, kLargeAllocation);
    mallopt(M_TOP_PAD, kStep);
}

void MWUseLargePages(const void* begin, size_t bytes) {
    const auto start = reinterpret_cast<uintptr_t>(begin);
    const uintptr_t first = (start + kLargePage - 1) / kLargePage * kLargePage;
    const uintptr_t end = (start + bytes) / kLargePage * kLargePage;
    if (first < end) {
        // NOLINTNEXTLINE(performance-no-int-to-ptr)
        madvise(reinterpret_cast<void*>(first), end - first, MADV_HUGEPAGE);
    }
}

// What is allocated from the thread's heap in one piece and given back at once stays there, untouched.
void MWExpectAllocations(size_t bytes) {
    constexpr size_t kMost = kMostKept / 2;
    if (bytes < kLargePage) {
        return;
    }
    bytes = std::min(bytes, kMost);
    mallopt(M_MMAP_THRESHOLD, kMostKept);
    void* const piece = std::malloc(bytes);
    mallopt(M_MMAP_THRESHOLD, kLargeAllocation);
    if (piece != nullptr) {
        MWUseLargePages(piece, bytes);
        std::free(piece);
    }
}
