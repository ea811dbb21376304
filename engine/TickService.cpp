// The tick service routine: one pass per timer expiry, on the timer thread.
//
// Every decision of a pass is taken against one monotonic reading `now` and
// its global equivalent. gNextDeadline is recomputed from scratch on every
// pass; each change to it, here and in the callers' arming paths, is made
// under gSchedLock so that the final arming of a pass can never overwrite an
// earlier deadline that a caller armed meanwhile.
//
// The timer thread must not wait for callers, and a caller holding the lock
// may have been preempted, so a pass takes the lock as seldom as it can: the
// clock reading and both conversions are made before it, and one hold serves
// the tick, the callback times' folding, the expired nodes and the arming.
// A due callback time is claimed and its callback made before the lock is
// taken at all, so a caller inside the lock never delays a callback. Only a
// pass that has something else to call (a node to post, the tick callback, a
// callback time set due meanwhile) leaves the lock for the calls and takes it
// once more to settle the fired nodes and arm.
#include "engine/TickService.h"

#include "engine/ClockTimeOps.h"
#include "engine/HandOff.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"

namespace quelta {

uint64_t (*gTickNowOverride)() = nullptr;

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;

// The routine's own state, kept from pass to pass for the life of the process
// (timer thread only; atomics so that tests may reset it between runs).
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
    void* arg = nullptr;
    QueltaCallbackFn fn = TakeCallback<StdAtomics>(gCallbackFn, gCallbackArg, arg);
    if (fn == nullptr) return;
    fn(arg != nullptr ? arg : const_cast<ClockTime*>(now));
}

// Claims a callback time that is due (NeverTime takes its place, so the
// callback may set the next one) and makes the callback. Needs no lock: the
// claim is one exchange against the time read, and a caller that changed the
// time meanwhile makes it fail; the locked part of the pass then looks again.
bool FireIfDue(AtomicClockTime& cell, uint64_t time, bool due, const ClockTime* nowTime) {
    if (!due || !cell.CompareExchange(time, kNeverTime64)) return false;
    CallCallback(nowTime);
    return true;
}

void FoldIntoNextDeadline(uint64_t t) {
    uint64_t d = gNextDeadline.Load();
    Fold(t, d);
    gNextDeadline.Store(d);
}

