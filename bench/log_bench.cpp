// Cost of the log engine's recording and read-out, called as the runtime
// calls them (virtual calls through an iKPLogEngine pointer), next to the
// bare CLOCK_REALTIME read that stamping is built on.
//
// Goals: no page fault while recording into fresh rings (BM_RecordFaults:
// 0); LogAt1 under 10 ns; LogNow5 within 10 ns of the bare clock read; a
// read-out's cost per entry on 256 CPUs within 2x of its cost on 2
// (BM_ReadOut10000). The LogNow5 runs come in two forms: with a timing engine in gEngine (the
// library as loaded: the stamp is the engine's ReadGlobal7, which also
// records the reading in the engine's last-global cell) and without one (the
// log's own CLOCK_REALTIME fallback). Two threads on two CPUs recording at
// once should each cost what one thread costs alone: every CPU has its own
// ring. The shared-record run forces both threads onto one ring to show what
// contention would look like.
#include <benchmark/benchmark.h>
#include <sys/resource.h>
#include <time.h>

#include <algorithm>
#include <cstring>
#include <thread>

#include "RawClock.h"

#include "engine/LibraryFrame.h"
#include "engine/tKPusTimingEngine.h"
#include "log/tKPLogEngine.h"
#include "tLinux/PalThreads.h"

namespace {

using namespace quelta;  // the timing engine and the seams

// Opaque to the optimiser, so every call below stays a virtual call. Built
// before main, so that threaded runs never race on its creation.
iKPLogEngine* volatile gBenchLog = tKPLogEngine::Create();

iKPLogEngine* Log() { return gBenchLog; }

// Puts a timing engine into gEngine (on) or takes it out (off) for one run.
void UseTimingEngine(bool on) {
    static tKPusTimingEngine* engine = nullptr;
    if (on && engine == nullptr) {
        engine = new tKPusTimingEngine();
        engine->SetEpochOffset(2082844800);
    }
    quelta::gEngine.store(on ? engine : nullptr);
}

// Recording on a ring of the default size; reconfigured per run so every run
// starts with empty rings and recording in the given state.
iKPLogEngine* Prepared(bool recording) {
    iKPLogEngine* log = Log();
    log->Reconfigure();
    if (recording) log->SetEnabled(1);
    return log;
}

// Page faults on the recording path. A fresh engine gets 12,000 LogAt1 per
// CPU from a thread pinned to that CPU (its 5000-entry rings wrap twice);
// then the same engine is configured to rings of 12,000 entries (large
// enough to come straight from the kernel) and recorded into again. The
// counters: minor faults summed over the threads (getrusage RUSAGE_THREAD
// around the records alone), the slowest single record, and what building
// the engine and the Configure cost. Runs first, on a heap no other run has
// touched yet.
struct FaultRun {
    long faults = 0;
    double worstNs = 0;
};

uint64_t MonoNs() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return uint64_t(ts.tv_sec) * 1000000000ull + uint64_t(ts.tv_nsec);
}

// Touches the stack the records will use and the calls the measurement
// makes, so that only the records are measured.
void WarmUpThread() {
    volatile char stack[64 * 1024];
    std::memset(const_cast<char*>(stack), 1, sizeof stack);
    rusage usage;
    getrusage(RUSAGE_THREAD, &usage);
    benchmark::DoNotOptimize(MonoNs());
    benchmark::DoNotOptimize(quelta::gLogCpuQuery());
}

FaultRun RecordOnEveryCpu(iKPLogEngine* log, uint32_t perCpu) {
    FaultRun run;
    const int32_t cpus = quelta::PalGetCpuCount();
    for (int32_t cpu = 0; cpu < cpus; ++cpu) {
        std::thread([&] {
            quelta::PalSetAffinityOne(cpu);
            WarmUpThread();
            rusage before, after;
            getrusage(RUSAGE_THREAD, &before);
            ClockTime t = {0x12345678u, 0x9u};
            uint64_t worst = 0;
            for (uint32_t i = 0; i < perCpu; ++i) {
                const uint64_t start = MonoNs();
                log->LogAt1(t, i);
                worst = std::max(worst, MonoNs() - start);
                ++t.low;
            }
            getrusage(RUSAGE_THREAD, &after);
            run.faults += after.ru_minflt - before.ru_minflt;
            run.worstNs = std::max(run.worstNs, double(worst));
        }).join();
    }
    return run;
}

void BM_RecordFaults(benchmark::State& state) {
    quelta::PalInitialize();
    for (auto _ : state) {
        uint64_t start = MonoNs();
        tKPLogEngine* engine = tKPLogEngine::Create();
        const double createUs = double(MonoNs() - start) / 1000;
        engine->SetEnabled(1);
        const FaultRun fresh = RecordOnEveryCpu(engine, 12000);
        start = MonoNs();
        engine->Configure(12000);
        const double configureUs = double(MonoNs() - start) / 1000;
        engine->SetEnabled(1);
        const FaultRun configured = RecordOnEveryCpu(engine, 12000);
        delete engine;
        state.counters["faults_fresh"] = double(fresh.faults);
        state.counters["worst_ns_fresh"] = fresh.worstNs;
        state.counters["faults_configured"] = double(configured.faults);
        state.counters["worst_ns_configured"] = configured.worstNs;
        state.counters["create_us"] = createUs;
        state.counters["configure_us"] = configureUs;
    }
}
BENCHMARK(BM_RecordFaults)->Iterations(1)->Unit(benchmark::kMillisecond);

