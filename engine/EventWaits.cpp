// Global-clock and event waits: the waits that go through the tick service.
//
// With the tick service in use they take a wait node from the pool (at most
// 128 such waits are pending at once) and block until their deadline; without
// it they fall back to plain sleeps and semaphore waits with millisecond
// timeouts.
//
// A blocking wait whose deadline is on the monotonic clock ends on the
// waiter's own timed wake at that deadline: the kernel's timer needs no
// second thread, so such a wait costs one wake-up, and its node is held, not
// queued, since firing it could add nothing. In particular
// quelta_iTSCEvent_Wait_C never posts the caller's semaphore itself: a post
// that the wait returns 0 for, or that is still pending when it returns 1,
// is always somebody else's, so the wait can neither lose one nor leave one
// behind. A global-clock wait is queued as well, because the wall clock may
// be stepped under it and the generation may change: the tick service then
// fires its node, which posts the node's own semaphore.
//
// Every blocking wait blocks through BlockOn, so that unloading the library
// ends it (result 3, or abort flag 1) before anything it uses is destroyed.
#include <time.h>

#include <cstdint>

#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/LibraryUse.h"
#include "engine/SchedulerState.h"
#include "engine/U64Arith.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/RuntimeSemaphore.h"
#include "quelta/quelta.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;
constexpr uint32_t kNoTimeout = 0xFFFFFFFFu;
constexpr uint32_t kAbortNotStarted = 0xFFFFFFFFu;
constexpr uint32_t kCannotServe = 3;

iKPusTimingEngine* Engine() { return gEngine.load(std::memory_order_acquire); }

// The monotonic deadline as a semaphore-wait bound. False when there is no
// usable bound (more than 68 years ahead: wait for the node alone); a time
// before 0 in the library's order has passed and gives {0, 0}.
bool WaitBound(uint64_t monotonic, timespec& out) {
    out = timespec{0, 0};
    if (static_cast<uint32_t>(monotonic >> 32) == 0xFFFFFFFFu) return true;
    const uint64_t seconds = monotonic / 1000000000u;
    if (seconds > 0x7FFFFFFFu) return false;
    out.tv_sec = static_cast<time_t>(seconds);
    out.tv_nsec = static_cast<long>(monotonic - seconds * 1000000000u);
    return true;
}

// Blocks on `semaphore` until the monotonic time `deadline`.
BlockResult BlockUntil(PalSemaphore* semaphore, uint64_t deadline) {
    timespec bound;
    const bool bounded = WaitBound(deadline, bound);
    return BlockOn(semaphore, bounded ? &bound : nullptr);
}

// How a node-using wait ended.
enum class WaitEnd {
    kDue,      // its deadline has come
    kAborted,  // its node was fired for a new generation of the global clock
    kStopped,  // the library is being unloaded
};

// Blocks on the node's own semaphore until a monotonic deadline. Nothing
// posts it but the stop (the node is held, not queued): the waiter's own
// timed wake ends the wait.
WaitEnd WaitUntilMonotonic(WaitNode* node, uint64_t deadline) {
    PalSemaphore* own = node->ownSemaphore.load(kRelaxed);
    for (;;) {
        switch (BlockUntil(own, deadline)) {
            case BlockResult::kTimedOut: return WaitEnd::kDue;
            case BlockResult::kStopped: return WaitEnd::kStopped;
            case BlockResult::kFailed: PalSleepMilliseconds(1); break;
            case BlockResult::kTaken: break;  // a stray post: the deadline stands
        }
    }
}

// Blocks on the queued node's own semaphore until the global clock reaches
// `deadline`. The global clock is the one the conversion defines (the
// kernel's call where it exists): each round measures the offset between it
// and the monotonic clock once, and the wait is over when the monotonic clock
// has passed the deadline's equivalent at that offset, the rule the tick
// service fires nodes by. The end is never judged from a wall-clock reading
// of its own, which could disagree with the conversion and then end the wait
// early or keep it spinning on a bound already past. A step of the wall clock
// moves the equivalent: the tick service's firing (a step forward), or the
// timed wake finding the equivalent later than it was (a step back), starts
// a new round. An abortable node fired while the generation differs from the
// caller's ends the wait as aborted.
WaitEnd WaitUntilGlobal(WaitNode* node, const ClockTime& deadline, uint32_t generation) {
    PalSemaphore* own = node->ownSemaphore.load(kRelaxed);
    for (;;) {
        if (node->abortable.load(kRelaxed) != 0 && node->fireCount.load(std::memory_order_acquire) != 0 &&
            gGeneration.load(kRelaxed) != generation) {
            return WaitEnd::kAborted;
        }
        uint64_t now = 0;
        const uint64_t bound = GlobalToMonotonicAt(ToU64(deadline), GlobalOffset(&now));
        if (Due(bound, now)) return WaitEnd::kDue;
        node->selfWakeAt.store(bound == 0 ? 1 : bound, kRelaxed);
        switch (BlockUntil(own, bound)) {
            case BlockResult::kStopped: return WaitEnd::kStopped;
            case BlockResult::kFailed: PalSleepMilliseconds(1); break;
            case BlockResult::kTaken:
            case BlockResult::kTimedOut: break;
        }
    }
}