// Serves the tick when it is due at `now`, with its jitter sample; afterwards
// gNextDeadline is gNextTick. Lock held.
bool ServeTickLocked(tKPusTimingEngine* engine, uint64_t now) {
    bool tickDue = false;
    uint64_t nextTick = gNextTick.Load();
    if (Due(nextTick, now)) {
        if (engine->statsEnabled.load(kRelaxed) != 0) {
            RecordSample<StdAtomics>(engine->stats.jitterSamples, kStatsSamples, engine->statsCount,
                                     static_cast<uint32_t>(now - nextTick));
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

// What one pass found to do outside the lock.
struct PassWork {
    bool tickDue = false;
    bool callMonotonic = false;  // the monotonic callback time was set due meanwhile
    bool repeat = false;         // the global callback time changed under us
    uint32_t fired = 0;
    WaitNode* batch[kWaitNodeCount];
    uint32_t release[kWaitNodeCount];
};

// Arms the timer for gNextDeadline. Lock held. False when the pass must be
// repeated: no timer took the deadline, yet one serves.
bool ArmNextLocked() {
    const uint64_t next = gNextDeadline.Load();
    if (IsNever(next)) return true;
    if (ArmTimer(FromU64(next)) != 0) return true;
    // No serving timer: nothing would run the next pass, and repeating would
    // spin on this thread forever, so the pass ends here.
    return !TimerServing();
}

}  // namespace

void ResetTickServiceState() {
    sGenerationSeen.store(false, kRelaxed);
    sLastGeneration.store(0, kRelaxed);
    sTickSerial.store(0, kRelaxed);
}

void TickServiceRoutine() {
    tKPusTimingEngine* engine = Published<StdAtomics>(gEngine);
    if (engine == nullptr) return;
    iKPusTimingEngine* slots = engine;
    if (!sGenerationSeen.load(kRelaxed)) {
        sLastGeneration.store(gGeneration.load(kRelaxed), kRelaxed);
        sGenerationSeen.store(true, kRelaxed);
    }

    PassWork work;
    for (;;) {
        // Before the lock: the reading, the due callbacks (with the pass's
        // monotonic now), the reading's global equivalent, and the global
        // callback time on the monotonic clock (NeverTime cancels: it is
        // neither converted nor folded). The global clock is consulted only
        // while something waits on it, so a pass at rest (the tick alone)
        // makes no conversion; a global node queued after this check (by a
        // caller, or by the callback) is seen under the lock, and the pass
        // looks again with a conversion.
        const uint64_t globalTime = gGlobalCallbackTime.Load();
        const bool needGlobal = !IsNever(globalTime) || GlobalNodesQueued();
        const uint64_t now = ReadNow(engine);
        const ClockTime nowTime = FromU64(now);
        const uint64_t callbackTime = gMonotonicCallbackTime.Load();
        FireIfDue(gMonotonicCallbackTime, callbackTime, Due(callbackTime, now), &nowTime);
        const uint64_t nowGlobal = needGlobal ? ToU64(slots->MonotonicToGlobal(nowTime)) : now;
        const int64_t offset = GlobalOffsetOf(now, nowGlobal);
        // The global callback time is compared on the global clock, so that
        // a step of the wall clock moves it along.
        const bool globalDue = Due(globalTime, nowGlobal);
        const bool globalFired = FireIfDue(gGlobalCallbackTime, globalTime, globalDue, &nowTime);
        uint64_t globalAsMonotonic = kNeverTime64;
        if (!globalDue && !IsNever(globalTime)) globalAsMonotonic = ToU64(slots->GlobalToMonotonic(FromU64(globalTime)));

        work.callMonotonic = work.repeat = false;
        work.fired = 0;
        {
            SchedLockGuard lock;
            if (!needGlobal && GlobalNodesQueued()) continue;  // one arrived meanwhile: convert first
            gNextDeadline.Store(kNeverTime64);
            work.tickDue = ServeTickLocked(engine, now);

            // A monotonic callback time set meanwhile may be due already; it
            // is claimed here and called after the lock.
            const uint64_t monotonicTime = gMonotonicCallbackTime.Load();
            if (Due(monotonicTime, now)) {
                gMonotonicCallbackTime.Store(kNeverTime64);
                work.callMonotonic = true;
            } else {
                FoldIntoNextDeadline(monotonicTime);
            }
            if (gGlobalCallbackTime.Load() != (globalFired ? kNeverTime64 : globalTime)) {
                work.repeat = true;  // set meanwhile: look again with its conversion
            } else if (!globalDue) {
                FoldIntoNextDeadline(globalAsMonotonic);
            }

            // Abortable global-clock waits end when the clock's generation
            // moved; then every expired node, in list order.
            const uint32_t generation = gGeneration.load(kRelaxed);
            if (generation != sLastGeneration.load(kRelaxed)) {
                sLastGeneration.store(generation, kRelaxed);
                work.fired = DetachAbortableGlobalNodesLocked(work.batch, kWaitNodeCount);
            }
            work.fired += DetachDueNodesLocked(now, offset, work.batch + work.fired, kWaitNodeCount - work.fired);

            const bool tickCallback = work.tickDue && gTickCallback.load(kRelaxed) != nullptr;
            if (!work.callMonotonic && work.fired == 0 && !tickCallback && !work.repeat) {
                if (ArmNextLocked()) return;
                continue;
            }
        }

        // The calls, without the lock: the callback for a monotonic callback
        // time set due meanwhile, the expired nodes, the tick.
        if (work.callMonotonic) CallCallback(&nowTime);
        for (uint32_t i = 0; i < work.fired; ++i) work.release[i] = RunFiring(work.batch[i]);
        if (work.tickDue) {
            QueltaTickCallbackFn tick = TakeTickCallback<StdAtomics>(gTickCallback);
            if (tick != nullptr) {
                tick(sTickSerial.load(kRelaxed));
                sTickSerial.fetch_add(1, kRelaxed);
            }
        }

        SchedLockGuard lock;
        for (uint32_t i = 0; i < work.fired; ++i) SettleFiringLocked(work.batch[i], work.release[i]);
        if (work.repeat) continue;
        if (ArmNextLocked()) return;
    }
}

}  // namespace quelta
