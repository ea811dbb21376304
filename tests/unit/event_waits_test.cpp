// The event and global-clock waits on the controlled scheduler: what ends a
// queued global-clock wait early (a new generation of the global clock) and
// what the abort flag then says, which deadlines bound a blocking wait, and
// the waits without the tick service, whose sleeps are whole milliseconds.
// Blocking waits run on threads of their own; one that does not return is
// ended the way unloading ends it.
#include <gtest/gtest.h>

#include <pthread.h>
#include <sched.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <thread>

#include "SchedulerHarness.h"
#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/LibraryUse.h"
#include "engine/SchedulerState.h"
#include "engine/SystemClock.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

using namespace quelta;
using testsupport::MonoNowNs;
using testsupport::SchedulerHarness;

namespace {

constexpr uint64_t kMs = 1000000;

// Polls `done` for up to `ms`.
template <typename F>
bool Within(uint32_t ms, F done) {
    for (const uint64_t end = MonoNowNs() + ms * kMs; !done(); usleep(200)) {
        if (MonoNowNs() > end) return false;
    }
    return true;
}

// A wait running on a thread of its own.
class Waiter {
public:
    template <typename F>
    explicit Waiter(F wait) : thread_([this, wait] {
        wait();
        done_.store(true);
    }) {}
    ~Waiter() { ReturnsWithin(0); }
    // True when the wait returns within `ms`. A wait still blocked then is
    // ended as unloading ends it (the stop's flag and a wake of every blocked
    // waiter); one that even that cannot end would hang the suite, so the
    // test process then ends at once, failed.
    bool ReturnsWithin(uint32_t ms) {
        if (!thread_.joinable()) return true;
        const bool returned = Within(ms, [this] { return done_.load(); });
        if (!returned) {
            gStopping.store(true);
            WakeBlockedWaiters();
            if (!Within(2000, [this] { return done_.load(); })) {
                std::fprintf(stderr, "a wait that the stop cannot end: giving up\n");
                std::fflush(nullptr);
                _exit(1);
            }
        }
        thread_.join();
        gStopping.store(false);
        return returned;
    }

private:
    std::atomic<bool> done_{false};
    std::thread thread_;
};

ClockTime GlobalNow() {
    ClockTime g;
    gEngine.load()->ReadGlobal6(g);
    return g;
}

class EventWaits : public ::testing::Test {
protected:
    void SetUp() override {
        h.GiveNodesSemaphores();
        ASSERT_EQ(PalSemaphoreCreate(&semaphore), 0);
        // The global clock is the machine's wall clock, converted for real,
        // so that a global waiter's own timed wake comes at its deadline.
        gConvertStandInEnabled.store(true);
        h.Pass();  // the routine's first pass notes the generation
    }
    void TearDown() override {
        gGeneration.store(0);
        PalSemaphoreDestroy(semaphore);
        ResetSystemClockHooks();
    }
    uint32_t FreeNodes() {
        uint32_t n = 0;
        EXPECT_TRUE(AuditWaitNodes(&n, nullptr, nullptr));
        return n;
    }
    SchedulerHarness h;
    PalSemaphore* semaphore = nullptr;
};

// A queued global-clock wait with an abort flag ends when a tick pass sees a
// new generation: abort flag 1, the time after written, its node back in the
// pool. (The target's low word is 0: only both words 0 mean "no wait".)
TEST_F(EventWaits, ANewGenerationEndsAnAbortableGlobalWait) {
    const uint32_t generation = gGeneration.load();
    const ClockTime before = GlobalNow();
    const ClockTime target{0, before.high + 2};  // 4.3 to 8.6 s ahead
    uint32_t abortFlag = 77;
    ClockTime after{1, 2};
    Waiter waiter([&] { quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, generation); });
    ASSERT_TRUE(Within(1000, [] { return gWaitList.load() != nullptr; })) << "the wait was not queued";
    gGeneration.store(generation + 1);
    h.SetNow(h.Now() + 1000);
    h.Pass();
    ASSERT_TRUE(waiter.ReturnsWithin(1000)) << "a new generation did not end the wait";
    EXPECT_EQ(abortFlag, 1u);
    EXPECT_GE(ToU64(after), ToU64(before));
    EXPECT_LT(ToU64(after), ToU64(target));
    EXPECT_EQ(FreeNodes(), kWaitNodeCount);
}

// Without an abort flag the caller could not be told, so a new generation
// does not end the wait: it lasts until its target.
TEST_F(EventWaits, AGlobalWaitWithoutAbortFlagOutlastsANewGeneration) {
    const uint32_t generation = gGeneration.load();
    const ClockTime target = FromU64(ToU64(GlobalNow()) + 150 * kMs);
    ClockTime after{1, 2};
    Waiter waiter([&] { quelta_iTSC_WaitUntilGlobalClocks64_C(&target, nullptr, &after, generation); });
    ASSERT_TRUE(Within(1000, [] { return gWaitList.load() != nullptr; })) << "the wait was not queued";
    gGeneration.store(generation + 1);
    h.SetNow(h.Now() + 1000);
    h.Pass();
    ASSERT_TRUE(waiter.ReturnsWithin(2000));
    EXPECT_GE(ToU64(after), ToU64(target)) << "ended early";
    EXPECT_EQ(FreeNodes(), kWaitNodeCount);
}

