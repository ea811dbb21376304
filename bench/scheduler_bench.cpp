// The tick scheduler's costs: one tick service pass with 0, 16 and 128 queued
// nodes (a fake timer records the arming, nothing sleeps), and the lateness
// of a wait whose deadline falls between ticks on the live timer thread.
#include <benchmark/benchmark.h>
#include <sched.h>
#include <time.h>

#include <algorithm>
#include <random>
#include <vector>

#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TickService.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "quelta/quelta.h"

using namespace quelta;

namespace {

uint64_t MonoNs() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * 1000000000ull + static_cast<uint64_t>(ts.tv_nsec);
}

class RecordingTimer : public tKPusLinuxNanoSleepTimer {
public:
    RecordingTimer() { state.status.store(static_cast<int32_t>(TimerThreadStatus::kServing)); }
    void SetExpiry(ClockTime) override {}
    void ExpireNow() override {}
};

// One pass of the tick service with `nodes` nodes queued behind a far head,
// so each pass serves a tick, looks at both callback times and the head.
void BM_TickServicePass(benchmark::State& state) {
    static WaitNode pool[kWaitNodeCount];
    InitSchedLock();
    auto* engine = new tKPusTimingEngine();
    gEngine.store(engine);
    auto* timer = new RecordingTimer();
    gTimer.store(timer);
    InitWaitNodePool(pool, kWaitNodeCount);
    gEventSystemReady.store(1);
    gTickPeriod.Store(kTickPeriodClocks);
    const uint64_t far = MonoNs() + 3600ull * 1000000000ull;
    for (int64_t i = 0; i < state.range(0); ++i) {
        WaitNode* n = TakeFreeNode();
        n->fireCount.store(0);
        n->prev.store(nullptr);
        n->isGlobal.store(0);
        n->autoRelease.store(0);
        ClockTime d = FromU64(far + static_cast<uint64_t>(i));
        InsertWaitNode(n, &d, nullptr, nullptr);
    }
    for (auto _ : state) {
        gNextTick.Store(MonoNs());  // a tick is due on every pass
        TickServiceRoutine();
    }
    gEventSystemReady.store(0);
    gWaitNodePool.store(nullptr);
    gFreeList.store(nullptr);
    gWaitList.store(nullptr);
    delete gTimer.exchange(nullptr);
    delete gEngine.exchange(nullptr);
    SetLoadTimeSchedulerState();
}
BENCHMARK(BM_TickServicePass)->Arg(0)->Arg(16)->Arg(128)->Unit(benchmark::kNanosecond);

// Arm-to-fire lateness of an own-semaphore wait with a deadline between ticks
// (1.3 ms + up to 0.5 ms ahead), on the live library, from a SCHED_FIFO thread.
void BM_WaitBetweenTicksLateness(benchmark::State& state) {
    if (LibraryControl(0, 1, 0) != 1 || !TimerServing()) {
        state.SkipWithError("the library could not start with a serving timer");
        LibraryControl(0, 0, 0);
        return;
    }
    sched_param p{};
    p.sched_priority = 50;
    const bool fifo = sched_setscheduler(0, SCHED_FIFO, &p) == 0;
    std::mt19937 rng(7);
    std::vector<double> lateUs;
    iKPusTimingEngine* e = gEngine.load();
    for (auto _ : state) {
        ClockTime now;
        e->ReadMonotonic0(now);
        const uint64_t deadline = ToU64(now) + 1300000 + rng() % 500000;
        const ClockTime d = FromU64(deadline);
        quelta_iTSCEvent_Wait_Callback_C(nullptr, &d, nullptr, nullptr, 0, nullptr);
        lateUs.push_back(static_cast<double>(MonoNs() - deadline) / 1000.0);
    }
    std::sort(lateUs.begin(), lateUs.end());
    if (!lateUs.empty()) {
        state.counters["p50_us"] = lateUs[lateUs.size() / 2];
        state.counters["p99_us"] = lateUs[lateUs.size() * 99 / 100];
        state.counters["max_us"] = lateUs.back();
        state.counters["fifo"] = fifo ? 1 : 0;
    }
    p.sched_priority = 0;
    sched_setscheduler(0, SCHED_OTHER, &p);
    LibraryControl(0, 0, 0);
}
BENCHMARK(BM_WaitBetweenTicksLateness)->Iterations(2000)->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
