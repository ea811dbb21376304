// Callback registration and callback times, the tick callback, the control
// flag: the small operations through which callers steer the tick scheduler.
#include <cstdint>

#include "engine/ClockTimeOps.h"
#include "engine/HandOff.h"
#include "engine/LibraryFrame.h"
#include "engine/LibraryUse.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalThreads.h"

namespace quelta {

namespace {

// Stores a callback time; arms the timer first when it is earlier than the
// deadline the timer is armed for. Returns 0 (and stores nothing) only when
// arming was needed and no serving timer exists.
uint32_t StoreCallbackTime(AtomicClockTime& cell, uint64_t stored, uint64_t monotonic) {
    SchedLockGuard lock;
    if (Earlier(monotonic, gNextDeadline.Load())) {
        if (ArmTimer(FromU64(monotonic)) == 0) return 0;
        gNextDeadline.Store(monotonic);
    }
    cell.Store(stored);
    return 1;
}

}  // namespace

void RegisterTickCallbackImpl(QueltaTickCallbackFn fn) { PublishTickCallback<StdAtomics>(gTickCallback, fn); }

void UnregisterTickCallbackImpl(QueltaTickCallbackFn fn) {
    QueltaTickCallbackFn registered = gTickCallback.exchange(nullptr, std::memory_order_acq_rel);
    if (registered != fn) {
        PAL_DEBUG_PRINT("UnregisterTickCallback: %p is not the registered tick callback (%p); "
                        "cleared all the same",
                        reinterpret_cast<void*>(fn), reinterpret_cast<void*>(registered));
    }
}

void SetControlFlagImpl(uint32_t action) {
    if (action == 1) gControlFlag.store(1, std::memory_order_relaxed);
    if (action == 2) gControlFlag.store(0, std::memory_order_relaxed);
}

}  // namespace quelta

using namespace quelta;

extern "C" QUELTA_EXPORT void quelta_iTSC_SetCallback(QueltaCallbackFn fn, void* arg) {
    // The argument first: the tick service reads the function, then its argument.
    PublishCallback<StdAtomics>(gCallbackFn, gCallbackArg, fn, arg);
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_SetCallbackTime(const ClockTime* when, int32_t selector) {
    CallerInside inside;  // the engine and the timer stay while we use them
    if (!inside || when == nullptr) return 0;
    const uint64_t t = ToU64(*when);
    if (selector >= 0) return StoreCallbackTime(gMonotonicCallbackTime, t, t);
    tKPusTimingEngine* engine = gEngine.load(std::memory_order_acquire);
    if (engine == nullptr) return 0;
    iKPusTimingEngine* slots = engine;
    // NeverTime cancels: it must stay NeverTime, never a converted instant.
    const uint64_t monotonic = IsNever(t) ? t : ToU64(slots->GlobalToMonotonic(*when));
    return StoreCallbackTime(gGlobalCallbackTime, t, monotonic);
}
