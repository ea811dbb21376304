// The tick scheduler's costs: one tick service pass with 0, 16 and 128 queued
// nodes (a fake timer records the arming, nothing sleeps); how long an insert
// holds the scheduler lock with 127 global-clock nodes queued; the lateness
// of a wait whose deadline falls between ticks on the live timer thread; and
// callback lateness with and without a low-priority thread inserting nodes
// in a loop.
#include <benchmark/benchmark.h>
#include <sched.h>
#include <unistd.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <thread>
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
#include "tLinux/PalSemaphoreOps.h"

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
// so each pass serves a tick, looks at both callback times and the head;
// with global-clock nodes (second argument 1) it looks at every node, since a
// wall-clock step may have left a due one anywhere.
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
    const bool global = state.range(1) != 0;
    ClockTime globalNow;
    static_cast<iKPusTimingEngine*>(engine)->ReadGlobal2(globalNow);
    const uint64_t far = (global ? ToU64(globalNow) : MonoNs()) + 3600ull * 1000000000ull;
    for (int64_t i = 0; i < state.range(0); ++i) {
        WaitNode* n = TakeFreeNode();
        n->fireCount.store(0);
        n->prev.store(nullptr);
        n->isGlobal.store(global ? 1 : 0);
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
BENCHMARK(BM_TickServicePass)
    ->ArgNames({"nodes", "global"})
    ->ArgsProduct({{0, 16, 128}, {0, 1}})
    ->Unit(benchmark::kNanosecond);

// Starts the library in this process; false (the benchmark skipped) when its
// timer thread cannot serve (no SCHED_FIFO).
bool StartLibrary(benchmark::State& state) {
    if (LibraryControl(0, 1, 0) == 1 && TimerServing()) return true;
    state.SkipWithError("the library could not start with a serving timer");
    LibraryControl(0, 0, 0);
    return false;
}

// A global time an hour or so after `g`, at a random place.
template <class Rng>
ClockTime AnHourAfter(const ClockTime& g, Rng& rng) {
    return FromU64(ToU64(g) + 3600ull * 1000000000ull + rng() % 1000000000ull);
}

double Percentile(std::vector<double> v, double p) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[std::min(v.size() - 1, static_cast<size_t>(p * static_cast<double>(v.size())))];
}

// Queues `count` global-clock nodes at random places an hour or so ahead, on
// the library as it runs (callers' semaphore, so nothing blocks).
std::vector<WaitNode*> QueueGlobalNodes(PalSemaphore* semaphore, int count, std::mt19937& rng) {
    std::vector<WaitNode*> nodes;
    ClockTime g;
    gEngine.load()->ReadGlobal2(g);
    for (int i = 0; i < count; ++i) {
        const ClockTime d = AnHourAfter(g, rng);
        WaitNode* node = nullptr;
        if (quelta_iTSCEvent_Wait_Callback_C(semaphore, &d, nullptr, nullptr, 1, &node) == 0) nodes.push_back(node);
    }
    return nodes;
}

// One insert of a global-clock node among 127 queued ones, at a random place,
// then its cancellation. The insert's whole duration bounds the time it holds
// the scheduler lock (its offset is measured before the lock is taken).
void BM_InsertAmong127GlobalNodes(benchmark::State& state) {
    if (!StartLibrary(state)) return;
    std::mt19937 rng(11);
    PalSemaphore* semaphore = nullptr;
    PalSemaphoreCreate(&semaphore);
    std::vector<WaitNode*> queued = QueueGlobalNodes(semaphore, kWaitNodeCount - 1, rng);
    ClockTime g;
    gEngine.load()->ReadGlobal2(g);
    // At a real-time priority, so that what is measured is the insert, not
    // the other processes that preempt a normal thread on a busy machine.
    sched_param p{};
    p.sched_priority = 50;
    const bool fifo = sched_setscheduler(0, SCHED_FIFO, &p) == 0;
    std::vector<double> us;
    for (auto _ : state) {
        WaitNode* node = TakeFreeNode();
        node->fireCount.store(0);
        node->prev.store(nullptr);
        node->isGlobal.store(1);
        node->autoRelease.store(0);
        node->semaphore.store(semaphore);
        const ClockTime d = AnHourAfter(g, rng);
        const uint64_t t0 = MonoNs();
        InsertWaitNode(node, &d, nullptr, nullptr);
        us.push_back(static_cast<double>(MonoNs() - t0) / 1000.0);
        ReleaseWaitNode(node);
    }
    p.sched_priority = 0;
    sched_setscheduler(0, SCHED_OTHER, &p);
    state.counters["fifo"] = fifo ? 1 : 0;
    state.counters["queued"] = static_cast<double>(queued.size());
    state.counters["p50_us"] = Percentile(us, 0.5);
    state.counters["p99_us"] = Percentile(us, 0.99);
    state.counters["max_us"] = Percentile(us, 1.0);
    for (WaitNode* n : queued) ReleaseWaitNode(n);
    LibraryControl(0, 0, 0);
    PalSemaphoreDestroy(semaphore);
}
BENCHMARK(BM_InsertAmong127GlobalNodes)->Iterations(20000)->Unit(benchmark::kMicrosecond);

