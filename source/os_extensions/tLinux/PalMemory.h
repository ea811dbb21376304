// Platform layer: the library's one allocation point.
//
// Every object, ring, pool and semaphore the library owns is allocated here,
// at start-up or at a log reconfiguration, never on a timing path. Tests can
// make the Nth allocation from now fail to check every failure path.
#ifndef QUELTA_TLINUX_PALMEMORY_H
#define QUELTA_TLINUX_PALMEMORY_H

#include <atomic>
#include <cstddef>
#include <cstdint>

namespace quelta {

void* PalMemAlloc(size_t bytes);        // null when out of memory (or injected)
void* PalMemAllocZeroed(size_t bytes);  // as PalMemAlloc, filled with zeros
void PalMemFree(void* p);

// Fault injection: when > 0, counts allocations down and fails the one that
// brings it to 0. 0 (the default) disables injection.
extern std::atomic<int32_t> gPalAllocFailCountdown;
// Number of allocations made so far (for tests that enumerate failure points).
extern std::atomic<uint32_t> gPalAllocCount;

}  // namespace quelta

#endif