// The waiter of a queued global-clock node is about to block until the
// deadline's monotonic equivalent: the timer thread need not wake for it.
void ExpectSelfWake(WaitNode* node, const ClockTime& deadline) {
    const uint64_t bound = GlobalToMonotonicAt(ToU64(deadline), GlobalOffset());
    node->selfWakeAt.store(bound == 0 ? 1 : bound, kRelaxed);
}

// A node as the waits take it: nothing fired, not queued yet.
void PrepareNode(WaitNode* node, uint32_t isGlobal, uint8_t abortable, uint32_t autoRelease,
                 PalSemaphore* semaphore) {
    node->fireCount.store(0, kRelaxed);
    node->prev.store(nullptr, kRelaxed);
    node->isGlobal.store(isGlobal, kRelaxed);
    node->abortable.store(abortable, kRelaxed);
    node->autoRelease.store(autoRelease, kRelaxed);
    node->semaphore.store(semaphore, kRelaxed);
    node->selfWakeAt.store(0, kRelaxed);
}

// Global-clock wait without the tick service: one sleep of the remaining time
// rounded to the nearest millisecond, plus one millisecond.
void SleepUntilGlobal(iKPusTimingEngine* engine, const ClockTime* target, ClockTime* timeAfter) {
    ClockTime now;
    engine->ReadGlobal6(now);
    if (Earlier(now, *target)) {
        ClockTime d = FromU64(ToU64(*target) - ToU64(now) + 500000u);
        uint32_t ms;
        if (d.high == 0) {
            ms = d.low / 1000000u;
        } else {
            ClockTime divisor{1000000u, 0};
            U64DivMod(d, divisor);
            ms = d.low;
        }
        ms += 1;
        if (ms == 0) ms = 1;
        PalSleepMilliseconds(ms);
    }
    engine->ReadGlobal6(now);
    if (timeAfter != nullptr) *timeAfter = now;
}

uint32_t ResultOf(BlockResult r) {
    switch (r) {
        case BlockResult::kTaken: return 0;
        case BlockResult::kTimedOut: return 1;
        case BlockResult::kStopped: return kCannotServe;
        case BlockResult::kFailed: break;
    }
    return 2;
}

}  // namespace

}  // namespace quelta

using namespace quelta;