// A wait is never early unless its result says why. The generation changes
// and changes back before the waiter looks (the callback restores it in the
// pass that fires the node, before the node's post): the wait goes on to its
// target, abort flag 0.
std::atomic<uint32_t> gRestoredGeneration{0};
void RestoreGeneration(void*) { gGeneration.store(gRestoredGeneration.load()); }

TEST_F(EventWaits, AGenerationChangedBackDoesNotEndTheWait) {
    const uint32_t generation = gGeneration.load();
    const ClockTime target = FromU64(ToU64(GlobalNow()) + 150 * kMs);
    uint32_t abortFlag = 77;
    ClockTime after{1, 2};
    Waiter waiter([&] { quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, generation); });
    ASSERT_TRUE(Within(1000, [] { return gWaitList.load() != nullptr; })) << "the wait was not queued";
    gRestoredGeneration.store(generation);
    quelta_iTSC_SetCallback(&RestoreGeneration, nullptr);
    const ClockTime now = FromU64(h.Now());
    ASSERT_EQ(quelta_iTSC_SetCallbackTime(&now, 0), 1u);
    gGeneration.store(generation + 1);
    h.Pass();
    quelta_iTSC_SetCallback(nullptr, nullptr);
    EXPECT_EQ(gGeneration.load(), generation);
    ASSERT_TRUE(waiter.ReturnsWithin(2000));
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_GE(ToU64(after), ToU64(target)) << "ended early";
}

// A waiter on the monotonic clock holds its node without queueing it and
// wakes by itself at the deadline; a post on the node's own semaphore that
// does not come from the deadline (a stray one) does not end it early.
TEST_F(EventWaits, AStrayPostDoesNotEndAMonotonicWaitEarly) {
    ClockTime now;
    gEngine.load()->ReadMonotonic0(now);
    const ClockTime deadline = FromU64(ToU64(now) + 100 * kMs);
    uint32_t r = 99;
    Waiter waiter([&] { r = quelta_iTSCEvent_Wait_Callback_C(nullptr, &deadline, nullptr, nullptr, 0, nullptr); });
    WaitNode* held = nullptr;
    ASSERT_TRUE(Within(1000, [&] {
        for (WaitNode& n : h.pool) {
            if (n.state.load() == static_cast<uint32_t>(NodeState::kHeld)) held = &n;
        }
        return held != nullptr;
    }));
    PalSemaphorePost(held->ownSemaphore.load());
    ASSERT_TRUE(waiter.ReturnsWithin(2000));
    EXPECT_EQ(r, 0u);
    EXPECT_GE(MonoNowNs(), ToU64(deadline)) << "ended early";
}

// With the tick service in use but the event system not started, the global
// wait says so with an abort flag of 0xFFFFFFFF and writes no time; the event
// waits refuse with 3.
TEST_F(EventWaits, BeforeTheEventSystemStartsWaitsAreRefused) {
    gEventSystemReady.store(0);
    const ClockTime target = FromU64(ToU64(GlobalNow()) + 1000 * kMs);
    uint32_t abortFlag = 5;
    ClockTime after{1, 2};
    const uint64_t t0 = MonoNowNs();
    quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, gGeneration.load());
    EXPECT_EQ(abortFlag, 0xFFFFFFFFu);
    EXPECT_EQ(ToU64(after), ToU64(ClockTime{1, 2}));
    EXPECT_EQ(quelta_iTSCEvent_Wait_C(semaphore, 1000), 3u);
    EXPECT_EQ(quelta_iTSCEvent_Wait_Callback_C(semaphore, &target, nullptr, nullptr, 0, nullptr), 3u);
    EXPECT_LT(MonoNowNs() - t0, 100 * kMs);
    gEventSystemReady.store(1);
}

// A blocking wait bounds its semaphore wait by its deadline: one whose high
// word is 0xFFFFFFFF comes before every time and has passed (it returns at
// once); one centuries ahead, with high word 0xFFFFFFFE, and NeverTime keep
// it waiting (here until the stop ends it: 3).
TEST_F(EventWaits, DeadlinesAtTheEdgesOfTheOrderBoundABlockingWait) {
    uint32_t r = 99;
    const ClockTime past{5, 0xFFFFFFFFu};
    Waiter passed([&] { r = quelta_iTSCEvent_Wait_Callback_C(nullptr, &past, nullptr, nullptr, 0, nullptr); });
    EXPECT_TRUE(passed.ReturnsWithin(1000)) << "a deadline before 0 in the library's order kept it waiting";
    EXPECT_EQ(r, 0u);
    EXPECT_EQ(FreeNodes(), kWaitNodeCount);
    for (const ClockTime far : {ClockTime{5, 0xFFFFFFFEu}, ClockTime{0xFFFFFFFFu, 0xFFFFFFFEu}}) {
        SCOPED_TRACE(far.high);
        r = 99;
        Waiter waiting([&] { r = quelta_iTSCEvent_Wait_Callback_C(nullptr, &far, nullptr, nullptr, 0, nullptr); });
        EXPECT_FALSE(waiting.ReturnsWithin(100)) << "a deadline centuries ahead has passed";
        EXPECT_EQ(r, 3u);  // the stop keeps the node: the pool goes with the library
    }
}

