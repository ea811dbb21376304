// A new deadline set from another thread must end the timer thread's sleep
// wherever the setting lands: in particular in the moment between the
// thread's last look at its wake state and its entry into the kernel.
//
// Each round the callback re-arms the timer itself for a deadline
// kOldDeadline ahead, tells the waker and returns; the thread then goes to
// sleep on the old deadline. The waker, on the other CPU, sets a deadline
// that is already due when it hears from the callback. A swept offset moves
// the two apart: negative, the callback spins before it returns; positive,
// the waker spins before it sets. Across the sweep the wake lands in the
// callback, on the thread's way into its sleep, and in the sleep. A lost wake
// shows as a callback that comes only at the old deadline.
//
// On 32-bit glibc, clock_nanosleep copies the request into its own frame
// (converting it for the 64-bit time call) before it enters the kernel; a
// wake design that edits the caller's request from a signal handler loses
// wakes that land in that window. The window is a few dozen nanoseconds, so
// the second sweep widens it: the test's own clock_nanosleep makes the same
// copy and waits kWrapperWindowNs before it calls the C library's.
#include <gtest/gtest.h>

#include <dlfcn.h>
#include <pthread.h>
#include <sched.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <memory>
#include <thread>

#include "TestSupport.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"

#ifndef QUELTA_WAKE_SWEEP_ROUNDS
#define QUELTA_WAKE_SWEEP_ROUNDS 20000
#endif

namespace {

using testsupport::MonoNowNs;

std::atomic<bool> gWidenWrapperWindow{false};
constexpr uint64_t kWrapperWindowNs = 2000;

void SpinFor(uint64_t ns) {
    for (const uint64_t end = MonoNowNs() + ns; MonoNowNs() < end;) {
    }
}

#if defined(__USE_TIME_BITS64) && __TIMESIZE == 32
constexpr const char* kClockNanosleepSymbol = "__clock_nanosleep_time64";
#else
constexpr const char* kClockNanosleepSymbol = "clock_nanosleep";
#endif

}  // namespace

// Interposes on the C library's clock_nanosleep for this test program.
extern "C" int clock_nanosleep(clockid_t clock, int flags, const struct timespec* request,
                               struct timespec* remain) {
    using Fn = int (*)(clockid_t, int, const struct timespec*, struct timespec*);
    static const Fn real = reinterpret_cast<Fn>(dlsym(RTLD_NEXT, kClockNanosleepSymbol));
    if (!gWidenWrapperWindow.load(std::memory_order_relaxed)) return real(clock, flags, request, remain);
    const struct timespec copy = *request;
    SpinFor(kWrapperWindowNs);
    return real(clock, flags, &copy, remain);
}