// The callback is given the pass's own reading of the clock: the time from it
// to the call is what the pass spent before calling, the wake-up excluded.
std::atomic<uint64_t> gCallbackAt{0}, gInPass{0};
void RecordCallback(void* passNow) {
    const uint64_t at = MonoNs();
    gInPass.store(at - ToU64(*static_cast<ClockTime*>(passNow)));
    gCallbackAt.store(at);
}

// Lateness of monotonic callback times (1.3 ms + up to 0.5 ms ahead, set from
// a SCHED_FIFO thread) in blocks of 100, in turn with a SCHED_OTHER thread
// inserting and cancelling global-clock nodes among 126 queued ones, with the
// same thread only keeping its CPU busy (reading the clock, taking no lock
// of the library's), and without it. busy/quiet is the cost a low-priority
// caller imposes on the timer thread, machine effects of a busy CPU
// included; busy/hog is the part of it that the library's lock accounts for.
void BM_CallbackLatenessWithLowPriorityInserter(benchmark::State& state) {
    if (!StartLibrary(state)) return;
    std::mt19937 rng(13);
    PalSemaphore* semaphore = nullptr;
    PalSemaphoreCreate(&semaphore);
    std::vector<WaitNode*> queued = QueueGlobalNodes(semaphore, kWaitNodeCount - 2, rng);
    std::atomic<int> mode{0};  // 0 quiet, 1 inserting, 2 keeping a CPU busy
    std::atomic<bool> quit{false};
    std::atomic<uint64_t> inserts{0};
    std::thread inserter([&] {
        std::mt19937 r(17);
        ClockTime g;
        gEngine.load()->ReadGlobal2(g);
        while (!quit.load()) {
            if (mode.load() == 0) {
                usleep(200);
                continue;
            }
            if (mode.load() == 2) {
                for (int k = 0; k < 100; ++k) gEngine.load()->ReadGlobal2(g);
                continue;
            }
            const ClockTime d = AnHourAfter(g, r);
            WaitNode* node = nullptr;
            if (quelta_iTSCEvent_Wait_Callback_C(semaphore, &d, nullptr, nullptr, 1, &node) == 0) {
                ReleaseWaitNode(node);
                inserts.fetch_add(1);
            }
        }
    });
    sched_param p{};
    p.sched_priority = 50;
    const bool fifo = sched_setscheduler(0, SCHED_FIFO, &p) == 0;
    quelta_iTSC_SetCallback(&RecordCallback, nullptr);
    std::vector<double> quiet, busy, hog, inPass[3];
    int i = 0;
    for (auto _ : state) {
        const int blockMode = (i++ / 100) % 3;
        if (mode.load() != blockMode) {
            mode.store(blockMode);
            usleep(2000);
        }
        ClockTime now;
        gEngine.load()->ReadMonotonic0(now);
        const uint64_t due = ToU64(now) + 1300000 + rng() % 500000;
        const ClockTime when = FromU64(due);
        gCallbackAt.store(0);
        quelta_iTSC_SetCallbackTime(&when, 0);
        while (gCallbackAt.load() == 0) {
            timespec ts{0, 50000};
            nanosleep(&ts, nullptr);
        }
        (blockMode == 0 ? quiet : blockMode == 1 ? busy : hog).push_back(static_cast<double>(gCallbackAt.load() - due) / 1000.0);
        inPass[blockMode].push_back(static_cast<double>(gInPass.load()) / 1000.0);
    }
    quit.store(true);
    inserter.join();
    quelta_iTSC_SetCallback(nullptr, nullptr);
    p.sched_priority = 0;
    sched_setscheduler(0, SCHED_OTHER, &p);
    state.counters["quiet_p50_us"] = Percentile(quiet, 0.5);
    state.counters["quiet_p99_us"] = Percentile(quiet, 0.99);
    state.counters["busy_p50_us"] = Percentile(busy, 0.5);
    state.counters["busy_p99_us"] = Percentile(busy, 0.99);
    state.counters["hog_p99_us"] = Percentile(hog, 0.99);
    state.counters["p99_ratio"] = Percentile(busy, 0.99) / std::max(Percentile(quiet, 0.99), 1e-9);
    state.counters["p99_ratio_to_hog"] = Percentile(busy, 0.99) / std::max(Percentile(hog, 0.99), 1e-9);
    // The same, counted from the pass's reading: the lock's share, free of the
    // machine's wake-up latency.
    state.counters["quiet_in_pass_p99_us"] = Percentile(inPass[0], 0.99);
    state.counters["busy_in_pass_p99_us"] = Percentile(inPass[1], 0.99);
    state.counters["busy_in_pass_max_us"] = Percentile(inPass[1], 1.0);
    state.counters["inserts"] = static_cast<double>(inserts.load());
    state.counters["fifo"] = fifo ? 1 : 0;
    for (WaitNode* n : queued) ReleaseWaitNode(n);
    LibraryControl(0, 0, 0);
    PalSemaphoreDestroy(semaphore);
}
BENCHMARK(BM_CallbackLatenessWithLowPriorityInserter)->Iterations(6000)->Unit(benchmark::kMicrosecond);

// Arm-to-fire lateness of an own-semaphore wait with a deadline between ticks
// (1.3 ms + up to 0.5 ms ahead), on the live library, from a SCHED_FIFO thread.
void BM_WaitBetweenTicksLateness(benchmark::State& state) {
    if (!StartLibrary(state)) return;
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
