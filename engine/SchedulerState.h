// The tick scheduler's library-wide state.
//
// Shared by the timer thread (tick service) and any number of caller threads.
// Every word is a relaxed atomic and every ClockTime a single 64-bit atomic,
// so no reader sees a torn time and the state is data-race free. Decisions
// that must agree with each other (list links, the arming of the earliest
// deadline) are made under gSchedLock; see WaitList.h. The callback words
// are the exception: set and taken without the lock, they carry what the
// setter wrote before, through the release/acquire pairs of HandOff.h.
#ifndef QUELTA_ENGINE_SCHEDULERSTATE_H
#define QUELTA_ENGINE_SCHEDULERSTATE_H

#include <atomic>
#include <cstdint>

#include "engine/ClockTimeOps.h"
#include "quelta/ClockTime.h"

namespace quelta {

extern AtomicClockTime gNextTick;               // next 1 ms tick (monotonic)
extern AtomicClockTime gTickPeriod;             // 0 at load, 1,000,000 at start
extern AtomicClockTime gNextDeadline;           // armed / earliest found so far
// The callback times (NeverTime = none; the global one on the global clock):
// callers store them under gSchedLock, together with the arming. The timer
// thread claims a due one without the lock, by a compare-exchange to NeverTime
// against the value it read, so that a callback never waits for a caller in
// the lock; a store made meanwhile makes the claim fail, and the pass's
// locked part looks again.
extern AtomicClockTime gMonotonicCallbackTime;
extern AtomicClockTime gGlobalCallbackTime;
extern std::atomic<QueltaCallbackFn> gCallbackFn;       // PublishCallback / TakeCallback
extern std::atomic<void*> gCallbackArg;
extern std::atomic<QueltaTickCallbackFn> gTickCallback;  // PublishTickCallback / TakeTickCallback
extern std::atomic<uint32_t> gGeneration;       // no writer in the library
extern std::atomic<WaitNode*> gWaitNodePool;    // 128 nodes, or null
extern std::atomic<WaitNode*> gFreeList;
// Written only under gSchedLock (release); an insert's placement walk reads
// it, and the nodes' next links, without the lock (acquire).
extern std::atomic<WaitNode*> gWaitList;
extern std::atomic<uint32_t> gEventSystemReady;
// Moved (release, under gSchedLock) after every change of the wait list's
// shape: link, unlink, detach. An insert reads it (acquire) before its
// lock-free placement walk and takes the place found only when it still
// reads the same under the lock.
extern std::atomic<uint32_t> gWaitListVersion;
extern std::atomic<uint32_t> gControlFlag;

constexpr uint64_t kTickPeriodClocks = 1000000;

}  // namespace quelta

#endif