namespace quelta {
namespace {

constexpr int kRounds = QUELTA_WAKE_SWEEP_ROUNDS;
constexpr uint64_t kMs = 1000000ull;
constexpr uint64_t kOldDeadline = 150 * kMs;  // what a lost wake sleeps on to
constexpr uint64_t kLost = 100 * kMs;         // a wake this late was lost
constexpr int kEnoughLost = 3;                // a sweep stops after so many

ClockTime Ct(uint64_t ns) { return ClockTime{static_cast<uint32_t>(ns), static_cast<uint32_t>(ns >> 32)}; }

std::atomic<tKPusLinuxNanoSleepTimer*> gSweepTimer{nullptr};
std::atomic<uint32_t> gCallbacks{0};
std::atomic<uint64_t> gLastCallback{0};
std::atomic<int64_t> gSweepFrom{0}, gSweepTo{0};  // the offset's range, ns

// The offset of round n: [from, to) in 3 ns steps.
int64_t OffsetOf(uint32_t n) {
    const int64_t from = gSweepFrom.load(std::memory_order_relaxed);
    const int64_t span = gSweepTo.load(std::memory_order_relaxed) - from;
    return span <= 0 ? from : from + static_cast<int64_t>((static_cast<uint64_t>(n) * 3) % span);
}

void ReArmFarAndCount() {
    gLastCallback.store(MonoNowNs());
    gSweepTimer.load()->SetExpiry(Ct(MonoNowNs() + kOldDeadline));
    const int64_t offset = OffsetOf(gCallbacks.fetch_add(1, std::memory_order_release));
    if (offset < 0) SpinFor(static_cast<uint64_t>(-offset));
}

bool PinTo(int cpu) {
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    return pthread_setaffinity_np(pthread_self(), sizeof set, &set) == 0;
}

void UnpinAll() {
    cpu_set_t all;
    CPU_ZERO(&all);
    for (long c = 0; c < CPU_SETSIZE && c < sysconf(_SC_NPROCESSORS_ONLN); ++c) CPU_SET(c, &all);
    pthread_setaffinity_np(pthread_self(), sizeof all, &all);
}

bool WaitForCallback(uint32_t count, uint64_t timeoutNs) {
    for (const uint64_t end = MonoNowNs() + timeoutNs; gCallbacks.load(std::memory_order_acquire) < count;) {
        if (MonoNowNs() > end) return false;
    }
    return true;
}

struct SweepResult {
    int rounds = 0, lost = 0;
    bool stuck = false;
    uint64_t worst = 0;
};

// Runs `rounds` wakes with the offset swept over [from, to) nanoseconds.
SweepResult Sweep(int rounds, int64_t from, int64_t to) {
    SweepResult result;
    // The timer thread inherits CPU 0 from this thread; the waker runs on CPU 1.
    PinTo(0);
    std::unique_ptr<tKPusLinuxNanoSleepTimer> timer(new tKPusLinuxNanoSleepTimer());
    gSweepTimer.store(timer.get());
    gCallbacks.store(0);
    gSweepFrom.store(from);
    gSweepTo.store(to);
    if (timer->Initialize(&ReArmFarAndCount) != 0 || !timer->IsServing()) {
        result.stuck = true;
        return result;
    }
    std::thread waker([&] {
        PinTo(1);
        sched_param p{};
        p.sched_priority = sched_get_priority_max(SCHED_FIFO) - 1;
        pthread_setschedparam(pthread_self(), SCHED_FIFO, &p);
        uint32_t seen = 0;
        timer->ExpireNow();
        if (!WaitForCallback(++seen, 1000 * kMs)) {
            result.stuck = true;
            return;
        }
        for (; result.rounds < rounds && result.lost < kEnoughLost; ++result.rounds) {
            const int64_t offset = OffsetOf(seen - 1);  // the round of the callback just seen
            if (offset > 0) SpinFor(static_cast<uint64_t>(offset));
            const uint64_t set = MonoNowNs();
            timer->ExpireNow();
            if (!WaitForCallback(++seen, 2 * kOldDeadline)) {
                result.stuck = true;  // not even the old deadline came
                return;
            }
            const uint64_t late = gLastCallback.load() - set;
            result.worst = std::max(result.worst, late);
            if (late > kLost) ++result.lost;
        }
    });
    waker.join();
    timer.reset();
    UnpinAll();
    return result;
}

class TimerWakeSweep : public ::testing::Test {
protected:
    void SetUp() override {
        if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO privilege";
        if (sysconf(_SC_NPROCESSORS_ONLN) < 2) GTEST_SKIP() << "needs 2 CPUs";
    }
    void TearDown() override { gWidenWrapperWindow.store(false); }
    static void Check(const SweepResult& r, const char* what) {
        printf("%s: %d rounds, %d wakes lost, worst %.1f us\n", what, r.rounds, r.lost, r.worst / 1e3);
        EXPECT_FALSE(r.stuck);
        EXPECT_EQ(r.lost, 0) << "wakes that only ended at the old deadline";
    }
};

TEST_F(TimerWakeSweep, NoWakeIsLostWhereverItLandsOnTheWayIntoTheSleep) {
    Check(Sweep(kRounds, -1500, 1500), "C library as it is");
}

TEST_F(TimerWakeSweep, NoWakeIsLostInsideTheSleepCallsOwnPreamble) {
    gWidenWrapperWindow.store(true);
    Check(Sweep(kRounds, -1500, 1500 + static_cast<int64_t>(kWrapperWindowNs)), "wrapper window widened");
}

}  // namespace
}  // namespace quelta
