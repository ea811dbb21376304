// Cost of the engine's hot slots, called as the runtime calls them (a virtual
// call through an iKPusTimingEngine pointer), next to the bare kernel clock
// reads they are built on. Goals: a read slot within 10% of the bare read of
// its clock; a conversion (slots 15, 17) under 100 ns.
#include <benchmark/benchmark.h>

#include "RawClock.h"
#include <time.h>

#include "engine/tKPusTimingEngine.h"

namespace {


// Opaque to the optimiser, so every call below stays a virtual call.
iKPusTimingEngine* volatile gBenchEngine = nullptr;

iKPusTimingEngine* Engine() {
    if (gBenchEngine == nullptr) {
        tKPusTimingEngine* e = new tKPusTimingEngine();
        e->SetEpochOffset(2082844800);
        gBenchEngine = e;
    }
    return gBenchEngine;
}

BENCHMARK_CAPTURE(RawClockGettime, monotonic, CLOCK_MONOTONIC);

BENCHMARK_CAPTURE(RawClockGettime, realtime, CLOCK_REALTIME);

BENCHMARK_CAPTURE(RawClockGettime, monotonic_raw, CLOCK_MONOTONIC_RAW);

void BM_Slot0_ReadMonotonic(benchmark::State& state) {
    iKPusTimingEngine* e = Engine();
    for (auto _ : state) {
        ClockTime t;
        e->ReadMonotonic0(t);
        benchmark::DoNotOptimize(t);
    }
}
BENCHMARK(BM_Slot0_ReadMonotonic);

void BM_Slot2_ReadGlobal(benchmark::State& state) {
    iKPusTimingEngine* e = Engine();
    for (auto _ : state) {
        ClockTime t;
        e->ReadGlobal2(t);
        benchmark::DoNotOptimize(t);
    }
}
BENCHMARK(BM_Slot2_ReadGlobal);

void BM_Slot8_ReadRaw(benchmark::State& state) {
    iKPusTimingEngine* e = Engine();
    for (auto _ : state) {
        ClockTime t;
        e->ReadRaw8(t);
        benchmark::DoNotOptimize(t);
    }
}
BENCHMARK(BM_Slot8_ReadRaw);

void BM_Slot15_MonotonicToGlobal(benchmark::State& state) {
    iKPusTimingEngine* e = Engine();
    ClockTime now;
    e->ReadMonotonic0(now);
    for (auto _ : state) {
        ClockTime g = e->MonotonicToGlobal(now);
        benchmark::DoNotOptimize(g);
    }
}
BENCHMARK(BM_Slot15_MonotonicToGlobal);

void BM_Slot17_GlobalToMonotonic(benchmark::State& state) {
    iKPusTimingEngine* e = Engine();
    ClockTime now;
    e->ReadGlobal2(now);
    for (auto _ : state) {
        ClockTime m = e->GlobalToMonotonic(now);
        benchmark::DoNotOptimize(m);
    }
}
BENCHMARK(BM_Slot17_GlobalToMonotonic);

void BM_Slot21_ClocksToMicroseconds64(benchmark::State& state) {
    iKPusTimingEngine* e = Engine();
    ClockTime x = {0x89ABCDEFu, 0x01234567u};
    for (auto _ : state) {
        benchmark::DoNotOptimize(x);
        ClockTime us = e->ClocksToMicroseconds64(x);
        benchmark::DoNotOptimize(us);
    }
}
BENCHMARK(BM_Slot21_ClocksToMicroseconds64);

}  // namespace

BENCHMARK_MAIN();
