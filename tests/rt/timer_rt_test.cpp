// The timer thread at top SCHED_FIFO priority: never early, settings from other threads take effect at once,
// the SIGALRM fallback as designed, prompt destruction, and no wake lost wherever it lands.
#include <gtest/gtest.h>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <mutex>
#include <thread>

#include "LibraryFixture.h"
#include "TestSupport.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalWake.h"

#ifndef QUELTA_WAKE_SWEEP_ROUNDS
#define QUELTA_WAKE_SWEEP_ROUNDS 20000
#endif

namespace quelta {
namespace {

using testsupport::CT, testsupport::Eventually, testsupport::MonoNowNs;
void SpinFor(uint64_t ns) {
    for (const uint64_t end = MonoNowNs() + ns; MonoNowNs() < end;) {}
}
using Timer = tKPusLinuxNanoSleepTimer;

constexpr uint64_t kUs = 1000ull, kMs = 1000000ull;
constexpr uint64_t kLate = 50 * kMs;    // lateness bound: loose, the VM is noisy
constexpr uint64_t kFar = 10000 * kMs;  // a sleep to be cut short

// The callback runs on the timer thread, one timer firing at a time; the time
// is stored before the count moves, so a reader that sees the count sees it.
constexpr int kMaxCalls = 1 << 16;
std::atomic<int> gCalls{0};
std::atomic<uint64_t> gCallTimes[kMaxCalls];
void RecordCall() {
    const int i = gCalls.load();
    gCallTimes[i % kMaxCalls].store(MonoNowNs());
    gCalls.store(i + 1);
}
uint64_t CallTime(int i) { return gCallTimes[i].load(); }
bool WaitCalls(int n, uint64_t limit = 2000 * kMs) { return Eventually([n] { return gCalls.load() >= n; }, limit); }
// Call i came at or after `due`, and not grossly late.
void ExpectServed(int i, uint64_t due) {
    ASSERT_GE(CallTime(i), due) << "call " << i << " early";
    EXPECT_LT(CallTime(i) - due, kLate) << "call " << i;
}

class RtTimer : public ::testing::Test {
protected:
    void SetUp() override {
        if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO privilege";
        gCalls.store(0);
    }
    void TearDown() override {
        gPalWakeStandInEnabled.store(true);
        gWakeSyscallNr.store(savedNr_);
    }
    static std::unique_ptr<Timer> Start(QueltaExpiryCallbackFn fn = &RecordCall) {
        std::unique_ptr<Timer> timer(new Timer());
        EXPECT_TRUE(timer->Initialize(fn) == 0 && timer->IsServing());
        return timer;
    }
    int32_t savedNr_ = gWakeSyscallNr.load();
};

// A far deadline cut short from another thread by a nearer one, by ExpireNow,
// or by one already past: served at once, and only once. Settings made before
// the thread started are served too (the later one wins).
TEST_F(RtTimer, NewDeadlineFromAnotherThreadTakesEffectAtOnce) {
    std::unique_ptr<Timer> timer(new Timer());
    const uint64_t deadline = MonoNowNs() + 30 * kMs;
    timer->SetExpiry(CT(deadline - 25 * kMs));
    timer->SetExpiry(CT(deadline));
    ASSERT_EQ(timer->Initialize(&RecordCall), 0);
    ASSERT_TRUE(WaitCalls(1, 1000 * kMs));
    ExpectServed(0, deadline);
    for (int n = 2; n <= 4; ++n) {
        timer->SetExpiry(CT(MonoNowNs() + kFar));
        usleep(20000);
        uint64_t due = 0;
        std::thread([&] {
            due = MonoNowNs();
            if (n == 2) timer->SetExpiry(CT(due += 5 * kMs));
            if (n == 3) timer->ExpireNow();
            if (n == 4) timer->SetExpiry(CT(due - 1000 * kMs));
        }).join();
        ASSERT_TRUE(WaitCalls(n, 1000 * kMs)) << "the new deadline waited for the old one";
        ExpectServed(n - 1, due);
        usleep(50000);
        EXPECT_EQ(gCalls.load(), n) << "the replaced deadline must not be served too";
    }
}

class RtTimerDestruction : public RtTimer, public ::testing::WithParamInterface<bool> {};

// The thread is named and at top FIFO priority; parked or sleeping, with the
// stand-in on or off, the timer ends promptly and leaves nothing behind.
TEST_P(RtTimerDestruction, ParkedOrSleepingTimerEndsPromptlyAndLeavesNothingBehind) {
    gPalWakeStandInEnabled.store(GetParam());
    struct sigaction before {}, after {};
    sigaction(SIGALRM, nullptr, &before);
    const int threadsBefore = testsupport::CountThreads();
    auto parked = Start();  // never armed: parked on the far deadline
    auto sleeping = Start();
    sleeping->SetExpiry(CT(MonoNowNs() + kFar));
    const int32_t tid = parked->state.threadId.load();
    std::string name;
    std::getline(std::ifstream("/proc/self/task/" + std::to_string(tid) + "/comm"), name);
    sched_param param{};
    EXPECT_EQ(name, "QUELTAisr");
    EXPECT_TRUE(sched_getscheduler(tid) == SCHED_FIFO && sched_getparam(tid, &param) == 0);
    EXPECT_EQ(param.sched_priority, sched_get_priority_max(SCHED_FIFO));
    usleep(10000);
    for (std::unique_ptr<Timer>* timer : {&parked, &sleeping}) {
        const uint64_t t0 = MonoNowNs();
        timer->reset();
        EXPECT_LT(MonoNowNs() - t0, 50 * kMs);
    }
    EXPECT_EQ(gCalls.load(), 0);
    sigaction(SIGALRM, nullptr, &after);
    EXPECT_EQ(after.sa_handler, before.sa_handler) << "SIGALRM action not restored";
    // A joined thread can linger in /proc for a moment (under an emulator).
    EXPECT_TRUE(Eventually([&] { return testsupport::CountThreads() == threadsBefore; }, 1000 * kMs));
}
INSTANTIATE_TEST_SUITE_P(StandIn, RtTimerDestruction, ::testing::Values(true, false),
                         [](const auto& info) { return info.param ? "On" : "Off"; });

std::atomic<int> gAlarms{0};
std::atomic<int32_t> gAlarmTids[64];
void CountingAlarm(int sig) {
    gAlarmTids[gAlarms.fetch_add(1) % 64].store(static_cast<int32_t>(syscall(SYS_gettid)));
    Timer::AlarmHandler(sig);
}

// While the stand-in serves, nothing is printed. Under the fallback a SIGALRM cannot end the sleep (EINTR
// resumes it): a new deadline is taken once the one slept on is served.
TEST_F(RtTimer, FallbackWarnsOncePerProcessSignalsEveryTimeAndServesAfterTheOldDeadline) {
    gWakeSyscallNr = -1, gWakeWarningShown = 0;
    testing::internal::CaptureStdout();
    auto a = Start(), b = Start();
    const uint64_t old = MonoNowNs() + 300 * kMs;
    a->SetExpiry(CT(old));
    usleep(20000);
    EXPECT_EQ(gWakeWarningShown.load(), 0) << "the stand-in woke with a warning";
    testsupport::ScopedAlarmHandler counting(&CountingAlarm);  // the timers' own, put back at the end
    gAlarms = 0, gPalWakeStandInEnabled = false;
    a->SetExpiry(CT(MonoNowNs() + 20 * kMs));  // cannot cut the sleep short
    for (int i = 0; i < 3; ++i) usleep(10000), b->SetExpiry(CT(MonoNowNs() + kFar));
    const bool served = WaitCalls(2);
    std::fflush(stdout);
    const std::string out = testing::internal::GetCapturedStdout();
    ASSERT_TRUE(served) << gCalls.load() << " callbacks";
    ExpectServed(0, old);  // the old deadline first; the new one, already past, right after
    EXPECT_GE(CallTime(1), CallTime(0));
    EXPECT_LT(CallTime(1) - old, kLate);
    EXPECT_EQ(out, "Warning: using sched_wake_up system call -1 failed!\n"
                   "This could lead to degraded nanosecond engine performance.\n");
    EXPECT_EQ(gAlarms.load(), 4) << "one SIGALRM per fallback wake";
    for (int i = 0; i < std::min(gAlarms.load(), 4); ++i) {
        const int32_t t = gAlarmTids[i].load();
        EXPECT_TRUE(t == a->state.threadId.load() || t == b->state.threadId.load()) << "SIGALRM went to " << t;
    }
}

// Two threads set deadlines (some past) at random; setting k arms armed[k]. A callback serves a value set
// after the previous callback ended (k >= floor) and before it began (k <= seen): never before all of them.
constexpr int kMaxSets = 1 << 16;
std::atomic<uint64_t> gArmed[kMaxSets], gStressAt[kMaxCalls];
std::atomic<int> gSetStarted{0}, gSetDone{0}, gStressSeen[kMaxCalls], gStressFloor[kMaxCalls];
int gFloorForNext = 0;  // timer thread only

void StressCall() {
    const int i = gCalls.load();
    if (i < kMaxCalls) {
        gStressAt[i].store(MonoNowNs());
        gStressSeen[i].store(gSetStarted.load());
        gStressFloor[i].store(gFloorForNext);
    }
    gFloorForNext = gSetDone.load();
    gCalls.store(i + 1);
}

TEST_F(RtTimer, ConcurrentSettersNeverGetEarlyCallbacksNorLoseTheLastWake) {
    gSetStarted = 0, gSetDone = 0, gFloorForNext = 0;
    auto timer = Start(&StressCall);
    std::mutex setMutex;
    auto set = [&](uint64_t deadline) {
        std::lock_guard<std::mutex> hold(setMutex);
        const int k = gSetStarted.load() + 1;
        if (k >= kMaxSets) return false;
        gArmed[k].store(deadline);
        gSetStarted.store(k);
        timer->SetExpiry(CT(deadline));
        gSetDone.store(k);
        return true;
    };
    std::atomic<bool> stop{false};
    auto writer = [&](uint32_t seed) {
        while (!stop.load()) {
            seed = seed * 1103515245u + 12345u;
            const uint32_t r = seed >> 8;  // one in 16 like ExpireNow, else -0.2 to 1.5 ms ahead
            if (!set(r % 16 == 0 ? 0 : MonoNowNs() + (r % 1700) * kUs - 200 * kUs)) break;
            if ((seed >> 4) % 400 > 20) usleep((seed >> 4) % 400);
        }
    };
    std::thread w1(writer, 1u), w2(writer, 2u);
    usleep(1500000);
    stop = true, w1.join(), w2.join();
    // The last wake: a far deadline replaced from another thread by a near one
    // must be served (a callback may still serve a value taken before).
    set(MonoNowNs() + kFar);
    uint64_t last = 0;
    int lastSeq = 0;
    std::thread([&] { set(last = MonoNowNs() + 2 * kMs), lastSeq = gSetDone.load(); }).join();
    ASSERT_TRUE(Eventually([&] {
        const int n = gCalls.load();
        return n > 0 && gStressSeen[n - 1].load() >= lastSeq && gStressAt[n - 1].load() >= last;
    })) << "the last deadline was lost";
    const int calls = gCalls.load();
    timer.reset();
    ASSERT_LE(calls, kMaxCalls);
    EXPECT_LT(gStressAt[calls - 1].load() - last, kLate);
    int early = 0;
    for (int i = 0; i < calls; ++i) {
        const int lo = std::max(gStressFloor[i].load(), 1), hi = gStressSeen[i].load();
        ASSERT_LE(lo, hi) << "callback " << i << " ran with no deadline set for it";
        uint64_t soonest = UINT64_MAX;
        for (int k = lo; k <= hi; ++k) soonest = std::min(soonest, gArmed[k].load());
        early += gStressAt[i].load() < soonest;
    }
    EXPECT_EQ(early, 0) << "callbacks served before any deadline they could belong to";
}

// The wake sweep: the callback re-arms far ahead; the waker on the other CPU then sets a due deadline, at a
// swept offset (<0: the callback spins; >0: the waker spins) that lands it in the callback, on the way into
// the sleep and in it; a lost one ends only at the old deadline.
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
    gSweepTimer.load()->SetExpiry(CT(MonoNowNs() + kOldDeadline));
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
            timer->ExpireNow();
            const uint64_t set = MonoNowNs();  // after the wake: a waker held off the CPU before it loses nothing
            stuck = !WaitForCallback(++seen, 2 * kOldDeadline);  // not even the old deadline came
            lost += static_cast<int64_t>(gLastCallback.load() - set) > static_cast<int64_t>(kLost);
        }
    });
    waker.join();
    timer.reset();
    PinTo(-1);
    EXPECT_FALSE(stuck);
    EXPECT_EQ(lost, 0) << "wakes that only ended at the old deadline, in " << rounds << " rounds";
}

TEST(TimerWakeSweep, NoWakeIsLostWhereverItLandsOnTheWayIntoTheSleep) { Sweep(-1500, 1500); }

}  // namespace
}  // namespace quelta