// --- without the tick service ------------------------------------------------

// How long `wait` takes, as the least of up to twenty tries: each try must
// last at least `atLeastMs` (never early); some try must come in below
// `atLeastMs + 1` (a sleep a whole millisecond longer shows in every try,
// noise does not). The waiting thread runs at real-time priority where that
// is allowed, so that a busy machine delays its wake-ups little.
template <typename F>
void ExpectMilliseconds(uint32_t atLeastMs, F wait) {
    SCOPED_TRACE(testing::Message() << atLeastMs << " ms");
    uint64_t least = ~uint64_t(0);
    for (int i = 0; i < 20 && least >= (atLeastMs + 1) * kMs; ++i) {
        uint64_t elapsed = 0;
        Waiter timed([&] {
            sched_param p{};
            p.sched_priority = 1;
            pthread_setschedparam(pthread_self(), SCHED_FIFO, &p);  // refused without the right: fine
            const uint64_t t0 = MonoNowNs();
            wait();
            elapsed = MonoNowNs() - t0;
        });
        ASSERT_TRUE(timed.ReturnsWithin(2000)) << "the wait does not end";
        EXPECT_GE(elapsed, atLeastMs * kMs) << "early";
        least = std::min(least, elapsed);
    }
    EXPECT_LT(least, (atLeastMs + 1) * kMs) << "a whole millisecond late in every try";
}

// The global clock reads a fixed time on the fake kernel clock, so that the
// remaining time is exact; the sleeps are real.
timespec gWallClock{};
int FixedWallClock(clockid_t id, timespec* ts) {
    if (id != CLOCK_REALTIME) return clock_gettime(id, ts);
    *ts = gWallClock;
    return 0;
}

class WithoutTickService : public EventWaits {
protected:
    void SetUp() override {
        EventWaits::SetUp();
        gEngine.load()->serviceMode.store(1);
    }
};

// The remaining time rounded to the nearest millisecond, plus one: 2.3 ms
// sleeps 3 ms, 2.6 ms sleeps 4 ms, a target passed does not sleep. The abort
// flag stays 0 and the time after is the global clock's.
TEST_F(WithoutTickService, GlobalWaitsSleepTheRoundedRemainderPlusAMillisecond) {
    gWallClock = timespec{1700000000, 250000000};
    gSystemClock.getTime = &FixedWallClock;
    const uint64_t now = ToU64(GlobalNow());
    for (auto [ahead, sleepMs] : {std::pair{int64_t(2300000), 3u}, {int64_t(2600000), 4u}, {-int64_t(1000 * kMs), 0u}}) {
        const ClockTime target = FromU64(now + static_cast<uint64_t>(ahead));
        ExpectMilliseconds(sleepMs, [&] {
            uint32_t abortFlag = 7;
            ClockTime after{1, 2};
            quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, gGeneration.load());
            EXPECT_EQ(abortFlag, 0u);
            EXPECT_EQ(ToU64(after), now);
        });
    }
}

// The timeout cut down to whole milliseconds, plus one: 999 us waits 1 ms,
// 1000 us 2 ms, 0 still 1 ms; 0xFFFFFFFF waits for a post. Queued waits
// are refused (3) and take no node.
TEST_F(WithoutTickService, EventWaitsWaitWholeMillisecondsPlusOne) {
    for (auto [timeout, ms] : {std::pair{999u, 1u}, {1000u, 2u}, {0u, 1u}}) {
        SCOPED_TRACE(timeout);
        ExpectMilliseconds(ms, [&, timeout = timeout] { EXPECT_EQ(quelta_iTSCEvent_Wait_C(semaphore, timeout), 1u); });
    }
    std::atomic<uint32_t> r{99};
    Waiter forever([&] { r.store(quelta_iTSCEvent_Wait_C(semaphore, 0xFFFFFFFFu)); });
    EXPECT_FALSE(Within(30, [&] { return r.load() != 99u; })) << "no timeout, yet it ended";
    PalSemaphorePost(semaphore);
    EXPECT_TRUE(forever.ReturnsWithin(1000));
    EXPECT_EQ(r.load(), 0u);

    ClockTime now;
    gEngine.load()->ReadMonotonic0(now);
    const ClockTime soon = FromU64(ToU64(now) + 20 * kMs);
    EXPECT_EQ(quelta_iTSCEvent_Wait_Callback_C(nullptr, &soon, nullptr, nullptr, 0, nullptr), 3u);
    EXPECT_EQ(quelta_iTSCEvent_Wait_Callback_C(semaphore, &soon, nullptr, nullptr, 0, nullptr), 3u);
    EXPECT_EQ(FreeNodes(), kWaitNodeCount);
}

}  // namespace