extern "C" QUELTA_EXPORT void quelta_iTSC_WaitUntilGlobalClocks64_C(const ClockTime* target,
                                                                    uint32_t* abortFlag,
                                                                    ClockTime* timeAfter,
                                                                    uint32_t generation) {
    CallerInside inside;
    iKPusTimingEngine* engine = inside ? Engine() : nullptr;
    if (engine == nullptr) {  // the library is not up, or is going
        if (abortFlag != nullptr) *abortFlag = kAbortNotStarted;
        return;
    }
    if (abortFlag != nullptr) {
        *abortFlag = 0;
        if (generation != gGeneration.load(kRelaxed)) {
            *abortFlag = 1;
            return;
        }
    }
    if (engine->UsesTickService() == 0) {
        if (target != nullptr) SleepUntilGlobal(engine, target, timeAfter);
        return;
    }
    if (gEventSystemReady.load(std::memory_order_acquire) == 0) {
        if (abortFlag != nullptr) *abortFlag = kAbortNotStarted;
        return;
    }
    WaitNode* node = nullptr;
    if (target != nullptr && (target->low != 0 || target->high != 0)) node = TakeFreeNode();
    if (node != nullptr) {
        // Without an abort flag the caller could not be told that a new
        // generation cut the wait short, so such a wait is not abortable.
        PrepareNode(node, 1, abortFlag != nullptr ? 1 : 0, 0, node->ownSemaphore.load(kRelaxed));
        const ClockTime copy = *target;
        WaitEnd end = WaitEnd::kDue;
        ExpectSelfWake(node, copy);
        if (InsertWaitNode(node, &copy, nullptr, nullptr) == 0) end = WaitUntilGlobal(node, copy, generation);
        if (abortFlag != nullptr && (end == WaitEnd::kStopped || generation != gGeneration.load(kRelaxed))) {
            *abortFlag = 1;
        }
        ReleaseWaitNode(node);
    }
    ClockTime now;
    engine->ReadGlobal6(now);
    if (timeAfter != nullptr) *timeAfter = now;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_Callback_C(PalSemaphore* semaphore,
                                                                   const ClockTime* deadline,
                                                                   QueltaWaitCallbackFn callback,
                                                                   void* callbackArg,
                                                                   uint32_t isGlobal,
                                                                   WaitNode** nodeOut) {
    CallerInside inside;
    iKPusTimingEngine* engine = inside ? Engine() : nullptr;
    if (engine == nullptr || engine->UsesTickService() == 0 ||
        gEventSystemReady.load(std::memory_order_acquire) == 0 || deadline == nullptr) {
        return kCannotServe;
    }
    WaitNode* node = TakeFreeNode();
    if (node == nullptr) return kCannotServe;
    const ClockTime copy = *deadline;
    const bool ownSemaphore = semaphore == nullptr && callback == nullptr;
    if (!ownSemaphore) {
        // Queued for the tick service, which posts, calls back and (without
        // nodeOut) gives the node back by itself.
        PrepareNode(node, isGlobal, 0, nodeOut != nullptr ? 0 : 1, semaphore);
        if (nodeOut != nullptr) *nodeOut = node;
        return InsertWaitNode(node, &copy, callback, callbackArg);
    }
    // A plain wait until a time on the chosen clock; a node handed out
    // through nodeOut has been given back again when the call returns.
    PrepareNode(node, isGlobal, 0, 0, node->ownSemaphore.load(kRelaxed));
    if (nodeOut != nullptr) *nodeOut = node;
    uint32_t r;
    WaitEnd end = WaitEnd::kDue;
    if (isGlobal != 0) {
        ExpectSelfWake(node, copy);
        r = InsertWaitNode(node, &copy, callback, callbackArg);
        if (r == 0) end = WaitUntilGlobal(node, copy, 0);
    } else {
        node->deadline.store(ToU64(copy), kRelaxed);
        r = TimerServesNow() ? 0 : 1;  // without a timer the call is refused at once, as ever
        if (r == 0) end = WaitUntilMonotonic(node, ToU64(copy));
    }
    ReleaseWaitNode(node);
    return end == WaitEnd::kStopped ? kCannotServe : r;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_C(PalSemaphore* semaphore, uint32_t timeout) {
    if (semaphore == nullptr) return kCannotServe;
    CallerInside inside;
    iKPusTimingEngine* engine = inside ? Engine() : nullptr;
    if (engine == nullptr) return kCannotServe;
    if (engine->UsesTickService() == 0) {
        // Without the tick service: no timeout, or the timeout cut down to
        // whole milliseconds plus one.
        if (timeout == kNoTimeout) return ResultOf(BlockOn(semaphore, nullptr));
        const timespec bound = quelta_runtime::DeadlineAfterMs(CLOCK_MONOTONIC, static_cast<int32_t>(timeout / 1000u + 1u));
        return ResultOf(BlockOn(semaphore, &bound));
    }
    if (gEventSystemReady.load(std::memory_order_acquire) == 0) return kCannotServe;
    if (timeout == kNoTimeout) return ResultOf(BlockOn(semaphore, nullptr));

    ClockTime now;
    engine->ReadMonotonic4(now);
    const uint32_t clocks = engine->MicrosecondsToClocks32Fwd(timeout);
    const uint64_t deadline = ToU64(now) + clocks;
    // The node stands for this pending wait in the pool; it is held, not
    // queued: the timeout is this thread's own timed wake at the deadline,
    // and the caller's semaphore is posted by nobody but the caller's peers.
    WaitNode* node = TakeFreeNode();
    if (node == nullptr) return kCannotServe;
    PrepareNode(node, 0, 0, 0, nullptr);
    node->deadline.store(deadline, kRelaxed);
    uint32_t result = 1;  // no serving timer: refused at once, as ever
    if (TimerServesNow()) result = ResultOf(BlockUntil(semaphore, deadline));
    ReleaseWaitNode(node);
    return result;
}
