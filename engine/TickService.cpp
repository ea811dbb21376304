// The tick service routine: one pass per timer expiry, on the timer thread.
//
// Every decision of a pass is taken against one monotonic reading `now` (and
// its global equivalent). gNextDeadline is recomputed from scratch on every
// pass; each change to it, here and in the callers' arming paths, is made
// under gSchedLock so that the final arming of a pass can never overwrite an
// earlier deadline that a caller armed meanwhile. Callbacks and semaphore
// posts run without the lock.
#include "engine/TickService.h"

#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"

namespace quelta {

uint64_t (*gTickNowOverride)() = nullptr;

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;

// The routine's own state, kept from pass to pass for the life of the process.
std::atomic<bool> sGenerationSeen{false};
std::atomic<uint32_t> sLastGeneration{0};
std::atomic<uint64_t> sTickSerial{0};

uint64_t ReadNow(iKPusTimingEngine* engine) {
    if (gTickNowOverride != nullptr) return gTickNowOverride();
    ClockTime now;
    engine->ReadMonotonic5(now);
    return ToU64(now);
}

void CallCallback(const ClockTime* now) {
    QueltaCallbackFn fn = gCallbackFn.load(std::memory_order_acquire);
    if (fn == nullptr) return;
    void* arg = gCallbackArg.load(kRelaxed);
    fn(arg != nullptr ? arg : const_cast<ClockTime*>(now));
}

// Takes a due callback time: NeverTime replaces it before the callback runs,
// so the callback may set its next time. False when a caller changed the time
// between our read and the exchange (the new value is looked at again).
bool TakeDueCallbackTime(AtomicClockTime& cell, uint64_t seen) {
    return cell.CompareExchange(seen, kNeverTime64);
}

void FoldLocked(uint64_t t) {
    SchedLockGuard lock;
    uint64_t d = gNextDeadline.Load();
    Fold(t, d);
    gNextDeadline.Store(d);
}

// Steps 1-3: start the recomputation and serve the tick when it is due.
bool ServeTick(tKPusTimingEngine* engine, uint64_t& nowOut) {
    SchedLockGuard lock;
    gNextDeadline.Store(kNeverTime64);
    uint64_t now = ReadNow(engine);
    nowOut = now;
    bool tickDue = false;
    uint64_t nextTick = gNextTick.Load();
    if (Due(nextTick, now)) {
        if (engine->statsEnabled.load(kRelaxed) != 0) {
            int32_t count = engine->statsCount.load(kRelaxed);
            if (count >= 0 && count < static_cast<int32_t>(kStatsSamples)) {
                engine->stats.jitterSamples[count].store(static_cast<uint32_t>(now - nextTick), kRelaxed);
                engine->statsCount.store(count + 1, std::memory_order_release);
            }
        }
        nextTick += gTickPeriod.Load();
        // Missed ticks are not replayed: the grid restarts from the present.
        if (Earlier(nextTick, now)) nextTick = now;
        gNextTick.Store(nextTick);
        tickDue = true;
    }
    gNextDeadline.Store(gNextTick.Load());
    return tickDue;
}

// A callback time that is due at `nowOnItsClock` is taken (NeverTime first,
// so the callback may set its next one) and the callback runs with the pass's
// monotonic `now`; otherwise the time, converted to the monotonic clock by
// `global` when it is a global-clock time, is folded into gNextDeadline.
void ServeCallbackTime(AtomicClockTime& cell, uint64_t nowOnItsClock, const ClockTime& now,
                       iKPusTimingEngine* global) {
    for (;;) {
        const uint64_t t = cell.Load();
        if (Due(t, nowOnItsClock)) {
            if (!TakeDueCallbackTime(cell, t)) continue;  // changed meanwhile
            CallCallback(&now);
            return;
        }
        if (global == nullptr) {
            FoldLocked(t);
            return;
        }
        // The conversion is made on every pass; when it is earlier it is
        // made once more for the value stored.
        const uint64_t converted = ToU64(global->GlobalToMonotonic(FromU64(t)));
        if (IsNever(t)) return;  // NeverTime cancels: never a converted instant
        SchedLockGuard lock;
        if (Earlier(converted, gNextDeadline.Load())) {
            gNextDeadline.Store(ToU64(global->GlobalToMonotonic(FromU64(t))));
        }
        return;
    }
}

}  // namespace

void ResetTickServiceState() {
    sGenerationSeen.store(false, kRelaxed);
    sLastGeneration.store(0, kRelaxed);
    sTickSerial.store(0, kRelaxed);
}

void TickServiceRoutine() {
    tKPusTimingEngine* engine = gEngine.load(std::memory_order_acquire);
    if (engine == nullptr) return;
    iKPusTimingEngine* slots = engine;
    if (!sGenerationSeen.load(kRelaxed)) {
        sLastGeneration.store(gGeneration.load(kRelaxed), kRelaxed);
        sGenerationSeen.store(true, kRelaxed);
    }

    for (;;) {
        uint64_t now64 = 0;
        const bool tickDue = ServeTick(engine, now64);
        const ClockTime now = FromU64(now64);

        // The monotonic callback time, then the global one, which is compared
        // on the global clock so that a step of the wall clock moves it along.
        ServeCallbackTime(gMonotonicCallbackTime, now64, now, nullptr);
        const uint64_t nowGlobal = ToU64(slots->MonotonicToGlobal(now));
        ServeCallbackTime(gGlobalCallbackTime, nowGlobal, now, slots);

        // Abortable global-clock waits end when the clock's generation moved.
        uint32_t generation = gGeneration.load(kRelaxed);
        if (generation != sLastGeneration.load(kRelaxed)) {
            sLastGeneration.store(generation, kRelaxed);
            FireAbortableGlobalNodes();
        }

        // Expired heads, in list order; the first one not due is folded in.
        // Global-clock heads are placed on the monotonic clock with this
        // pass's own pair of readings, so the lock sees no conversion.
        const int64_t offset = GlobalOffsetOf(now64, nowGlobal);
        while (FireHeadIfDue(now64, offset)) {
        }

        if (tickDue) {
            QueltaTickCallbackFn tick = gTickCallback.load(std::memory_order_acquire);
            if (tick != nullptr) {
                tick(sTickSerial.load(kRelaxed));
                sTickSerial.fetch_add(1, kRelaxed);
            }
        }

        {
            SchedLockGuard lock;
            uint64_t next = gNextDeadline.Load();
            if (IsNever(next)) return;
            if (ArmTimer(FromU64(next)) != 0) return;
        }
        // No serving timer: nothing would run the next pass. Repeating would
        // spin on this thread forever, so the pass ends here.
        if (!TimerServing()) return;
    }
}

}  // namespace quelta
