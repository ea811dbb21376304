// The event and global-clock waits on the controlled scheduler, each blocking wait on a thread of its own.
#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <thread>
#include <tuple>

#include "SchedulerHarness.h"
#include "TestSupport.h"
#include "engine/LibraryUse.h"
#include "engine/SystemClock.h"
#include "quelta/quelta.h"

using namespace quelta;
using testsupport::MonoNowNs;

namespace {

constexpr uint64_t kMs = 1000000;

template <typename F>
bool Within(uint64_t ms, F done) {  // polls `done` for up to `ms`
    for (const uint64_t end = MonoNowNs() + ms * kMs; !done(); usleep(200)) if (MonoNowNs() > end) return false;
    return true;
}

// A wait on a thread of its own; one given up on is ended as unloading does, else the process fails.
class Waiter {
public:
    template <typename F>
    explicit Waiter(F wait) : thread_([this, wait] { wait(), done_.store(true); }) {}
    ~Waiter() { ReturnsWithin(0); }
    bool ReturnsWithin(uint32_t ms) {
        if (!thread_.joinable()) return true;
        const bool returned = Within(ms, [this] { return done_.load(); });
        if (!returned) {
            gStopping.store(true);
            WakeBlockedWaiters();
            if (!Within(2000, [this] { return done_.load(); })) std::fprintf(stderr, "unstoppable wait\n"), _exit(1);
        }
        thread_.join();
        gStopping.store(false);
        return returned;
    }
    std::atomic<bool> done_{false};
    std::thread thread_;
};

uint64_t GlobalNow() { ClockTime g; return gEngine.load()->ReadGlobal6(g), ToU64(g); }
uint64_t MonotonicNow() { ClockTime m; return gEngine.load()->ReadMonotonic0(m), ToU64(m); }
uint32_t WaitOwn(uint64_t deadline, PalSemaphore* s = nullptr) {  // an event wait on its node's own semaphore
    const ClockTime d = FromU64(deadline);
    return quelta_iTSCEvent_Wait_Callback_C(s, &d, nullptr, nullptr, 0, nullptr);
}

class EventWaits : public ::testing::Test {
protected:
    void SetUp() override {
        h.GiveNodesSemaphores();
        ASSERT_EQ(PalSemaphoreCreate(&semaphore), 0);
        gConvertStandInEnabled.store(true);  // the wall clock, converted for real: a waiter's own wake is on time
        h.Pass();  // the first pass notes the generation
    }
    void TearDown() override { gGeneration.store(0), PalSemaphoreDestroy(semaphore), ResetSystemClockHooks(); }
    testsupport::SchedulerHarness h;
    PalSemaphore* semaphore = nullptr;
};

std::atomic<uint32_t> gRestoredGeneration{0};
void RestoreGeneration(void*) { gGeneration.store(gRestoredGeneration.load()); }

// Never early unless the result says why: a new generation ends a queued global wait with an abort flag
// (flag 1); without a flag, or changed back before the waiter looks (by the pass's callback), it lasts.
TEST_F(EventWaits, ANewGenerationEndsOnlyAnAbortableGlobalWait) {
    const struct { bool flag, changedBack; uint64_t ahead; } rows[] = {
        {true, false, 5000 * kMs}, {false, false, 150 * kMs}, {true, true, 150 * kMs}};
    for (const auto& row : rows) {
        SCOPED_TRACE(testing::Message() << row.flag << row.changedBack);
        const uint32_t generation = gGeneration.load(), aborted = row.flag && !row.changedBack;
        const uint64_t before = GlobalNow();
        const ClockTime target = FromU64(before + row.ahead);
        uint32_t abortFlag = 77;
        ClockTime after{1, 2};
        Waiter waiter([&] {
            quelta_iTSC_WaitUntilGlobalClocks64_C(&target, row.flag ? &abortFlag : nullptr, &after, generation);
        });
        ASSERT_TRUE(Within(1000, [] { return gWaitList.load() != nullptr; })) << "the wait was not queued";
        if (row.changedBack) {
            gRestoredGeneration.store(generation);
            quelta_iTSC_SetCallback(&RestoreGeneration, nullptr);
            const ClockTime now = FromU64(h.Now());
            ASSERT_EQ(quelta_iTSC_SetCallbackTime(&now, 0), 1u);
        }
        gGeneration.store(generation + 1);
        h.SetNow(h.Now() + 1000), h.Pass();
        quelta_iTSC_SetCallback(nullptr, nullptr);
        ASSERT_TRUE(waiter.ReturnsWithin(2000)) << "the wait did not end";
        EXPECT_EQ(abortFlag, row.flag ? aborted : 77u);
        EXPECT_GE(ToU64(after), before);
        EXPECT_EQ(ToU64(after) < ToU64(target), bool(aborted)) << "early, or late when aborted";
        EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
    }
}

// A monotonic waiter holds its node unqueued, waking by itself: a stray post on it does not end it early.
TEST_F(EventWaits, AStrayPostDoesNotEndAMonotonicWaitEarly) {
    const uint64_t deadline = MonotonicNow() + 100 * kMs;
    uint32_t r = 99;
    Waiter waiter([&] { r = WaitOwn(deadline); });
    WaitNode* held = nullptr;
    ASSERT_TRUE(Within(1000, [&] {
        for (WaitNode& n : h.pool) held = n.state.load() == uint32_t(NodeState::kHeld) ? &n : held;
        return held != nullptr;
    }));
    PalSemaphorePost(held->ownSemaphore.load());
    ASSERT_TRUE(waiter.ReturnsWithin(2000));
    EXPECT_EQ(r, 0u);
    EXPECT_GE(MonoNowNs(), deadline) << "ended early";
}

// Before the event system starts: abort flag 0xFFFFFFFF and no time written, or 3; none blocks.
TEST_F(EventWaits, BeforeTheEventSystemStartsWaitsAreRefused) {
    gEventSystemReady.store(0);
    const ClockTime target = FromU64(GlobalNow() + 1000 * kMs);
    uint32_t abortFlag = 5;
    ClockTime after{1, 2};
    const uint64_t t0 = MonoNowNs();
    quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, gGeneration.load());
    EXPECT_EQ(std::tuple(abortFlag, after.low, after.high), std::tuple(0xFFFFFFFFu, 1u, 2u));
    EXPECT_EQ(quelta_iTSCEvent_Wait_C(semaphore, 1000), 3u);
    EXPECT_EQ(WaitOwn(ToU64(target), semaphore), 3u);
    EXPECT_LT(MonoNowNs() - t0, 100 * kMs);
    gEventSystemReady.store(1);
}