BENCHMARK_CAPTURE(RawClockGettime, realtime, CLOCK_REALTIME);

void BM_LogAt1(benchmark::State& state) {
    iKPLogEngine* log = Prepared(state.range(0) != 0);
    ClockTime t = {0x12345678u, 0x9u};
    for (auto _ : state) {
        log->LogAt1(t, 0x42);
        ++t.low;
    }
}
BENCHMARK(BM_LogAt1)->ArgName("recording")->Arg(1)->Arg(0);

void BM_LogAtWithData(benchmark::State& state) {
    iKPLogEngine* log = Prepared(true);
    ClockTime t = {0x12345678u, 0x9u};
    for (auto _ : state) {
        log->LogAtWithData(t, 0xD47A, 0x43);
        ++t.low;
    }
}
BENCHMARK(BM_LogAtWithData);

// range(0): recording on/off; range(1): timing engine in gEngine or the
// log's fallback clock.
void BM_LogNow5(benchmark::State& state) {
    UseTimingEngine(state.range(1) != 0);
    iKPLogEngine* log = Prepared(state.range(0) != 0);
    for (auto _ : state) log->LogNow5(0x44);
    UseTimingEngine(false);
}
BENCHMARK(BM_LogNow5)
    ->ArgNames({"recording", "engine"})
    ->Args({1, 1})
    ->Args({0, 1})
    ->Args({1, 0})
    ->Args({0, 0});

// One read-out of the newest 10,000 entries, merged across n CPUs (an engine
// built as if n CPUs were online); the counter is the cost per entry handed
// out. Entries are interleaved round-robin, so every output entry comes from
// another ring than the one before: the worst case for the selection.
thread_local int tBenchCpu = 0;
int BenchCpu() { return tBenchCpu; }

tKPLogEngine* CreateWithCpus(int32_t cpus) {
    const int32_t saved = quelta::gCpuCount.load();
    quelta::gCpuCount.store(cpus);
    tKPLogEngine* engine = tKPLogEngine::Create();
    quelta::gCpuCount.store(saved);
    return engine;
}

void BM_ReadOut10000(benchmark::State& state) {
    constexpr uint32_t kEntries = 10000;
    const uint32_t cpus = static_cast<uint32_t>(state.range(0));
    tKPLogEngine* engine = CreateWithCpus(static_cast<int32_t>(cpus));
    if (engine == nullptr || engine->CpuCount() != cpus) {
        state.SkipWithError("no engine with that many CPUs");
        delete engine;
        return;
    }
    iKPLogEngine* log = engine;
    const uint32_t perCpu = (kEntries + cpus - 1) / cpus;
    if (perCpu > 5000) log->Configure(static_cast<int32_t>(perCpu));
    log->SetEnabled(1);
    int (*saved)() = quelta::gLogCpuQuery;
    quelta::gLogCpuQuery = BenchCpu;
    for (uint32_t i = 0; i < perCpu * cpus; ++i) {
        tBenchCpu = static_cast<int>(i % cpus);
        log->LogAt1(ClockTime{1000 + i, 1}, i);
    }
    tBenchCpu = 0;
    quelta::gLogCpuQuery = saved;

    static uint32_t low[kEntries], high[kEntries], events[kEntries], data[kEntries];
    for (auto _ : state) {
        uint32_t count = kEntries;
        log->ReadOutMerged(count, low, high, events, data, 0);
        benchmark::DoNotOptimize(count);
        if (count != kEntries) state.SkipWithError("read-out returned too few entries");
    }
    state.counters["per_entry_ns"] =
        benchmark::Counter(kEntries, benchmark::Counter::kIsIterationInvariantRate |
                                         benchmark::Counter::kInvert);
    delete engine;
}
BENCHMARK(BM_ReadOut10000)->ArgName("cpus")->Arg(2)->Arg(16)->Arg(64)->Arg(256)->Unit(benchmark::kMicrosecond);

// Threads pinned to CPUs 0 and 1 (or to one CPU, as the baseline) record
// LogAt1 at once; the time shown is per record and thread. range(0) = 1
// forces every thread onto ring 0 (contention on purpose).
int SharedRing() { return 0; }

void BM_LogAt1_Pinned(benchmark::State& state) {
    const bool shared = state.range(0) != 0;
    static int (*saved)() = nullptr;  // thread 0's alone
    if (state.thread_index() == 0) {
        saved = quelta::gLogCpuQuery;
        quelta::PalInitialize();
        Prepared(true);
        if (shared) quelta::gLogCpuQuery = SharedRing;
    }
    // Each thread pins itself; the timed loops start together once every
    // thread is ready and end together before the code after them runs.
    const bool pinned = quelta::PalSetAffinityOne(static_cast<int32_t>(state.thread_index())) == 0;
    iKPLogEngine* log = Log();
    ClockTime t = {0x12345678u, 0x9u};
    for (auto _ : state) {
        log->LogAt1(t, 0x45);
        ++t.low;
    }
    if (!pinned) state.SkipWithError("could not pin the thread to its CPU");
    quelta::PalSetAffinityAll();
    if (state.thread_index() == 0) quelta::gLogCpuQuery = saved;
}

BENCHMARK(BM_LogAt1_Pinned)->ArgName("shared_ring")->Arg(0)->Threads(1)->Threads(2)->UseRealTime();
BENCHMARK(BM_LogAt1_Pinned)->ArgName("shared_ring")->Arg(1)->Threads(2)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
