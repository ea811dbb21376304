// A deadline set from another thread must end the timer thread's sleep
// wherever the setting lands, in particular between the thread's last look at
// its wake state and its entry into the kernel. Each round the callback
// re-arms for a deadline kOldDeadline ahead and returns; the waker, on the
// other CPU, then sets one already due. A swept offset moves the two apart
// (negative: the callback spins before it returns; positive: the waker spins
// before it sets), so the wake lands in the callback, on the way into the
// sleep and in it. A lost wake shows as a callback only at the old deadline.
// On 32-bit glibc clock_nanosleep copies the request into its own frame
// before the kernel call; a design that edits the caller's request from a
// signal handler loses wakes in that window. The second sweep widens it: this
// program's clock_nanosleep makes the same copy and waits kWrapperWindowNs.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sched.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <thread>

#include "LibraryFixture.h"
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
    for (const uint64_t end = MonoNowNs() + ns; MonoNowNs() < end;) {}
}
#if defined(__USE_TIME_BITS64) && __TIMESIZE == 32
constexpr const char* kClockNanosleepSymbol = "__clock_nanosleep_time64";
#else
constexpr const char* kClockNanosleepSymbol = "clock_nanosleep";
#endif
}  // namespace

// Interposes on the C library's clock_nanosleep for this test program.
extern "C" int clock_nanosleep(clockid_t clock, int flags, const struct timespec* request, struct timespec* remain) {
    using Fn = int (*)(clockid_t, int, const struct timespec*, struct timespec*);
    static const Fn real = reinterpret_cast<Fn>(dlsym(RTLD_NEXT, kClockNanosleepSymbol));
    if (!gWidenWrapperWindow.load(std::memory_order_relaxed)) return real(clock, flags, request, remain);
    const struct timespec copy = *request;
    SpinFor(kWrapperWindowNs);
    return real(clock, flags, &copy, remain);
}

namespace quelta {
namespace {

constexpr uint64_t kMs = 1000000ull;
constexpr uint64_t kOldDeadline = 150 * kMs;  // what a lost wake sleeps on to
constexpr uint64_t kLost = 100 * kMs;         // a wake this late was lost

std::atomic<tKPusLinuxNanoSleepTimer*> gSweepTimer{nullptr};
std::atomic<uint32_t> gCallbacks{0};
std::atomic<uint64_t> gLastCallback{0};
std::atomic<int64_t> gSweepFrom{0}, gSweepTo{0};  // the offset's range, ns

int64_t OffsetOf(uint32_t n) {  // round n's offset: [from, to) in 3 ns steps
    const int64_t from = gSweepFrom.load(), span = gSweepTo.load() - from;
    return span <= 0 ? from : from + static_cast<int64_t>((static_cast<uint64_t>(n) * 3) % span);
}
void ReArmFarAndCount() {
    gLastCallback.store(MonoNowNs());
    gSweepTimer.load()->SetExpiry(testsupport::CT(MonoNowNs() + kOldDeadline));
    const int64_t offset = OffsetOf(gCallbacks.fetch_add(1, std::memory_order_release));
    if (offset < 0) SpinFor(static_cast<uint64_t>(-offset));
}
void PinTo(int cpu) {
    cpu_set_t set;
    CPU_ZERO(&set);
    if (cpu >= 0) CPU_SET(cpu, &set);
    for (long c = 0; cpu < 0 && c < CPU_SETSIZE && c < sysconf(_SC_NPROCESSORS_ONLN); ++c) CPU_SET(c, &set);
    pthread_setaffinity_np(pthread_self(), sizeof set, &set);
}
bool WaitForCallback(uint32_t count, uint64_t timeoutNs) {
    for (const uint64_t end = MonoNowNs() + timeoutNs; gCallbacks.load(std::memory_order_acquire) < count;)
        if (MonoNowNs() > end) return false;
    return true;
}

// `rounds` wakes with the offset swept over [from, to) ns; none may be lost.
void Sweep(int64_t from, int64_t to) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO privilege";
    if (sysconf(_SC_NPROCESSORS_ONLN) < 2) GTEST_SKIP() << "needs 2 CPUs";
    PinTo(0);  // the timer thread inherits CPU 0; the waker runs on CPU 1
    std::unique_ptr<tKPusLinuxNanoSleepTimer> timer(new tKPusLinuxNanoSleepTimer());
    gSweepTimer.store(timer.get());
    gCallbacks.store(0);
    gSweepFrom.store(from);
    gSweepTo.store(to);
    ASSERT_TRUE(timer->Initialize(&ReArmFarAndCount) == 0 && timer->IsServing());
    int rounds = 0, lost = 0;
    bool stuck = false;
    std::thread waker([&] {
        PinTo(1);
        sched_param p{};
        p.sched_priority = sched_get_priority_max(SCHED_FIFO) - 1;
        pthread_setschedparam(pthread_self(), SCHED_FIFO, &p);
        uint32_t seen = 0;
        timer->ExpireNow();
        stuck = !WaitForCallback(++seen, 1000 * kMs);
        for (; !stuck && rounds < QUELTA_WAKE_SWEEP_ROUNDS && lost < 3; ++rounds) {
            const int64_t offset = OffsetOf(seen - 1);  // the round of the callback just seen
            if (offset > 0) SpinFor(static_cast<uint64_t>(offset));
            const uint64_t set = MonoNowNs();
            timer->ExpireNow();
            stuck = !WaitForCallback(++seen, 2 * kOldDeadline);  // not even the old deadline came
            lost += gLastCallback.load() - set > kLost;
        }
    });
    waker.join();
    timer.reset();
    PinTo(-1);
    EXPECT_FALSE(stuck);
    EXPECT_EQ(lost, 0) << "wakes that only ended at the old deadline, in " << rounds << " rounds";
}

TEST(TimerWakeSweep, NoWakeIsLostWhereverItLandsOnTheWayIntoTheSleep) { Sweep(-1500, 1500); }

TEST(TimerWakeSweep, NoWakeIsLostInsideTheSleepCallsOwnPreamble) {
    gWidenWrapperWindow.store(true);
    Sweep(-1500, 1500 + static_cast<int64_t>(kWrapperWindowNs));
    gWidenWrapperWindow.store(false);
}

}  // namespace
}  // namespace quelta