// High word 0xFFFFFFFF is before every time: at once. Centuries ahead (0xFFFFFFFE) and NeverTime
// keep it waiting (until the stop ends it: 3, the node kept, as the pool goes with the library).
TEST_F(EventWaits, DeadlinesAtTheEdgesOfTheOrderBoundABlockingWait) {
    for (uint64_t at : {0xFFFFFFFF00000005ull, 0xFFFFFFFE00000005ull, 0xFFFFFFFEFFFFFFFFull}) {
        SCOPED_TRACE(at);
        const bool past = (at >> 32) == 0xFFFFFFFFu;
        uint32_t r = 99;
        Waiter waiter([&] { r = WaitOwn(at); });
        EXPECT_EQ(waiter.ReturnsWithin(past ? 1000 : 100), past);
        EXPECT_EQ(r, past ? 0u : 3u);
        if (past) EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
    }
}

// Over up to twenty tries `wait` never takes under `ms`, and some try under `ms + 1` (an extra
// millisecond shows in every try, noise not).
template <typename F>
void ExpectMilliseconds(uint32_t ms, F wait) {
    SCOPED_TRACE(testing::Message() << ms << " ms");
    uint64_t least = ~uint64_t(0);
    for (int i = 0; i < 20 && least >= (ms + 1) * kMs; ++i) {
        uint64_t elapsed = 0;
        Waiter timed([&] {
            sched_param p{1};
            pthread_setschedparam(pthread_self(), SCHED_FIFO, &p);  // where allowed: fewer late wakes
            const uint64_t t0 = MonoNowNs();
            wait();
            elapsed = MonoNowNs() - t0;
        });
        ASSERT_TRUE(timed.ReturnsWithin(2000)) << "the wait does not end";
        EXPECT_GE(elapsed, ms * kMs) << "early";
        least = std::min(least, elapsed);
    }
    EXPECT_LT(least, (ms + 1) * kMs) << "a whole millisecond late in every try";
}

timespec gWallClock{1700000000, 250000000};  // a fixed global clock: the remaining time is exact
int FixedWallClock(clockid_t id, timespec* ts) { return id == CLOCK_REALTIME ? (*ts = gWallClock, 0) : clock_gettime(id, ts); }

// Without the tick service a global wait sleeps the remainder rounded to whole ms, plus one.
TEST_F(EventWaits, WithoutTickServiceGlobalWaitsSleepTheRoundedRemainderPlusAMillisecond) {
    gEngine.load()->serviceMode.store(1), gSystemClock.getTime = &FixedWallClock;
    const uint64_t now = GlobalNow();
    for (auto [ahead, ms] : {std::pair{int64_t(2300000), 3u}, {int64_t(2600000), 4u}, {-int64_t(1000 * kMs), 0u}}) {
        const ClockTime target = FromU64(now + static_cast<uint64_t>(ahead));
        ExpectMilliseconds(ms, [&] {
            uint32_t abortFlag = 7;
            ClockTime after{1, 2};
            quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, gGeneration.load());
            EXPECT_EQ(abortFlag, 0u);
            EXPECT_EQ(ToU64(after), now);
        });
    }
}

// Without it an event wait's timeout is cut to whole ms, plus one; 0xFFFFFFFF waits for a post;
// waits on the list are refused (3) and take no node.
TEST_F(EventWaits, WithoutTickServiceEventWaitsWaitWholeMillisecondsPlusOne) {
    gEngine.load()->serviceMode.store(1);
    for (auto [timeout, ms] : {std::pair{999u, 1u}, {1000u, 2u}, {0u, 1u}}) {
        ExpectMilliseconds(ms, [&, timeout = timeout] { EXPECT_EQ(quelta_iTSCEvent_Wait_C(semaphore, timeout), 1u); });
    }
    std::atomic<uint32_t> r{99};
    Waiter forever([&] { r.store(quelta_iTSCEvent_Wait_C(semaphore, 0xFFFFFFFFu)); });
    EXPECT_FALSE(Within(30, [&] { return r.load() != 99u; })) << "no timeout, yet it ended";
    PalSemaphorePost(semaphore);
    EXPECT_TRUE(forever.ReturnsWithin(1000));
    EXPECT_EQ(r.load(), 0u);
    EXPECT_EQ(WaitOwn(MonotonicNow() + 20 * kMs), 3u);
    EXPECT_EQ(WaitOwn(MonotonicNow() + 20 * kMs, semaphore), 3u);
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

}  // namespace
