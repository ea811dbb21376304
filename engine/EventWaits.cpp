// Global-clock and event waits: the waits that go through the tick service.
//
// With the tick service in use they take a wait node, queue it in deadline
// order and let the timer thread fire it; without it they fall back to plain
// sleeps and semaphore waits with millisecond timeouts.
#include <time.h>

#include <cstdint>

#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/U64Arith.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {

std::atomic<int32_t> gActiveNodeWaiters{0};
std::atomic<bool> gStopping{false};

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;
constexpr uint32_t kNoTimeout = 0xFFFFFFFFu;
constexpr uint32_t kAbortNotStarted = 0xFFFFFFFFu;

// Marks a caller inside a wait that uses a wait node, so that the stop can
// let it leave before the pool and its semaphores are destroyed.
class NodeWaiterScope {
public:
    NodeWaiterScope() { gActiveNodeWaiters.fetch_add(1, std::memory_order_acq_rel); }
    ~NodeWaiterScope() { gActiveNodeWaiters.fetch_sub(1, std::memory_order_acq_rel); }
    NodeWaiterScope(const NodeWaiterScope&) = delete;
    NodeWaiterScope& operator=(const NodeWaiterScope&) = delete;
};

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

// Blocks on a node's own semaphore until its deadline. Two things end the
// wait: the tick service firing the node (which posts the semaphore), or the
// waiter's own timed wait reaching the deadline. The second needs no second
// thread to wake the waiter, so a wait ends one scheduler wake-up after its
// deadline instead of two. A global-clock deadline is converted afresh on
// every round and checked against the global clock itself, so a step of the
// wall clock moves it. The stop posts the semaphore too; the wait then ends.
void WaitUntilDue(iKPusTimingEngine* engine, WaitNode* node, const ClockTime& deadline, bool global) {
    PalSemaphore* semaphore = node->semaphore.load(kRelaxed);
    while (node->fireCount.load(std::memory_order_acquire) == 0) {
        if (gStopping.load(std::memory_order_acquire)) return;
        const uint64_t monotonic = global ? ToU64(engine->GlobalToMonotonicFwd(deadline)) : ToU64(deadline);
        timespec bound;
        const bool bounded = WaitBound(monotonic, bound);
        const uint32_t r = PalSemaphoreWaitUntil(semaphore, bounded ? &bound : nullptr);
        if (r == 1) {
            if (!global) return;  // the monotonic deadline has come
            ClockTime now;
            engine->ReadGlobal6(now);
            if (!Earlier(now, deadline)) return;
            // The wall clock was stepped back: wait on for the new instant.
        } else if (r == 2) {
            PalSleepMilliseconds(1);
        }
    }
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

}  // namespace

}  // namespace quelta

using namespace quelta;

extern "C" QUELTA_EXPORT void quelta_iTSC_WaitUntilGlobalClocks64_C(const ClockTime* target,
                                                                    uint32_t* abortFlag,
                                                                    ClockTime* timeAfter,
                                                                    uint32_t generation) {
    iKPusTimingEngine* engine = Engine();
    if (engine == nullptr) {  // the library is not up
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
    NodeWaiterScope scope;
    WaitNode* node = nullptr;
    if (target != nullptr && (target->low != 0 || target->high != 0)) node = TakeFreeNode();
    if (node != nullptr) {
        node->abortable.store(1, kRelaxed);
        node->fireCount.store(0, kRelaxed);
        node->prev.store(nullptr, kRelaxed);
        node->semaphore.store(node->ownSemaphore.load(kRelaxed), kRelaxed);
        node->autoRelease.store(0, kRelaxed);
        node->isGlobal.store(1, kRelaxed);
        const ClockTime copy = *target;
        if (InsertWaitNode(node, &copy, nullptr, nullptr) == 0) WaitUntilDue(engine, node, copy, true);
        if (abortFlag != nullptr && generation != gGeneration.load(kRelaxed)) *abortFlag = 1;
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
    iKPusTimingEngine* engine = Engine();
    if (engine == nullptr || engine->UsesTickService() == 0 ||
        gEventSystemReady.load(std::memory_order_acquire) == 0 || deadline == nullptr) {
        return 3;
    }
    NodeWaiterScope scope;
    WaitNode* node = TakeFreeNode();
    if (node == nullptr) return 3;
    node->autoRelease.store(1, kRelaxed);
    node->fireCount.store(0, kRelaxed);
    node->prev.store(nullptr, kRelaxed);
    node->abortable.store(0, kRelaxed);
    node->isGlobal.store(isGlobal, kRelaxed);
    const bool ownSemaphore = semaphore == nullptr && callback == nullptr;
    if (ownSemaphore) {
        node->semaphore.store(node->ownSemaphore.load(kRelaxed), kRelaxed);
        node->autoRelease.store(0, kRelaxed);
    } else {
        node->semaphore.store(semaphore, kRelaxed);
    }
    if (nodeOut != nullptr) {
        node->autoRelease.store(0, kRelaxed);
        *nodeOut = node;
    }
    const ClockTime copy = *deadline;
    const uint32_t r = InsertWaitNode(node, &copy, callback, callbackArg);
    if (!ownSemaphore) return r;
    if (r == 0) WaitUntilDue(engine, node, copy, isGlobal != 0);
    ReleaseWaitNode(node);
    return r;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_C(PalSemaphore* semaphore, uint32_t timeout) {
    if (semaphore == nullptr) return 3;
    iKPusTimingEngine* engine = Engine();
    if (engine == nullptr) return 3;
    if (engine->UsesTickService() == 0) {
        if (timeout == kNoTimeout) return PalSemaphoreWait(semaphore, -1);
        return PalSemaphoreWait(semaphore, static_cast<int32_t>(timeout / 1000u + 1u));
    }
    if (gEventSystemReady.load(std::memory_order_acquire) == 0) return 3;
    if (timeout == kNoTimeout) return PalSemaphoreWait(semaphore, -1);

    NodeWaiterScope scope;
    ClockTime now;
    engine->ReadMonotonic4(now);
    const uint32_t clocks = engine->MicrosecondsToClocks32Fwd(timeout);
    const ClockTime deadline = FromU64(ToU64(now) + clocks);
    WaitNode* node = nullptr;
    const uint32_t r = quelta_iTSCEvent_Wait_Callback_C(semaphore, &deadline, nullptr, nullptr, 0, &node);
    if (r == 3) return 3;
    if (r == 1) {
        ReleaseWaitNode(node);
        return 1;
    }
    // Bounded by the deadline itself, so the timeout ends with this thread's
    // own wake-up; the node, fired at the same deadline, is then cancelled.
    timespec bound;
    const bool bounded = WaitBound(ToU64(deadline), bound);
    const uint32_t waited = PalSemaphoreWaitUntil(semaphore, bounded ? &bound : nullptr);
    if (waited == 1) {
        // If the node fired meanwhile, its post is on the semaphore: take it
        // back, so the semaphore's count is as it was before the call.
        if (ReleaseWaitNodeReport(node) != 0) PalSemaphoreWait(semaphore, 0);
        return 1;
    }
    const uint32_t result = node->fireCount.load(std::memory_order_acquire) != 0 ? 1 : waited;
    ReleaseWaitNode(node);
    return result;
}
