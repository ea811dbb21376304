// Who is inside the library's node-using code, and how the stop gets them
// out before anything they use is destroyed.
//
// A caller enters (CallerInside) before it looks at the event system and
// leaves when it returns. Entering is refused once the stop has begun: the
// caller's increment and the stop's flag are both sequentially consistent, so
// either the caller sees the stop and turns back, or the stop sees the caller
// and waits for it to leave.
//
// A caller that blocks on a semaphore inside the library blocks through
// BlockOn, which lists the semaphore for the stop and gives up when the stop
// has begun. The stop wakes every listed semaphore's waiters (a broadcast on
// its condition, which posts nothing), and they find the stop and leave. The
// list has room for two waiters per wait node; a waiter beyond that blocks in
// 5 ms slices and looks for the stop between them.
#ifndef QUELTA_ENGINE_LIBRARYUSE_H
#define QUELTA_ENGINE_LIBRARYUSE_H

#include <time.h>

#include <atomic>
#include <cstdint>

#include "quelta/PalSemaphore.h"

namespace quelta {

// Set (sequentially consistent) when the stop begins, cleared at start-up.
extern std::atomic<bool> gStopping;
// Callers inside node-using code right now. Both words move only through
// the sequentially consistent steps of HandOff.h (EnterUnlessStopping,
// LeaveInside, BeginStop, NobodyInside).
extern std::atomic<int32_t> gCallersInside;

// Marks the caller inside for its scope; false (and not counted) once the
// stop has begun, and the caller must then turn back at once.
class CallerInside {
public:
    CallerInside();
    ~CallerInside();
    CallerInside(const CallerInside&) = delete;
    CallerInside& operator=(const CallerInside&) = delete;
    explicit operator bool() const { return entered_; }

private:
    bool entered_;
};

enum class BlockResult {
    kTaken,     // a post was taken
    kTimedOut,  // the deadline came, no post taken
    kFailed,    // the condition wait failed
    kStopped,   // the stop began: given up, no post taken
};

// Waits on `semaphore` until a post (taken) or the absolute CLOCK_MONOTONIC
// `deadline` (null: none), listed for the stop while it blocks.
BlockResult BlockOn(PalSemaphore* semaphore, const timespec* deadline);

// The stop: wakes every waiter blocked through BlockOn (gStopping set first).
void WakeBlockedWaiters();

// The stop: waits up to `graceMs` for every caller to leave; true when none
// is left inside.
bool WaitForCallersToLeave(uint32_t graceMs);

}  // namespace quelta

#endif
