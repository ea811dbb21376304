// Platform layer: the library's one allocation point, with fault injection.
#include "tLinux/PalMemory.h"

#include <cstdlib>

namespace quelta {

std::atomic<int32_t> gPalAllocFailCountdown{0};
std::atomic<uint32_t> gPalAllocCount{0};

namespace {

// True when this allocation is the one a test asked to fail. The countdown is
// consumed with a compare-exchange so that two threads allocating at once
// never both see the same count, and exactly one allocation fails.
bool InjectedFailure() {
    int32_t left = gPalAllocFailCountdown.load(std::memory_order_relaxed);
    while (left > 0) {
        if (gPalAllocFailCountdown.compare_exchange_weak(left, left - 1,
                                                         std::memory_order_relaxed)) {
            return left == 1;
        }
    }
    return false;
}

}  // namespace

// Every call counts as one allocation, failed or not, so that a test can run
// an operation once, read how many allocations it made, and then fail each of
// them in turn with the countdown (which counts calls the same way).
void* PalMemAlloc(size_t bytes) {
    gPalAllocCount.fetch_add(1, std::memory_order_relaxed);
    if (InjectedFailure()) return nullptr;
    return std::malloc(bytes);
}

void* PalMemAllocZeroed(size_t bytes) {
    gPalAllocCount.fetch_add(1, std::memory_order_relaxed);
    if (InjectedFailure()) return nullptr;
    return std::calloc(1, bytes);
}

void PalMemFree(void* p) { std::free(p); }

}  // namespace quelta
