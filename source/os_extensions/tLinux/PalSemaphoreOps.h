// Platform layer: the counting semaphore (record layout in quelta/PalSemaphore.h).
//
// count never exceeds waiters + 1: with nobody waiting the semaphore remembers
// at most one post. Waits take a timeout in milliseconds (negative: none) on
// CLOCK_MONOTONIC and return 0 taken, 1 timed out, 2 other failure.
#ifndef QUELTA_TLINUX_PALSEMAPHOREOPS_H
#define QUELTA_TLINUX_PALSEMAPHOREOPS_H

#include <time.h>

#include <cstdint>

#include "quelta/PalSemaphore.h"

namespace quelta {

int32_t PalSemaphoreCreate(PalSemaphore** out);
uint32_t PalSemaphoreWait(PalSemaphore* semaphore, int32_t timeoutMs);
// As PalSemaphoreWait, until an absolute CLOCK_MONOTONIC deadline (null:
// none). The waiter's own kernel timer ends the wait, so a wait bounded by a
// known deadline needs no second thread to wake it.
uint32_t PalSemaphoreWaitUntil(PalSemaphore* semaphore, const timespec* deadline);
// As PalSemaphoreWaitUntil, but gives up (result 3, no post taken) as soon as
// `abandon()` returns true; it is asked under the semaphore's mutex before the
// wait and after every wake-up (PalSemaphoreWakeAll makes one).
uint32_t PalSemaphoreWaitUntilUnless(PalSemaphore* semaphore, const timespec* deadline, bool (*abandon)());
int32_t PalSemaphorePost(PalSemaphore* semaphore);
// Wakes every waiter without posting: each looks at its own reason to go on.
void PalSemaphoreWakeAll(PalSemaphore* semaphore);
int32_t PalSemaphoreDestroy(PalSemaphore* semaphore);

}  // namespace quelta

#endif
