// The raw clock read every benchmark compares the library's calls with,
// measured in the same run.
#ifndef QUELTA_BENCH_RAWCLOCK_H
#define QUELTA_BENCH_RAWCLOCK_H

#include <benchmark/benchmark.h>
#include <time.h>

inline void RawClockGettime(benchmark::State& state, clockid_t clock) {
    for (auto _ : state) {
        timespec ts;
        clock_gettime(clock, &ts);
        benchmark::DoNotOptimize(ts);
    }
}

#endif
