// Arm-to-callback latency of the timer: a deadline 200-900 us ahead is armed
// from another thread while the timer thread sleeps on a 1 ms tick, and the
// time from the deadline to its callback is measured.
//
// The callback behaves like the library's tick service: it serves the armed
// deadline once it is due and re-arms for the earlier of that deadline and the
// next tick. With the wake stand-in the new deadline cuts the tick's sleep
// short; without it (plain SIGALRM fallback) the thread first sleeps out the
// tick it had taken, so the latency grows up to the previously armed deadline.
#include <benchmark/benchmark.h>

#include <pthread.h>
#include <sched.h>
#include <unistd.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstdlib>
#include <thread>
#include <vector>

#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalWake.h"
#include "engine/LibraryFrame.h"
#include "engine/TimerArming.h"

namespace {

using quelta::tKPusLinuxNanoSleepTimer;

constexpr uint64_t kTickNs = 1000000;

uint64_t MonoNs() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * 1000000000ull + static_cast<uint64_t>(ts.tv_nsec);
}

ClockTime Ct(uint64_t ns) {
    return ClockTime{static_cast<uint32_t>(ns), static_cast<uint32_t>(ns >> 32)};
}

std::atomic<tKPusLinuxNanoSleepTimer*> gBenchTimer{nullptr};
std::atomic<uint64_t> gPending{0};     // armed deadline not yet served, 0 none
std::atomic<uint64_t> gLatency{0};     // of the last served deadline
std::atomic<uint32_t> gServed{0};
std::atomic<uint64_t> gNextTick{0};    // advanced by the timer thread

void TickLikeCallback() {
    const uint64_t now = MonoNs();
    const uint64_t pending = gPending.load();
    if (pending != 0 && pending <= now) {
        gLatency.store(now - pending);
        gPending.store(0);
        gServed.fetch_add(1);
    }
    uint64_t tick = gNextTick.load(std::memory_order_relaxed);
    while (tick <= now) tick += kTickNs;
    gNextTick.store(tick, std::memory_order_relaxed);
    const uint64_t still = gPending.load();
    const uint64_t next = (still != 0 && still < tick) ? still : tick;
    tKPusLinuxNanoSleepTimer* timer = gBenchTimer.load();
    timer->SetExpiry(Ct(next));
    // A deadline armed between our look at gPending and our own SetExpiry was
    // just overwritten; put it back so that the measurement is the timer's,
    // not this re-arming race's.
    const uint64_t late = gPending.load();
    if (late != 0 && late < next) timer->SetExpiry(Ct(late));
}

double Percentile(std::vector<uint64_t>& v, double p) {
    if (v.empty()) return 0;
    const size_t i = std::min(v.size() - 1, static_cast<size_t>(p * (v.size() - 1) + 0.5));
    std::nth_element(v.begin(), v.begin() + static_cast<std::ptrdiff_t>(i), v.end());
    return static_cast<double>(v[i]) / 1e3;
}

double Median(std::vector<double> v) {
    std::nth_element(v.begin(), v.begin() + static_cast<std::ptrdiff_t>(v.size() / 2), v.end());
    return v[v.size() / 2];
}

void BM_ArmToCallbackLatency(benchmark::State& state) {
    const bool standIn = state.range(0) != 0;
    const int32_t savedNr = quelta::gWakeSyscallNr.load();
    quelta::gWakeSyscallNr.store(-1);          // no kernel call: stand-in or fallback
    quelta::gWakeWarningShown.store(1);        // keep the fallback's warning out of the report
    quelta::gPalWakeStandInEnabled.store(true);

    gPending.store(0);
    gServed.store(0);
    gNextTick.store(MonoNs() + kTickNs);
    auto* timer = new tKPusLinuxNanoSleepTimer();
    if (timer == nullptr || timer->Initialize(&TickLikeCallback) != 0 || !timer->IsServing()) {
        delete timer;
        state.SkipWithError("timer thread not serving (needs SCHED_FIFO)");
        return;
    }
    gBenchTimer.store(timer);
    const uint64_t start = gNextTick.load();
    timer->SetExpiry(Ct(start));  // start ticking (wakes the parked thread)
    while (gNextTick.load() < start + 3 * kTickNs) std::this_thread::yield();
    quelta::gPalWakeStandInEnabled.store(standIn);

    // The arming thread runs at a middle real-time priority, as the runtime's
    // threads do, so that the machine's other work does not delay the arming
    // itself. It sleeps (rather than spins) while it waits for the callback.
    int policy = 0;
    sched_param saved{};
    pthread_getschedparam(pthread_self(), &policy, &saved);
    sched_param mid{};
    mid.sched_priority = sched_get_priority_max(SCHED_FIFO) / 2;
    pthread_setschedparam(pthread_self(), SCHED_FIFO, &mid);

    std::vector<uint64_t> latencies;
    latencies.reserve(static_cast<size_t>(state.max_iterations));
    uint32_t seed = 12345;
    for (auto _ : state) {
        seed = seed * 1103515245u + 12345u;
        const uint64_t ahead = 200000 + (seed >> 8) % 700001;  // 200-900 us
        const uint32_t served = gServed.load();
        const uint64_t deadline = MonoNs() + ahead;
        gPending.store(deadline);
        timer->SetExpiry(Ct(deadline));
        while (gServed.load() == served) {
            const timespec poll{0, 50000};
            nanosleep(&poll, nullptr);
        }
        latencies.push_back(gLatency.load());
    }
    pthread_setschedparam(pthread_self(), policy, &saved);

    quelta::gPalWakeStandInEnabled.store(true);
    delete timer;  // joins the thread; no callback runs after this
    gBenchTimer.store(nullptr);
    quelta::gWakeSyscallNr.store(savedNr);

    state.counters["p50_us"] = Percentile(latencies, 0.50);
    state.counters["p99_us"] = Percentile(latencies, 0.99);
    state.counters["max_us"] = Percentile(latencies, 1.0);
}

