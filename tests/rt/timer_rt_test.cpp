// The timer with its thread serving at top SCHED_FIFO priority: deadlines are
// never served early, new deadlines from other threads take effect at once
// through the wake stand-in, the plain SIGALRM fallback behaves as designed,
// and destruction is prompt and leaves nothing behind.
#include <gtest/gtest.h>

#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <fstream>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "TestSupport.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalWake.h"

namespace quelta {
namespace {

using testsupport::MonoNowNs;
using Timer = tKPusLinuxNanoSleepTimer;

constexpr uint64_t kUs = 1000ull, kMs = 1000000ull;
constexpr uint64_t kLate = 50 * kMs;    // lateness bound: loose, the VM is noisy
constexpr uint64_t kFar = 10000 * kMs;  // a sleep to be cut short

ClockTime Ct(uint64_t ns) { return ClockTime{static_cast<uint32_t>(ns), static_cast<uint32_t>(ns >> 32)}; }
int32_t Tid() { return static_cast<int32_t>(syscall(SYS_gettid)); }

bool WaitUntil(const std::function<bool()>& done, uint64_t timeoutNs = 2000 * kMs) {
    for (const uint64_t end = MonoNowNs() + timeoutNs; !done(); usleep(200)) {
        if (MonoNowNs() > end) return false;
    }
    return true;
}

// The callback runs on the timer thread (one timer fires at a time in these
// tests). The time is stored before the count moves, so a reader that sees
// the count also sees the time.
constexpr int kMaxCalls = 1 << 16;
std::atomic<int> gCalls{0};
std::atomic<uint64_t> gCallTimes[kMaxCalls];
std::atomic<void (*)()> gAfterCall{nullptr};  // a test's extra work in the callback
void RecordCall() {
    const uint64_t now = MonoNowNs();
    const int i = gCalls.load();
    if (i < kMaxCalls) gCallTimes[i].store(now);
    gCalls.store(i + 1);
    if (void (*extra)() = gAfterCall.load()) extra();
}
uint64_t CallTime(int i) { return gCallTimes[i].load(); }
bool WaitCalls(int n, uint64_t timeoutNs = 2000 * kMs) {
    return WaitUntil([n] { return gCalls.load() >= n; }, timeoutNs);
}

class RtTimer : public ::testing::Test {
protected:
    void SetUp() override {
        if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO privilege";
        gCalls.store(0);
    }
    void TearDown() override {
        gAfterCall.store(nullptr);
        gPalWakeStandInEnabled.store(true);
        gWakeSyscallNr.store(savedNr_);
    }
    static std::unique_ptr<Timer> Start(QueltaExpiryCallbackFn fn = &RecordCall) {
        std::unique_ptr<Timer> timer(new Timer());
        EXPECT_EQ(timer->Initialize(fn), 0);
        EXPECT_TRUE(timer->IsServing());
        return timer;
    }
    int32_t savedNr_ = gWakeSyscallNr.load();
};

// --- deadlines ------------------------------------------------------------

TEST_F(RtTimer, CallbacksNeverRunBeforeTheirDeadline) {
    auto timer = Start();
    uint64_t worst = 0;
    int n = 0;
    for (int rep = 0; rep < 3; ++rep) {
        for (uint64_t ahead : {200 * kUs, 500 * kUs, 1 * kMs, 2 * kMs, 5 * kMs, 10 * kMs}) {
            const uint64_t deadline = MonoNowNs() + ahead;
            timer->SetExpiry(Ct(deadline));
            ASSERT_TRUE(WaitCalls(++n)) << "deadline " << ahead << " ns ahead never served";
            ASSERT_GE(CallTime(n - 1), deadline) << "served early, " << ahead << " ns ahead";
            EXPECT_LT(CallTime(n - 1) - deadline, kLate);
            worst = std::max(worst, CallTime(n - 1) - deadline);
        }
    }
    printf("worst lateness over %d deadlines: %.1f us\n", n, worst / 1e3);
}

// The callback re-arms from the timer thread itself (no wake is attempted);
// each new deadline is taken as soon as the callback returns.
constexpr int kLinks = 50;
std::atomic<Timer*> gChainTimer{nullptr};
std::atomic<uint64_t> gChainDeadlines[kLinks];
void ReArm() {
    const int next = gCalls.load();
    if (next >= kLinks) return;
    gChainDeadlines[next].store(gChainDeadlines[next - 1].load() + 1 * kMs);
    gChainTimer.load()->SetExpiry(Ct(gChainDeadlines[next].load()));
}

TEST_F(RtTimer, CallbackReArmingFromInsideTheCallbackChains) {
    auto timer = Start();
    gChainTimer.store(timer.get());
    gAfterCall.store(&ReArm);
    gChainDeadlines[0].store(MonoNowNs() + 2 * kMs);
    timer->SetExpiry(Ct(gChainDeadlines[0].load()));
    ASSERT_TRUE(WaitCalls(kLinks, 3000 * kMs)) << "chain stopped after " << gCalls.load();
    usleep(20000);
    EXPECT_EQ(gCalls.load(), kLinks) << "the chain's end must leave the timer parked";
    for (int i = 0; i < kLinks; ++i) {
        ASSERT_GE(CallTime(i), gChainDeadlines[i].load()) << "link " << i << " early";
        EXPECT_LT(CallTime(i) - gChainDeadlines[i].load(), kLate) << "link " << i;
    }
}

// A far deadline cut short from another thread by a nearer one, by
// ExpireNow, or by one already past: served at once, and only once.
TEST_F(RtTimer, NewDeadlineFromAnotherThreadTakesEffectAtOnce) {
    auto timer = Start();
    for (int n = 1; n <= 3; ++n) {
        SCOPED_TRACE(n);
        timer->SetExpiry(Ct(MonoNowNs() + kFar));
        usleep(20000);
        uint64_t due = 0;  // when the callback is due
        std::thread([&] {
            due = MonoNowNs();
            if (n == 1) timer->SetExpiry(Ct(due += 5 * kMs));
            if (n == 2) timer->ExpireNow();
            if (n == 3) timer->SetExpiry(Ct(due - 1000 * kMs));
        }).join();
        ASSERT_TRUE(WaitCalls(n, 1000 * kMs)) << "the new deadline waited for the old one";
        ASSERT_GE(CallTime(n - 1), due);
        EXPECT_LT(CallTime(n - 1) - due, kLate);
        printf("served %.1f us after it was due\n", (CallTime(n - 1) - due) / 1e3);
        usleep(50000);
        EXPECT_EQ(gCalls.load(), n) << "the replaced deadline must not be served too";
    }
}

TEST_F(RtTimer, DeadlineSetBeforeTheThreadStartedIsServed) {
    std::unique_ptr<Timer> timer(new Timer());
    const uint64_t deadline = MonoNowNs() + 30 * kMs;
    timer->SetExpiry(Ct(deadline - 25 * kMs));
    timer->SetExpiry(Ct(deadline));  // the later call wins
    ASSERT_EQ(timer->Initialize(&RecordCall), 0);
    ASSERT_TRUE(WaitCalls(1, 1000 * kMs));
    EXPECT_GE(CallTime(0), deadline);
    EXPECT_LT(CallTime(0) - deadline, kLate);
    usleep(30000);
    EXPECT_EQ(gCalls.load(), 1);
}

// Two deadlines set while the thread is busy in the callback: it takes only
// the one set last, once.
std::atomic<bool> gHoldFirstCall{false}, gInFirstCall{false};
void HoldFirstCall() {
    if (gCalls.load() != 1) return;
    gInFirstCall.store(true);
    while (gHoldFirstCall.load()) usleep(100);
}

TEST_F(RtTimer, TwoSettingsBeforeATakeGiveOneCallbackAtTheLastSet) {
    auto timer = Start();
    gHoldFirstCall.store(true);
    gInFirstCall.store(false);
    gAfterCall.store(&HoldFirstCall);
    timer->ExpireNow();
    ASSERT_TRUE(WaitUntil([] { return gInFirstCall.load(); }, 1000 * kMs));
    const uint64_t first = MonoNowNs() + 300 * kMs, last = MonoNowNs() + 15 * kMs;
    timer->SetExpiry(Ct(first));
    timer->SetExpiry(Ct(last));
    gHoldFirstCall.store(false);
    ASSERT_TRUE(WaitCalls(2, 1000 * kMs));
    EXPECT_GE(CallTime(1), last);
    EXPECT_LT(CallTime(1), first) << "the overwritten deadline was served";
    ASSERT_TRUE(WaitUntil([&] { return MonoNowNs() > first + 50 * kMs; }));
    EXPECT_EQ(gCalls.load(), 2);
}

// --- the thread -------------------------------------------------------------

TEST_F(RtTimer, ThreadIsNamedAndRunsAtTopFifoPriority) {
    auto timer = Start();
    const int32_t tid = timer->state.threadId.load();
    ASSERT_GT(tid, 0);
    std::ifstream comm("/proc/self/task/" + std::to_string(tid) + "/comm");
    std::string name;
    std::getline(comm, name);
    EXPECT_EQ(name, "QUELTAisr");
    EXPECT_EQ(sched_getscheduler(tid), SCHED_FIFO);
    sched_param param{};
    ASSERT_EQ(sched_getparam(tid, &param), 0);
    EXPECT_EQ(param.sched_priority, sched_get_priority_max(SCHED_FIFO));
}

class RtTimerDestruction : public RtTimer, public ::testing::WithParamInterface<bool> {};

TEST_P(RtTimerDestruction, ParkedOrSleepingTimerEndsPromptlyAndLeavesNothingBehind) {
    gPalWakeStandInEnabled.store(GetParam());
    struct sigaction before {}, after {};
    sigaction(SIGALRM, nullptr, &before);
    const int threadsBefore = testsupport::CountThreads();
    auto parked = Start();  // never armed: parked on the far deadline
    auto sleeping = Start();
    sleeping->SetExpiry(Ct(MonoNowNs() + kFar));
    usleep(10000);
    for (std::unique_ptr<Timer>* timer : {&parked, &sleeping}) {
        const uint64_t t0 = MonoNowNs();
        timer->reset();
        printf("destruction took %.1f us\n", (MonoNowNs() - t0) / 1e3);
        EXPECT_LT(MonoNowNs() - t0, 50 * kMs);
    }
    EXPECT_EQ(gCalls.load(), 0);
    sigaction(SIGALRM, nullptr, &after);
    EXPECT_EQ(after.sa_handler, before.sa_handler) << "SIGALRM action not restored";
    // A joined thread can linger in /proc for a moment (under an emulator).
    EXPECT_TRUE(WaitUntil([&] { return testsupport::CountThreads() == threadsBefore; }, 1000 * kMs))
        << testsupport::CountThreads() << " threads, " << threadsBefore << " before";
}

INSTANTIATE_TEST_SUITE_P(StandIn, RtTimerDestruction, ::testing::Values(true, false),
                         [](const ::testing::TestParamInfo<bool>& info) { return info.param ? "On" : "Off"; });

// --- the plain SIGALRM fallback -------------------------------------------

std::atomic<int> gAlarms{0};
std::atomic<int32_t> gAlarmTids[64];
void CountingAlarm(int sig) {
    const int i = gAlarms.fetch_add(1);
    if (i < 64) gAlarmTids[i].store(Tid());
    Timer::AlarmHandler(sig);
}

// While the stand-in serves, nothing is printed. Under the fallback a SIGALRM
// cannot end the sleep (EINTR resumes it), so a new deadline is taken only
// once the one being slept on has been served. A thread parked on the far
// deadline would never take one; the test therefore arms with the stand-in
// on and switches it off only for the settings under test.
TEST_F(RtTimer, FallbackWarnsOncePerProcessSignalsEveryTimeAndServesAfterTheOldDeadline) {
    gWakeSyscallNr.store(-1);
    gWakeWarningShown.store(0);
    testing::internal::CaptureStdout();
    auto a = Start();
    auto b = Start();
    const uint64_t old = MonoNowNs() + 300 * kMs;
    a->SetExpiry(Ct(old));
    b->SetExpiry(Ct(MonoNowNs() + kFar));
    EXPECT_EQ(WakeTimerThread(b->state), 0);
    usleep(20000);
    EXPECT_EQ(gWakeWarningShown.load(), 0) << "the stand-in served without a word";

    struct sigaction counting {}, timers {};
    counting.sa_handler = &CountingAlarm;
    sigemptyset(&counting.sa_mask);
    sigaction(SIGALRM, &counting, &timers);
    gAlarms.store(0);
    gPalWakeStandInEnabled.store(false);
    const uint64_t fresh = MonoNowNs() + 20 * kMs;
    a->SetExpiry(Ct(fresh));  // cannot cut the sleep short
    for (int i = 0; i < 3; ++i) {
        usleep(10000);
        b->SetExpiry(Ct(MonoNowNs() + kFar));
    }
    const bool served = WaitCalls(2);
    std::fflush(stdout);
    const std::string out = testing::internal::GetCapturedStdout();
    sigaction(SIGALRM, &timers, nullptr);
    ASSERT_TRUE(served) << gCalls.load() << " callbacks";

    // The old deadline is served first; the new one, already past, right after.
    EXPECT_GE(CallTime(0), old) << "the fallback must not end the sleep early";
    EXPECT_GE(CallTime(1), CallTime(0));
    EXPECT_LT(CallTime(1) - old, kLate);
    printf("fallback: new deadline served %.1f ms late (old deadline %.1f ms after it)\n",
           (CallTime(1) - fresh) / 1e6, (old - fresh) / 1e6);
    EXPECT_EQ(out,
              "Warning: using sched_wake_up system call -1 failed!\n"
              "This could lead to degraded nanosecond engine performance.\n");
    EXPECT_EQ(gAlarms.load(), 4) << "one SIGALRM per fallback wake";
    const int32_t ta = a->state.threadId.load(), tb = b->state.threadId.load();
    for (int i = 0; i < std::min(gAlarms.load(), 4); ++i) {
        const int32_t t = gAlarmTids[i].load();
        EXPECT_TRUE(t == ta || t == tb) << "SIGALRM went to thread " << t;
    }
}

// --- concurrent setters -----------------------------------------------------
//
// Two threads set deadlines (some already past) at random moments while the
// timer serves. A test mutex serialises the settings, giving each a sequence
// number k and deadline armed[k]. A callback serves the value the thread took
// last, which was set after the settings completed before the previous
// callback ended (k >= floor) and before this callback began (k <= seen): so
// no callback may come before the smallest deadline in armed[floor..seen].

constexpr int kMaxSets = 1 << 16;
std::atomic<uint64_t> gArmed[kMaxSets];
std::atomic<int> gSetStarted{0}, gSetDone{0}, gStressCalls{0};
std::atomic<uint64_t> gStressAt[kMaxCalls];
std::atomic<int> gStressSeen[kMaxCalls], gStressFloor[kMaxCalls];
int gFloorForNext = 0;  // timer thread only

void StressCall() {
    const uint64_t now = MonoNowNs();
    const int seen = gSetStarted.load(), i = gStressCalls.load();
    if (i < kMaxCalls) {
        gStressAt[i].store(now);
        gStressSeen[i].store(seen);
        gStressFloor[i].store(gFloorForNext);
    }
    gFloorForNext = gSetDone.load();
    gStressCalls.store(i + 1);
}

TEST_F(RtTimer, ConcurrentSettersNeverGetEarlyCallbacksNorLoseTheLastWake) {
    gStressCalls.store(0);
    gSetStarted.store(0);
    gSetDone.store(0);
    gFloorForNext = 0;
    auto timer = Start(&StressCall);
    std::mutex setMutex;
    auto set = [&](uint64_t deadline) {
        std::lock_guard<std::mutex> hold(setMutex);
        const int k = gSetStarted.load() + 1;
        if (k >= kMaxSets) return false;
        gArmed[k].store(deadline);
        gSetStarted.store(k);
        timer->SetExpiry(Ct(deadline));
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
    stop.store(true);
    w1.join();
    w2.join();

    // The last wake: a far deadline replaced from another thread by a near
    // one must be served. A callback may still serve a value taken before the
    // far setting; the one for `last` must follow at once.
    set(MonoNowNs() + kFar);
    uint64_t last = 0;
    int lastSeq = 0;
    std::thread([&] {
        last = MonoNowNs() + 2 * kMs;
        set(last);
        lastSeq = gSetDone.load();
    }).join();
    ASSERT_TRUE(WaitUntil(
        [&] {
            const int n = gStressCalls.load();
            return n > 0 && gStressSeen[n - 1].load() >= lastSeq && gStressAt[n - 1].load() >= last;
        },
        1000 * kMs))
        << "the last deadline was lost";
    const int calls = gStressCalls.load();
    timer.reset();

    ASSERT_LE(calls, kMaxCalls);
    EXPECT_LT(gStressAt[calls - 1].load() - last, kLate);
    int early = 0;
    for (int i = 0; i < calls; ++i) {
        const int lo = std::max(gStressFloor[i].load(), 1), hi = gStressSeen[i].load();
        ASSERT_LE(lo, hi) << "callback " << i << " ran with no deadline set for it";
        uint64_t soonest = UINT64_MAX;
        for (int k = lo; k <= hi; ++k) soonest = std::min(soonest, gArmed[k].load());
        if (gStressAt[i].load() < soonest) ++early;
    }
    printf("%d settings, %d callbacks\n", gSetDone.load(), calls);
    EXPECT_EQ(early, 0) << "callbacks served before any deadline they could belong to";
}

}  // namespace
}  // namespace quelta
