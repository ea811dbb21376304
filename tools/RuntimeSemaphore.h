// The runtime's side of the semaphores passed to the library's event waits.
//
// A runtime creates these with its own platform layer; the library waits on
// them and its timer thread posts them, so the record must have the layout of
// quelta/PalSemaphore.h and the operations must keep the same rules:
//   - a condition on CLOCK_MONOTONIC and a priority-inheriting mutex that
//     guards count and waiters;
//   - count never exceeds waiters + 1: with nobody waiting one post is
//     remembered, further ones are dropped;
//   - waits take a timeout in milliseconds (negative: none) and return 0
//     (taken), 1 (timed out) or 2 (any other failure); a timed-out waiter
//     takes no post, and trims count back within the bound as it leaves.
#ifndef QUELTA_TOOLS_RUNTIMESEMAPHORE_H
#define QUELTA_TOOLS_RUNTIMESEMAPHORE_H

#include <cstdint>

#include "quelta/PalSemaphore.h"

namespace qtools {

// 0, or the error number of the allocation or initialisation that failed
// (*out untouched then).
int RuntimeSemaphoreCreate(PalSemaphore** out);
uint32_t RuntimeSemaphoreWait(PalSemaphore* s, int32_t timeoutMs);
int RuntimeSemaphorePost(PalSemaphore* s);
// Posts not yet taken (read under the mutex).
int32_t RuntimeSemaphorePending(PalSemaphore* s);
// Takes a pending post if there is one, then destroys; 22 for null.
int RuntimeSemaphoreDestroy(PalSemaphore* s);

}  // namespace qtools

#endif
