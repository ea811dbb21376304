// The timing engine object: construction, clock reads, the atomic last-read
// cells, and the slots that forward to the waits and the scheduler.
//
// Conversions and units live in EngineConversion.cpp, the kernel clock's rate
// and stepping in EngineRate.cpp, the statistics in EngineStatistics.cpp.
#include "engine/tKPusTimingEngine.h"

#include <time.h>

#include "engine/ClockWaits.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "quelta/quelta.h"
#include "tLinux/PalMemory.h"

using namespace quelta;

namespace {

constexpr uint64_t kNsPerSecond = 1000000000ull;

struct ClockChoice {
    clockid_t clock;
    bool global;  // add the epoch offset, record in lastGlobal
    AtomicClockTime* cell;
};

}  // namespace

tKPusTimingEngine::tKPusTimingEngine()
    : statsEnabled(0), statsCount(0), serviceMode(0), epochOffset(0) {
    // std::atomic's default constructor leaves the value indeterminate.
    stats.statsReserved.store(0, std::memory_order_relaxed);
    stats.jitterMode.store(0, std::memory_order_relaxed);
    stats.rawReadCost.store(0, std::memory_order_relaxed);
    stats.globalReadExtra.store(0, std::memory_order_relaxed);
    for (uint32_t i = 0; i < kStatsSamples; ++i) {
        stats.jitterSamples[i].store(0, std::memory_order_relaxed);
        stats.rawReadSamples[i].store(0, std::memory_order_relaxed);
        stats.globalReadSamples[i].store(0, std::memory_order_relaxed);
    }
    lastMonotonic.Store(0);
    lastGlobal.Store(0);
}

// The engine holds no resources.
tKPusTimingEngine::~tKPusTimingEngine() {}

void* tKPusTimingEngine::operator new(size_t bytes) noexcept { return PalMemAlloc(bytes); }

void tKPusTimingEngine::operator delete(void* p) noexcept { PalMemFree(p); }

// What a failed clock_gettime yields (the kernel has then not written the
// timespec): a recorded kind returns the value its cell holds, the latest
// good reading, and leaves the cell alone, so a failure never makes the
// recorded time jump back to the clock's zero; the raw kind, which keeps no
// cell, returns 0. The timespec is zeroed first regardless, so nothing
// uninitialised can ever reach the caller.
void tKPusTimingEngine::ReadClock(ClockTime& out, uint32_t selector) {
    ClockChoice c;
    switch (selector) {
        case 0: c = {CLOCK_MONOTONIC, false, &lastMonotonic}; break;
        case 1: c = {CLOCK_REALTIME, true, &lastGlobal}; break;
        default: c = {CLOCK_MONOTONIC_RAW, false, nullptr}; break;
    }
    timespec ts{};
    if (gSystemClock.getTime(c.clock, &ts) != 0) {
        out = c.cell != nullptr ? c.cell->LoadTime() : ClockTime{0, 0};
        return;
    }
    const int64_t offset = c.global ? epochOffset.load(std::memory_order_relaxed) : 0;
    // (offset + sec) * 1e9 + nsec in 64-bit arithmetic, wrapping modulo 2^64.
    // The seconds are the kernel's full 64-bit count, so the global clock
    // goes on past 2038 on every target; the 64-bit nanosecond value since
    // 1904 itself runs until the year 2488.
    const uint64_t seconds = static_cast<uint64_t>(offset) + static_cast<uint64_t>(static_cast<int64_t>(ts.tv_sec));
    const uint64_t value = seconds * kNsPerSecond + static_cast<uint64_t>(static_cast<int64_t>(ts.tv_nsec));
    out = FromU64(value);
    if (c.cell != nullptr) c.cell->Store(value);
}

// --- clock reads: each slot a fixed selector ---------------------------------

void tKPusTimingEngine::ReadMonotonic0(ClockTime& out) { ReadClock(out, 0); }
void tKPusTimingEngine::ReadMonotonic1(ClockTime& out) { ReadClock(out, 0); }
void tKPusTimingEngine::ReadGlobal2(ClockTime& out) { ReadClock(out, 1); }
void tKPusTimingEngine::ReadGlobal3(ClockTime& out) { ReadClock(out, 1); }
void tKPusTimingEngine::ReadMonotonic4(ClockTime& out) { ReadClock(out, 0); }
void tKPusTimingEngine::ReadMonotonic5(ClockTime& out) { ReadClock(out, 0); }
void tKPusTimingEngine::ReadGlobal6(ClockTime& out) { ReadClock(out, 1); }
void tKPusTimingEngine::ReadGlobal7(ClockTime& out) { ReadClock(out, 1); }
void tKPusTimingEngine::ReadRaw8(ClockTime& out) { ReadClock(out, 2); }
void tKPusTimingEngine::ReadRaw9(ClockTime& out) { ReadClock(out, 2); }

ClockTime tKPusTimingEngine::GetClocksPerSecond() { return ClockTime{1000000000u, 0}; }

// --- forwarding slots: through the virtual table, as the runtime would ------

