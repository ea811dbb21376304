// PalSemaphore costs: the post-to-wake round trip between two threads, the
// uncontended post + wait(0), and a wait(0) that finds nothing.
#include <benchmark/benchmark.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <thread>

#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace {

using namespace quelta;

PalSemaphore* NewSemaphore() {
    PalSemaphore* s = nullptr;
    if (PalInitialize() != 1 || PalSemaphoreCreate(&s) != 0) {
        std::fprintf(stderr, "cannot create a semaphore\n");
        std::abort();
    }
    return s;
}

// One iteration: post to the partner, which wakes and posts back; the time
// per iteration is one full round trip (two wake-ups).
void BM_SemaphorePingPong(benchmark::State& state) {
    PalSemaphore* ping = NewSemaphore();
    PalSemaphore* pong = NewSemaphore();
    std::atomic<bool> stop{false};
    std::thread partner([&] {
        for (;;) {
            PalSemaphoreWait(ping, -1);
            if (stop.load(std::memory_order_relaxed)) break;
            PalSemaphorePost(pong);
        }
    });
    for (auto _ : state) {
        PalSemaphorePost(ping);
        PalSemaphoreWait(pong, -1);
    }
    stop = true;
    PalSemaphorePost(ping);
    partner.join();
    PalSemaphoreDestroy(ping);
    PalSemaphoreDestroy(pong);
    state.SetLabel("ns per round trip");
}
BENCHMARK(BM_SemaphorePingPong)->UseRealTime();

void BM_SemaphorePostWaitUncontended(benchmark::State& state) {
    PalSemaphore* s = NewSemaphore();
    for (auto _ : state) {
        PalSemaphorePost(s);
        benchmark::DoNotOptimize(PalSemaphoreWait(s, 0));
    }
    PalSemaphoreDestroy(s);
}
BENCHMARK(BM_SemaphorePostWaitUncontended);

// Nothing pending: reads the clock and times out at once in the condition wait.
void BM_SemaphoreWaitZeroEmpty(benchmark::State& state) {
    PalSemaphore* s = NewSemaphore();
    for (auto _ : state) benchmark::DoNotOptimize(PalSemaphoreWait(s, 0));
    PalSemaphoreDestroy(s);
}
BENCHMARK(BM_SemaphoreWaitZeroEmpty);

}  // namespace

BENCHMARK_MAIN();