BENCHMARK(BM_ArmToCallbackLatency)
    ->ArgName("stand_in")
    ->Arg(1)
    ->Arg(0)
    ->Iterations(2000)
    ->UseRealTime()
    ->Unit(benchmark::kMicrosecond);

// CPU time a thread has used, in ns.
uint64_t ThreadCpuNs(pthread_t thread) {
    clockid_t clock;
    if (pthread_getcpuclockid(thread, &clock) != 0) return 0;
    timespec ts{};
    clock_gettime(clock, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * 1000000000ull + static_cast<uint64_t>(ts.tv_nsec);
}

// The library's timer thread at rest (the 1 ms tick and nothing else) against
// a bare SCHED_FIFO thread that sleeps to the next millisecond with
// clock_nanosleep, in the same window: CPU time per tick of each, and their
// ratio. What the library adds to the bare loop is its pass (a clock reading,
// its global equivalent, one hold of the scheduler lock, the re-arming).
void BM_IdleTickCostAgainstABareLoop(benchmark::State& state) {
    if (quelta::LibraryControl(0, 1, 0) != 1 || !quelta::TimerServing()) {
        state.SkipWithError("the library could not start with a serving timer");
        quelta::LibraryControl(0, 0, 0);
        return;
    }
    const pthread_t timerThread = quelta::gTimer.load()->thread;
    std::atomic<bool> quit{false};
    std::atomic<uint64_t> bareTicks{0};
    std::thread bare([&] {
        sched_param p{};
        p.sched_priority = sched_get_priority_max(SCHED_FIFO) - 1;
        pthread_setschedparam(pthread_self(), SCHED_FIFO, &p);
        uint64_t next = MonoNs();
        while (!quit.load(std::memory_order_relaxed)) {
            next += kTickNs;
            const timespec ts{static_cast<time_t>(next / 1000000000ull), static_cast<long>(next % 1000000000ull)};
            clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr);
            bareTicks.fetch_add(1, std::memory_order_relaxed);
        }
    });
    usleep(100000);
    // Windows of QUELTA_IDLE_WINDOW_S seconds (20 by default); the figures
    // are the medians over the windows.
    const char* window = std::getenv("QUELTA_IDLE_WINDOW_S");
    const useconds_t windowUs = static_cast<useconds_t>((window != nullptr ? std::atof(window) : 20.0) * 1e6);
    std::vector<double> library, bareCost, ratios;
    for (auto _ : state) {
        const uint64_t lib0 = ThreadCpuNs(timerThread), bare0 = ThreadCpuNs(bare.native_handle());
        const uint64_t ticks0 = bareTicks.load();
        const uint64_t t0 = MonoNs();
        usleep(windowUs);
        const double ms = static_cast<double>(MonoNs() - t0) / 1e6;  // the library ticks once per ms
        const double libraryNs = static_cast<double>(ThreadCpuNs(timerThread) - lib0) / ms;
        const double bareNs = static_cast<double>(ThreadCpuNs(bare.native_handle()) - bare0) /
                              static_cast<double>(std::max<uint64_t>(1, bareTicks.load() - ticks0));
        library.push_back(libraryNs);
        bareCost.push_back(bareNs);
        ratios.push_back(libraryNs / std::max(bareNs, 1.0));
    }
    quit.store(true);
    bare.join();
    quelta::LibraryControl(0, 0, 0);
    state.counters["library_ns_per_tick"] = Median(library);
    state.counters["bare_ns_per_tick"] = Median(bareCost);
    state.counters["ratio_median"] = Median(ratios);
    state.counters["ratio_max"] = *std::max_element(ratios.begin(), ratios.end());
}

BENCHMARK(BM_IdleTickCostAgainstABareLoop)->Iterations(5)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