ClockTime tKPusTimingEngine::MonotonicToGlobal(const ClockTime& t) { return this->MonotonicToGlobalImpl(t); }
ClockTime tKPusTimingEngine::GlobalToMonotonic(const ClockTime& t) { return this->GlobalToMonotonicImpl(t); }
ClockTime tKPusTimingEngine::MonotonicToGlobalFwd(const ClockTime& t) { return this->MonotonicToGlobal(t); }
ClockTime tKPusTimingEngine::MonotonicToGlobalImplFwd(const ClockTime& t) { return this->MonotonicToGlobalImpl(t); }
ClockTime tKPusTimingEngine::GlobalToMonotonicFwd(const ClockTime& t) { return this->GlobalToMonotonic(t); }
ClockTime tKPusTimingEngine::GlobalToMonotonicImplFwd(const ClockTime& t) { return this->GlobalToMonotonicImpl(t); }
ClockTime tKPusTimingEngine::MicrosecondsToClocks64Fwd(const ClockTime& us) { return this->MicrosecondsToClocks64(us); }
uint32_t tKPusTimingEngine::MicrosecondsToClocks32Fwd(const uint32_t& us) { return this->MicrosecondsToClocks32(us); }
ClockTime tKPusTimingEngine::ClocksToMicroseconds64Fwd(const ClockTime& ns) { return this->ClocksToMicroseconds64(ns); }
uint32_t tKPusTimingEngine::ClocksToMicroseconds32Fwd(const uint32_t& ns) { return this->ClocksToMicroseconds32(ns); }

// --- waits and scheduler operations ------------------------------------------

uint32_t tKPusTimingEngine::EventWait(PalSemaphore* semaphore, uint32_t timeout) {
    return quelta_iTSCEvent_Wait_C(semaphore, timeout);
}

uint32_t tKPusTimingEngine::EventWaitCallback(PalSemaphore* semaphore, const ClockTime& deadline,
                                              QueltaWaitCallbackFn callback, void* callbackArg,
                                              uint32_t isGlobal, WaitNode** nodeOut) {
    // The exported function takes the deadline by pointer; hand it a private
    // copy so the caller's record may change while the node is queued.
    ClockTime copy = deadline;
    return quelta_iTSCEvent_Wait_Callback_C(semaphore, &copy, callback, callbackArg, isGlobal, nodeOut);
}

void tKPusTimingEngine::ReleaseWait(WaitNode* node) { ReleaseWaitNode(node); }

uint32_t tKPusTimingEngine::WaitMicroSeconds(uint32_t us) { return quelta_iTSC_WaitMicroSeconds_C(us); }
uint32_t tKPusTimingEngine::WaitUntilNextMultipleMicroSeconds(uint32_t us) {
    return quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(us);
}
uint32_t tKPusTimingEngine::WaitUntilMicroSeconds(uint32_t us) { return quelta_iTSC_WaitUntilMicroSeconds_C(us); }
uint32_t tKPusTimingEngine::WaitClocks(uint32_t clocks) { return quelta_iTSC_WaitClocks_C(clocks); }
uint32_t tKPusTimingEngine::WaitUntilNextMultipleClocks(uint32_t clocks) {
    return quelta_iTSC_WaitUntilNextMultipleClocks_C(clocks);
}
uint32_t tKPusTimingEngine::WaitUntilClocks64(const ClockTime* target) { return quelta_iTSC_WaitUntilClocks64_C(target); }
uint32_t tKPusTimingEngine::WaitUntilClocks(uint32_t target) { return quelta_iTSC_WaitUntilClocks_C(target); }

void tKPusTimingEngine::SetControlFlag(uint32_t action) { SetControlFlagImpl(action); }

uint32_t tKPusTimingEngine::UsesTickService() {
    return serviceMode.load(std::memory_order_relaxed) == 0 ? 1u : 0u;
}

void tKPusTimingEngine::LoadLastMonotonicFwd(ClockTime& out) { this->LoadLastMonotonic(out); }
void tKPusTimingEngine::LoadLastMonotonic(ClockTime& out) { out = lastMonotonic.LoadTime(); }
void tKPusTimingEngine::LoadLastGlobalFwd(ClockTime& out) { this->LoadLastGlobal(out); }
void tKPusTimingEngine::LoadLastGlobal(ClockTime& out) { out = lastGlobal.LoadTime(); }

ClockTime tKPusTimingEngine::WaitUntilNextMultipleClocks64(const ClockTime& period) {
    return WaitUntilNextMultipleClocks64Impl(period);
}

void tKPusTimingEngine::WaitUntilGlobalClocks64(const ClockTime* target, uint32_t* abortFlag,
                                                ClockTime* timeAfter, uint32_t generation) {
    quelta_iTSC_WaitUntilGlobalClocks64_C(target, abortFlag, timeAfter, generation);
}

// The clock first, then the generation: a change between the two is not
// detected here; the wait that receives the pair checks again.
void tKPusTimingEngine::ReadGlobalWithGeneration(ClockTime& out, uint32_t& generation) {
    ReadClock(out, 1);
    generation = gGeneration.load(std::memory_order_relaxed);
}

void tKPusTimingEngine::RegisterTickCallback(QueltaTickCallbackFn fn) { RegisterTickCallbackImpl(fn); }
void tKPusTimingEngine::UnregisterTickCallback(QueltaTickCallbackFn fn) { UnregisterTickCallbackImpl(fn); }
