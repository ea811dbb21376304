// Global-clock nodes in the wait list: their place follows the global clock,
// a deadline from before the monotonic clock's zero is simply past, and
// neither an insert nor a tick pass converts times node by node (that work
// would sit under the lock the timer thread needs).
#include <gtest/gtest.h>

#include <time.h>

#include <atomic>
#include <vector>

#include "SchedulerHarness.h"
#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/SystemClock.h"
#include "engine/TickService.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

using namespace quelta;
using testsupport::SchedulerHarness;

namespace {

constexpr uint64_t kMs = 1000000;
constexpr uint64_t kSecond = 1000 * kMs;

std::atomic<int> gClockReads{0};
int CountingGetTime(clockid_t id, timespec* ts) {
    gClockReads.fetch_add(1);
    return clock_gettime(id, ts);
}

class SchedulerGlobalNodes : public ::testing::Test {
protected:
    void TearDown() override {
        ResetSystemClockHooks();
        gConvertStandInEnabled.store(false);
    }
    uint32_t QueueGlobal(uint64_t deadline) {
        WaitNode* node = h.Take();
        EXPECT_NE(node, nullptr);
        node->isGlobal.store(1);
        node->autoRelease.store(1);
        const ClockTime d = FromU64(deadline);
        return InsertWaitNode(node, &d, nullptr, nullptr);
    }
    // A node queued at `deadline` and released when it fires: global-clock or
    // monotonic, its holder waking by itself at `selfWake` (0: it needs the
    // timer thread).
    WaitNode* QueueAt(uint64_t deadline, bool global, uint64_t selfWake = 0) {
        WaitNode* node = h.Take();
        node->isGlobal.store(global ? 1 : 0);
        node->autoRelease.store(1);
        node->selfWakeAt.store(selfWake);
        const ClockTime d = FromU64(deadline);
        EXPECT_EQ(InsertWaitNode(node, &d, nullptr, nullptr), 0u);
        return node;
    }
    uint32_t Queued() {
        uint32_t n = 0;
        for (WaitNode* w = gWaitList.load(); w != nullptr; w = w->next.load()) ++n;
        return n;
    }
    SchedulerHarness h;
};

// A pass at rest makes no conversion; a global-clock node queued just as it
// began (here: while it reads the clock) is still placed by the pass's own
// conversion, so a due one fires in that pass.
TEST_F(SchedulerGlobalNodes, ANodeQueuedAsAPassAtRestBeginsIsConverted) {
    gEngine.load()->SetEpochOffset(100);
    static decltype(this) self;
    static WaitNode* arrived;
    self = this;
    arrived = nullptr;
    gTickNowOverride = [] {
        if (arrived == nullptr) arrived = self->QueueAt(self->h.Now() + 100 * kSecond - kMs, true);
        return self->h.Now();
    };
    h.Pass();
    ASSERT_NE(arrived, nullptr);
    EXPECT_EQ(arrived->fireCount.load(), 1u);
}

// The harness's global clock is its monotonic clock plus the epoch offset.
// With an offset of 100 s, a global deadline of 50 s lies 50 s before the
// monotonic zero, and one whose high word is 0xFFFFFFFF before the global
// zero itself: both are due at the first pass, like any past deadline, and
// neither is taken for a time far in the future.
TEST_F(SchedulerGlobalNodes, ADeadlineBeforeTheMonotonicZeroIsPast) {
    gEngine.load()->SetEpochOffset(100);
    ASSERT_EQ(QueueGlobal(50 * kSecond), 0u);
    ASSERT_EQ(QueueGlobal(0xFFFFFFFF00000005ull), 0u);
    ASSERT_EQ(QueueGlobal(200 * kSecond), 0u);  // 100 s monotonic: later
    EXPECT_EQ(h.timer->LastArmed(), 0u) << "a past deadline arms the timer at once";
    h.Pass();
    EXPECT_EQ(Queued(), 1u) << "a past deadline was not fired";
    EXPECT_EQ(gNextDeadline.Load(), h.Now() + kMs) << "the later node is folded, the tick comes first";
}

// With the global clock 100 s behind the monotonic one, a global deadline
// less than 100 s below NeverTime lies beyond the top of the range on the
// monotonic clock: it reads as the latest time there, not as one whose high
// word is 0xFFFFFFFF (which would be before every time, so at once).
TEST_F(SchedulerGlobalNodes, ADeadlineBeyondTheMonotonicRangeIsTheLatest) {
    gEngine.load()->SetEpochOffset(-100);
    ASSERT_EQ(QueueGlobal(kNeverTime64 - 100 * kSecond + 6), 0u);
    EXPECT_EQ(h.timer->armed.size(), 0u) << "a deadline centuries ahead was armed";
    h.Pass();
    EXPECT_EQ(Queued(), 1u) << "a deadline at the top of the range was fired";
}

// 127 global-clock nodes are queued with the kernel's conversion replaced by
// the user-space one, which reads the clocks. One more insert, and one pass,
// must not read them once per queued node.
TEST_F(SchedulerGlobalNodes, InsertAndPassDoNotConvertNodeByNode) {
    gConvertStandInEnabled.store(true);
    iKPusTimingEngine* engine = gEngine.load();
    const uint64_t base = ToU64(engine->MonotonicToGlobal(FromU64(h.Now()))) + 30 * kSecond;
    for (uint32_t i = 0; i < kWaitNodeCount - 1; ++i) {
        ASSERT_EQ(QueueGlobal(base + (i + 1) * kMs), 0u);
    }
    ASSERT_EQ(Queued(), kWaitNodeCount - 1);
    gSystemClock.getTime = &CountingGetTime;

    gClockReads.store(0);
    ASSERT_EQ(QueueGlobal(base + kSecond), 0u);  // walks past every node
    const int insertReads = gClockReads.load();
    gClockReads.store(0);
    h.Pass();
    const int passReads = gClockReads.load();
    printf("clock reads: %d for the insert, %d for the pass, %u nodes queued\n", insertReads,
           passReads, kWaitNodeCount);
    // One measured offset costs a reading and at most three brackets of
    // three readings (more when a bracket is wide, as under instrumentation);
    // node by node it was hundreds.
    EXPECT_LE(insertReads, 16) << "an insert converts every node it passes";
    EXPECT_LE(passReads, 40) << "a pass converts node by node";

    // The new node went behind all the others, by its global deadline.
    ASSERT_EQ(Queued(), kWaitNodeCount) << "nodes 30 s ahead were fired";
    WaitNode* last = gWaitList.load();
    while (last->next.load() != nullptr) last = last->next.load();
    EXPECT_EQ(last->deadline.load(), base + kSecond);
}

// A global-clock wait whose waiter blocks until the deadline's monotonic
// equivalent wakes by itself: the timer thread is not armed for it (it would
// only compete with the waiter for a CPU), and a pass that finds it due after
// that wake does not post it. A step of the wall clock that brings the
// deadline well before the waiter's wake is the timer thread's business
// again: the next pass fires it and posts its semaphore.
TEST_F(SchedulerGlobalNodes, AWaiterThatWakesByItselfCostsTheTimerThreadNothing) {
    ASSERT_EQ(PalInitialize(), 1u);
    PalSemaphore* semaphore = nullptr;
    ASSERT_EQ(PalSemaphoreCreate(&semaphore), 0);
    const uint64_t tick = gNextDeadline.Load();
    auto queue = [&](uint64_t deadline) {
        WaitNode* node = h.Take();
        node->isGlobal.store(1);
        node->autoRelease.store(0);
        node->semaphore.store(semaphore);
        node->selfWakeAt.store(deadline);  // the harness's global clock is its monotonic clock
        const ClockTime d = FromU64(deadline);
        EXPECT_EQ(InsertWaitNode(node, &d, nullptr, nullptr), 0u);
        return node;
    };
    WaitNode* node = queue(h.Now() + 400 * 1000);
    EXPECT_EQ(h.timer->LastArmed(), kNeverTime64) << "armed for a waiter that wakes by itself";
    h.SetNow(h.Now() + 100 * 1000);
    h.Pass();
    EXPECT_EQ(h.timer->LastArmed(), tick) << "a pass armed for it rather than for the tick";

    h.SetNow(h.Now() + 400 * 1000);  // its wake has come
    h.Pass();
    EXPECT_NE(node->fireCount.load(), 0u);
    EXPECT_EQ(PalSemaphoreWait(semaphore, 0), 1u) << "posted a waiter that was waking anyway";
    ReleaseWaitNode(node);

    // The wall clock steps 1 s forward: the deadline is now 0.6 s past.
    node = queue(h.Now() + 400 * 1000);
    gEngine.load()->SetEpochOffset(1);
    h.SetNow(h.Now() + 1000);
    h.Pass();
    EXPECT_NE(node->fireCount.load(), 0u) << "a stepped deadline waited for the waiter's own wake";
    EXPECT_EQ(PalSemaphoreWait(semaphore, 0), 0u) << "the waiter was not woken";
    ReleaseWaitNode(node);
    PalSemaphoreDestroy(semaphore);
}

// A node that needs the timer is armed for even when it is not the head: a
// head whose waiter wakes by itself leaves the timer unarmed, so a callback
// queued behind it would otherwise wait for the next tick.
TEST_F(SchedulerGlobalNodes, ANodeBehindASelfWakingHeadIsArmedFor) {
    WaitNode* head = QueueAt(h.Now() + 400 * 1000, true, h.Now() + 400 * 1000);
    ASSERT_EQ(h.timer->LastArmed(), kNeverTime64);
    const uint64_t behindAt = h.Now() + 600 * 1000;
    QueueAt(behindAt, false);
    ASSERT_EQ(gWaitList.load(), head);
    EXPECT_EQ(h.timer->LastArmed(), behindAt) << "the callback behind the head waits for the next tick";
}

// A step of the wall clock moves every global deadline at once, so the list's
// order, made before the step, no longer holds: a pass fires every node that
// is due wherever it stands, and never arms the timer for a time already past
// (which would make the timer thread spin until the stale head came due).
TEST_F(SchedulerGlobalNodes, AfterAWallClockStepEveryDueNodeFiresWhereverItStands) {
    // Placed while the wall clock read 1 s ahead (global = monotonic + 1 s),
    // then stepped back to the monotonic clock: a global head now 1 s later
    // than the monotonic node behind it.
    gEngine.load()->SetEpochOffset(1);
    WaitNode* global = QueueAt(h.Now() + kSecond + 400 * 1000, true, h.Now() + 400 * 1000);
    WaitNode* monotonic = QueueAt(h.Now() + 600 * 1000, false);
    ASSERT_EQ(gWaitList.load(), global);
    gEngine.load()->SetEpochOffset(0);
    h.SetNow(h.Now() + 700 * 1000);
    h.Pass();
    EXPECT_NE(monotonic->fireCount.load(), 0u) << "a due node behind a stepped head did not fire";
    EXPECT_EQ(global->fireCount.load(), 0u) << "fired 1 s early";
    EXPECT_FALSE(Earlier(h.timer->LastArmed(), h.Now())) << "armed for a time already past";
    gEngine.load()->SetEpochOffset(1);
    h.SetNow(h.Now() + 1000);
    h.Pass();
    EXPECT_NE(global->fireCount.load(), 0u);
    gEngine.load()->SetEpochOffset(0);

    // Stepped back, at a tick's pass (which makes the next deadline anew):
    // the timer is armed for the earliest node that needs it, not for the
    // first in the list's stale order.
    h.SetNow(gNextTick.Load());
    h.Pass();
    const uint64_t tickAt = gNextTick.Load();
    WaitNode* staleHead = QueueAt(tickAt + 400 * 1000, true);
    const uint64_t earliestAt = tickAt + 500 * 1000;
    WaitNode* earliest = QueueAt(earliestAt, false);
    ASSERT_EQ(gWaitList.load(), staleHead);
    gEngine.load()->SetEpochOffset(-1);
    h.SetNow(tickAt);
    h.Pass();
    EXPECT_EQ(h.timer->LastArmed(), earliestAt) << "armed for the stale head, or the tick, not the earliest node";
    gEngine.load()->SetEpochOffset(0);
    h.SetNow(earliestAt);
    h.Pass();
    EXPECT_NE(staleHead->fireCount.load(), 0u);
    EXPECT_NE(earliest->fireCount.load(), 0u);

    // Stepped forward: a global node behind a monotonic one is due first.
    WaitNode* first = QueueAt(h.Now() + 2 * kSecond, false);
    WaitNode* stepped = QueueAt(h.Now() + 3 * kSecond, true);
    ASSERT_EQ(gWaitList.load(), first);
    gEngine.load()->SetEpochOffset(2);  // its deadline is now 1 s ahead
    h.SetNow(h.Now() + 1500 * kMs);
    h.Pass();
    EXPECT_NE(stepped->fireCount.load(), 0u) << "a stepped global node waited for the node before it";
    EXPECT_EQ(first->fireCount.load(), 0u);
    gEngine.load()->SetEpochOffset(0);
}

}  // namespace
