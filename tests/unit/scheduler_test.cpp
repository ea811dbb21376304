// The tick scheduler driven deterministically: passes at chosen times, a fake timer, recording callbacks.
#include <gtest/gtest.h>
#include <time.h>

#include <atomic>
#include <tuple>
#include <vector>

#include "SchedulerHarness.h"
#include "engine/SystemClock.h"
#include "quelta/quelta.h"

using namespace quelta;

namespace {

constexpr uint64_t kMs = 1000000, kSecond = 1000 * kMs;
using Nodes = std::vector<WaitNode*>;
using Tags = std::vector<int>;
uint32_t State(const WaitNode* n) { return n->state.load(); }
uint32_t Fired(const WaitNode* n) { return n->fireCount.load(); }
constexpr uint32_t kFree = uint32_t(NodeState::kFree), kHeld = uint32_t(NodeState::kHeld), kDone = uint32_t(NodeState::kFired);

std::vector<uint64_t> gTicks;
void RecordTick(uint64_t serial) { gTicks.push_back(serial); }
struct Call { void* arg; uint64_t seen; };  // seen: the ClockTime behind arg
std::vector<Call> gCalls;
void RecordCallback(void* arg) { gCalls.push_back({arg, ToU64(*static_cast<ClockTime*>(arg))}); }
Tags gFired;
uint32_t gRelease = 0;  // what the wait callback asks for
uint32_t RecordFire(void* arg) { return gFired.push_back(int(reinterpret_cast<intptr_t>(arg))), gRelease; }
std::atomic<int> gClockReads{0};
int CountingGetTime(clockid_t id, timespec* ts) { return gClockReads.fetch_add(1), clock_gettime(id, ts); }

class Scheduler : public ::testing::Test {
protected:
    void SetUp() override { gTicks.clear(), gCalls.clear(), gFired.clear(), gRelease = 0; }
    void TearDown() override { ResetSystemClockHooks(); }
    // Queues `n` at `deadline`; `tag` is what RecordFire records when it fires.
    uint32_t Queue(WaitNode* n, uint64_t deadline, int tag = 0, QueltaWaitCallbackFn cb = RecordFire) {
        const ClockTime d = FromU64(deadline);
        return InsertWaitNode(n, &d, cb, reinterpret_cast<void*>(intptr_t(tag)));
    }
    // Released as it fires; its waiter wakes by itself at `selfWake` (0: never).
    WaitNode* QueueAt(uint64_t deadline, bool global, uint64_t selfWake = 0) {
        WaitNode* n = h.Take(global, 1, 0, selfWake);
        EXPECT_EQ(Queue(n, deadline, 0, nullptr), 0u);
        return n;
    }
    void PassAt(uint64_t t) { h.SetNow(t), h.Pass(); }
    void Tick() { PassAt(gNextTick.Load()); }
    void MoveTo(uint64_t now) { h.SetNow(now), gNextTick.Store(now + kMs), gNextDeadline.Store(now + kMs); }
    uint32_t SetCallbackTime(uint64_t t, int32_t clock) { const ClockTime c = FromU64(t); return quelta_iTSC_SetCallbackTime(&c, clock); }
    void SetOffset(int32_t seconds) { gEngine.load()->SetEpochOffset(seconds); }
    testsupport::SchedulerHarness h;
};

// Ticks on time: zero jitter, one period apart; a late one served once, not replayed, the grid restarted
// from it; the tick serial counts only while a tick callback is registered.
TEST_F(Scheduler, TicksKeepTheGridAndAreNeverReplayed) {
    auto* engine = gEngine.load();
    engine->statsCount.store(0), engine->statsEnabled.store(1);
    for (int i = 0; i < 500; ++i) Tick();
    EXPECT_EQ(std::tuple(engine->statsCount.load(), engine->stats.jitterSamples[0].load()), std::tuple(500, 0u));
    EXPECT_EQ(std::tuple(gNextTick.Load(), h.timer->LastArmed()), std::tuple(h.Now() + kMs, h.Now() + kMs));
    gTickCallback.store(RecordTick);
    const uint64_t late = gNextTick.Load() + 3 * kMs + kMs / 2;
    PassAt(late);
    EXPECT_EQ(std::tuple(gNextTick.Load(), h.timer->LastArmed()), std::tuple(late, late));  // next tick at once
    PassAt(late + 1000);
    EXPECT_EQ(gNextTick.Load(), late + kMs);
    PassAt(late + kMs / 2);  // no tick due
    EXPECT_EQ(gTicks, (std::vector<uint64_t>{0, 1}));
}

// The jitter samples fill an array of 1000; a count at its end or below 0 records nothing, nor beside it.
TEST_F(Scheduler, JitterSamplesStayInsideTheirArray) {
    auto* engine = gEngine.load();
    engine->stats.globalReadExtra.store(0x5A5A5A5Au), engine->stats.rawReadSamples[0].store(0xA5A5A5A5u);
    engine->statsEnabled.store(1);
    for (int32_t count : {999, 1000, -1}) {
        engine->statsCount.store(count);
        PassAt(gNextTick.Load() + 123);
        EXPECT_EQ(engine->statsCount.load(), count == 999 ? 1000 : count);
    }
    EXPECT_EQ(engine->stats.jitterSamples[999].load(), 123u);
    EXPECT_EQ(std::tuple(engine->stats.rawReadSamples[0].load(), engine->stats.globalReadExtra.load()),
              std::tuple(0xA5A5A5A5u, 0x5A5A5A5Au));
}

// Both callback times due exactly at a pass: two calls, given the pass's now (no argument set).
TEST_F(Scheduler, BothCallbackTimesDueInOnePassCallTwice) {
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    const uint64_t t = h.Now() + 100;
    EXPECT_EQ(SetCallbackTime(t, 0) + SetCallbackTime(t, -1), 2u);
    EXPECT_EQ(h.timer->LastArmed(), t);  // earlier than the tick: armed
    PassAt(t);
    ASSERT_EQ(gCalls.size(), 2u);
    EXPECT_EQ(std::tuple(gCalls[0].seen, gCalls[1].seen), std::tuple(t, t));
    EXPECT_TRUE(IsNever(gMonotonicCallbackTime.Load()) && IsNever(gGlobalCallbackTime.Load()));
}

// A callback time ticks ahead is stored unarmed, then folded by each tick: the one before it arms for it.
TEST_F(Scheduler, ALaterCallbackTimeIsFoldedAndArmedExactly) {
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    for (int32_t clock : {0, -1}) {
        gCalls.clear();
        const uint64_t when = h.Now() + 5 * kMs + 300000;
        const size_t armed = h.timer->armed.size();
        SetCallbackTime(when, clock);
        EXPECT_EQ(h.timer->armed.size(), armed) << clock;
        while (gNextTick.Load() + kMs <= when) Tick();
        Tick();
        EXPECT_EQ(h.timer->LastArmed(), when) << clock;
        EXPECT_TRUE(gCalls.empty());
        PassAt(when);
        EXPECT_EQ(gCalls.size(), 1u) << clock;
    }
}

void ReArmingCallback(void* arg) {
    gCalls.push_back({arg, 0});
    const ClockTime next = FromU64(ToU64(*static_cast<ClockTime*>(arg)) + 250000);
    if (gCalls.size() < 3) quelta_iTSC_SetCallbackTime(&next, 0);
}

TEST_F(Scheduler, ACallbackSettingItsNextTimeIsArmedAtOnce) {
    quelta_iTSC_SetCallback(ReArmingCallback, nullptr);
    SetCallbackTime(h.Now() + 100000, 0);
    PassAt(h.Now() + 100000);
    EXPECT_EQ(gCalls.size(), 1u);
    EXPECT_EQ(gMonotonicCallbackTime.Load(), h.Now() + 250000);
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + 250000);  // the pass kept the earlier time
    PassAt(h.Now() + 250000);
    EXPECT_EQ(gCalls.size(), 2u);
}

// NeverTime cancels a callback time; a set argument is what the callback gets.
TEST_F(Scheduler, CallbackArgumentAndNeverTimeCancel) {
    ClockTime token{42, 0};
    quelta_iTSC_SetCallback(RecordCallback, &token);
    SetCallbackTime(h.Now() + 10, 0);
    EXPECT_EQ(SetCallbackTime(kNeverTime64, 0), 1u);
    PassAt(h.Now() + 100);
    EXPECT_TRUE(gCalls.empty());
    SetCallbackTime(h.Now() - 90, 0);
    h.Pass();
    ASSERT_EQ(gCalls.size(), 1u);
    EXPECT_EQ(std::tuple(gCalls[0].arg, gCalls[0].seen), std::tuple((void*)&token, 42ull));
}

// A NeverTime global callback time is neither converted (at +100 s it would arm early) nor folded.
TEST_F(Scheduler, NeverTimeGlobalCallbackTimeIsNeitherConvertedNorFolded) {
    SetOffset(100);
    MoveTo(kNeverTime64 - 100 * kSecond - 400000);
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    EXPECT_EQ(SetCallbackTime(kNeverTime64, -1), 1u);
    EXPECT_TRUE(h.timer->armed.empty()) << "armed for a cancelled callback time";
    EXPECT_TRUE(IsNever(gGlobalCallbackTime.Load()));
    h.Pass();
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + kMs) << "a cancelled callback time was folded";
    EXPECT_TRUE(gCalls.empty());
}

TEST_F(Scheduler, TickCallbackRegistrationAndControlFlag) {
    iKPusTimingEngine* e = gEngine.load();
    e->RegisterTickCallback(RecordTick);
    EXPECT_EQ(gTickCallback.load(), &RecordTick);
    e->UnregisterTickCallback(nullptr);  // another function: cleared all the same
    EXPECT_EQ(gTickCallback.load(), nullptr);
    for (auto [set, flag] : {std::pair{1u, 1u}, {3u, 1u}, {2u, 0u}}) {
        e->SetControlFlag(set);
        EXPECT_EQ(gControlFlag.load(), flag) << set;
    }
}

// A deadline equal to now is due; nodes fire in list order (equal ones as they came), the rest is folded.
TEST_F(Scheduler, DueNodesFireInListOrderAndTheNextIsFolded) {
    const uint64_t now = h.Now();
    WaitNode *x = h.Take(), *y = h.Take(), *z = h.Take(), *a = h.Take(), *d = h.Take();
    int tag = 0;
    for (auto [n, at] : {std::pair{x, now + 300}, {y, now + 300}, {z, now + 300}, {a, now + 100}, {d, now + 600000}}) {
        ASSERT_EQ(Queue(n, at, ++tag), 0u);
    }
    EXPECT_EQ(h.ListOrder(), (Nodes{a, x, y, z, d}));
    PassAt(now + 300);
    EXPECT_EQ(gFired, (Tags{4, 1, 2, 3}));
    EXPECT_EQ(h.ListOrder(), Nodes{d});
    EXPECT_EQ(h.timer->LastArmed(), now + 600000);
    for (WaitNode* n : {x, y, z, a}) EXPECT_EQ(std::tuple(Fired(n), State(n)), std::tuple(1u, kDone));
    for (WaitNode* n : {x, y, z, a, d}) ReleaseWaitNode(n);  // d: cancels the queued wait
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

// Whether a fired node goes back to the pool: the callback's answer, or autoRelease without one.
TEST_F(Scheduler, ReleaseDecisionComesFromTheCallbackOrAutoRelease) {
    WaitNode *keep = h.Take(0, 0), *back = h.Take(0, 0), *plain = h.Take(0, 1);
    Queue(keep, h.Now() + 1);
    PassAt(h.Now() + 2);
    gRelease = 1;
    Queue(back, h.Now() + 1), Queue(plain, h.Now() + 1, 0, nullptr);
    PassAt(h.Now() + 2);
    EXPECT_EQ(std::tuple(State(keep), State(back), State(plain)), std::tuple(kDone, kFree, kFree));
    ReleaseWaitNode(keep);
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

// An insert arms only for a new earliest deadline; high word 0xFFFFFFFF is before every time: past.
TEST_F(Scheduler, InsertArmsOnlyForANewEarliestDeadline) {
    const uint64_t now = h.Now();
    WaitNode *late = h.Take(), *early = h.Take(), *never = h.Take(), *first = h.Take();
    Queue(late, now + 5 * kMs, 1);
    EXPECT_TRUE(h.timer->armed.empty());
    Queue(early, now + 200000, 2);
    EXPECT_EQ(std::tuple(h.timer->LastArmed(), gNextDeadline.Load()), std::tuple(now + 200000, now + 200000));
    Queue(never, kNeverTime64, 0, nullptr), Queue(first, 0xFFFFFFFF00000000ull, 3);
    EXPECT_EQ(h.ListOrder(), (Nodes{first, early, late, never}));
    EXPECT_EQ(std::tuple(h.timer->LastArmed(), h.timer->expireNowCalls), std::tuple(0ull, 0));
    h.Pass();
    EXPECT_EQ(gFired, Tags{3});
}

// Without a timer a callback time that would arm is refused (0), and so is every insert (1), earliest
// or not: the node stays held, or goes back to the pool with autoRelease; the list is left alone.
TEST_F(Scheduler, WithoutATimerWhatWouldNeedItIsRefused) {
    WaitNode *queued = h.Take(), *held = h.Take(0, 0), *autoNode = h.Take(0, 1), *behind = h.Take(0, 0);
    Queue(queued, h.Now() + 500000);
    h.RemoveTimer();
    const uint64_t deadline = gNextDeadline.Load();
    EXPECT_EQ(SetCallbackTime(h.Now() + 10, 0), 0u);
    EXPECT_TRUE(IsNever(gMonotonicCallbackTime.Load()));
    EXPECT_EQ(gNextDeadline.Load(), deadline);
    EXPECT_EQ(SetCallbackTime(h.Now() + 50 * kMs, 0), 1u);
    EXPECT_EQ(gMonotonicCallbackTime.Load(), h.Now() + 50 * kMs);
    EXPECT_EQ(Queue(held, h.Now() + 100), 1u);
    EXPECT_EQ(State(held), kHeld);
    EXPECT_EQ(Queue(autoNode, h.Now() + 100), 1u);
    EXPECT_EQ(gFreeList.load(), autoNode);
    EXPECT_EQ(Queue(behind, h.Now() + 900000), 1u);
    EXPECT_EQ(h.ListOrder(), Nodes{queued});
    for (WaitNode* n : {behind, held, queued}) ReleaseWaitNode(n);
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

TEST_F(Scheduler, BadReleasesAreRefusedWithoutCorruptingTheLists) {
    WaitNode foreign{};
    WaitNode *unused = gFreeList.load(), *n = h.Take();
    for (WaitNode* bad : {unused, n, n, &foreign, reinterpret_cast<WaitNode*>(reinterpret_cast<char*>(n) + 4)}) {
        ReleaseWaitNode(bad);  // never taken, twice, not of the pool, inside a node
    }
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

// NeverTime is one value: a time with only one of its words is an ordinary time; so is a tick there.
TEST_F(Scheduler, NeverTimeIsRecognisedOnlyWhenBothWordsMatch) {
    for (uint64_t t : {0x00000005FFFFFFFFull, 0xFFFFFFFE00000005ull}) {
        gFired.clear();
        MoveTo(t - 400000);
        h.Pass();
        EXPECT_EQ(h.timer->LastArmed(), t + 600000) << t << ": the next tick was not armed";
        WaitNode* n = h.Take();
        ASSERT_EQ(Queue(n, t, 7), 0u);
        EXPECT_EQ(std::tuple(h.timer->LastArmed(), h.timer->expireNowCalls), std::tuple(t, 0));
        PassAt(t);
        EXPECT_EQ(gFired, Tags{7}) << t;
        ReleaseWaitNode(n);
    }
}

// A new generation of the global clock fires abortable global nodes (only) at once, and only once.
TEST_F(Scheduler, ANewGenerationFiresOnlyAbortableGlobalNodesOnce) {
    const uint32_t saved = gGeneration.load();
    h.Pass();  // the first pass notes the generation
    const uint64_t far = h.Now() + 3600 * kSecond;
    WaitNode *aborted = h.Take(1, 1, 1), *global = h.Take(1, 1, 0), *monotonic = h.Take(0, 1, 1), *later = h.Take(1, 1, 1);
    Queue(aborted, far, 1), Queue(global, far, 2), Queue(monotonic, far, 3);
    gGeneration.store(saved + 1);
    PassAt(h.Now() + 1000);
    EXPECT_EQ(gFired, Tags{1});
    Queue(later, far, 4);
    PassAt(h.Now() + 1000);
    EXPECT_EQ(gFired, Tags{1}) << "an old change of generation fired a new wait";
    EXPECT_EQ(h.ListOrder(), (Nodes{global, monotonic, later}));
    for (WaitNode* n : {aborted, global, monotonic, later}) ReleaseWaitNode(n);
    gGeneration.store(saved);
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

// A global node queued as a pass at rest begins (reading the clock) is converted by it and fires.
TEST_F(Scheduler, AGlobalNodeQueuedAsAPassAtRestBeginsIsConverted) {
    SetOffset(100);
    static decltype(this) self;
    static WaitNode* arrived;
    self = this, arrived = nullptr;
    gTickNowOverride = [] {
        if (arrived == nullptr) arrived = self->QueueAt(self->h.Now() + 100 * kSecond - kMs, true);
        return self->h.Now();
    };
    h.Pass();
    ASSERT_NE(arrived, nullptr);
    EXPECT_EQ(Fired(arrived), 1u);
}

// Global = monotonic + 100 s: deadlines before the monotonic zero (50 s) or the global one are past.
TEST_F(Scheduler, AGlobalDeadlineBeforeTheMonotonicZeroIsPast) {
    SetOffset(100);
    for (uint64_t at : {50 * kSecond, uint64_t(0xFFFFFFFF00000005ull), 200 * kSecond}) QueueAt(at, true);
    EXPECT_EQ(h.timer->LastArmed(), 0u) << "a past deadline arms the timer at once";
    h.Pass();
    EXPECT_EQ(h.ListOrder().size(), 1u) << "a past deadline was not fired";
    EXPECT_EQ(gNextDeadline.Load(), h.Now() + kMs) << "the later node is folded, the tick comes first";
}

// Global = monotonic - 100 s: a deadline < 100 s below NeverTime is the latest time, not wrapped.
TEST_F(Scheduler, AGlobalDeadlineBeyondTheMonotonicRangeIsTheLatest) {
    SetOffset(-100);
    QueueAt(kNeverTime64 - 100 * kSecond + 6, true);
    EXPECT_TRUE(h.timer->armed.empty()) << "a deadline centuries ahead was armed";
    h.Pass();
    EXPECT_EQ(h.ListOrder().size(), 1u) << "a deadline at the top of the range was fired";
}

// With the user-space conversion (it reads the clocks), no insert or pass converts node by node.
TEST_F(Scheduler, InsertAndPassDoNotConvertNodeByNode) {
    gConvertStandInEnabled.store(true);
    const uint64_t base = ToU64(gEngine.load()->MonotonicToGlobal(FromU64(h.Now()))) + 30 * kSecond;
    for (uint32_t i = 1; i < kWaitNodeCount; ++i) QueueAt(base + i * kMs, true);
    gSystemClock.getTime = &CountingGetTime;
    gClockReads.store(0);
    QueueAt(base + kSecond, true);  // walks past every node
    // An offset costs a read and up to three brackets of three (more under instrumentation).
    EXPECT_LE(gClockReads.exchange(0), 16) << "an insert converts every node it passes";
    h.Pass();
    EXPECT_LE(gClockReads.load(), 40) << "a pass converts node by node";
    const Nodes order = h.ListOrder();
    ASSERT_EQ(order.size(), kWaitNodeCount) << "nodes 30 s ahead were fired";
    EXPECT_EQ(order.back()->deadline.load(), base + kSecond);
}

// A global waiter that wakes by itself costs the timer nothing (no arming, no post),
// unless a wall clock step puts its deadline well before that wake.
TEST_F(Scheduler, AWaiterThatWakesByItselfCostsTheTimerThreadNothing) {
    ASSERT_EQ(PalInitialize(), 1u);
    PalSemaphore* semaphore = nullptr;
    ASSERT_EQ(PalSemaphoreCreate(&semaphore), 0);
    const uint64_t tick = gNextDeadline.Load();
    auto queue = [&](uint64_t at) {
        WaitNode* n = h.Take(1, 0, 0, at);
        n->semaphore.store(semaphore);
        EXPECT_EQ(Queue(n, at, 0, nullptr), 0u);
        return n;
    };
    WaitNode* n = queue(h.Now() + 400000);
    EXPECT_EQ(h.timer->LastArmed(), kNeverTime64) << "armed for a waiter that wakes by itself";
    PassAt(h.Now() + 100000);
    EXPECT_EQ(h.timer->LastArmed(), tick) << "a pass armed for it rather than for the tick";
    PassAt(h.Now() + 400000);
    EXPECT_NE(Fired(n), 0u);
    EXPECT_EQ(PalSemaphoreWait(semaphore, 0), 1u) << "posted a waiter that was waking anyway";
    ReleaseWaitNode(n);
    n = queue(h.Now() + 400000);
    SetOffset(1);  // the deadline is now 0.6 s past
    PassAt(h.Now() + 1000);
    EXPECT_NE(Fired(n), 0u) << "a stepped deadline waited for the waiter's own wake";
    EXPECT_EQ(PalSemaphoreWait(semaphore, 0), 0u) << "the waiter was not woken";
    ReleaseWaitNode(n);
    PalSemaphoreDestroy(semaphore);
}

// A node that needs the timer is armed for even behind a head that wakes by itself.
TEST_F(Scheduler, ANodeBehindASelfWakingHeadIsArmedFor) {
    WaitNode* head = QueueAt(h.Now() + 400000, true, h.Now() + 400000);
    ASSERT_EQ(h.timer->LastArmed(), kNeverTime64);
    QueueAt(h.Now() + 600000, false);
    ASSERT_EQ(gWaitList.load(), head);
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + 600000) << "the node behind the head waits for the next tick";
}

// After a wall clock step the list's order is stale: a pass fires every due node wherever it stands,
// never arms for a past time, and arms for the earliest node that needs the timer.
TEST_F(Scheduler, AfterAWallClockStepEveryDueNodeFiresWhereverItStands) {
    SetOffset(1);  // placed with the wall clock 1 s ahead, then stepped back
    WaitNode* global = QueueAt(h.Now() + kSecond + 400000, true, h.Now() + 400000);
    WaitNode* monotonic = QueueAt(h.Now() + 600000, false);
    ASSERT_EQ(gWaitList.load(), global);
    SetOffset(0);
    PassAt(h.Now() + 700000);
    EXPECT_NE(Fired(monotonic), 0u) << "a due node behind a stepped head did not fire";
    EXPECT_EQ(Fired(global), 0u) << "fired 1 s early";
    EXPECT_FALSE(Earlier(h.timer->LastArmed(), h.Now())) << "armed for a time already past";
    SetOffset(1);
    PassAt(h.Now() + 1000);
    EXPECT_NE(Fired(global), 0u);

    SetOffset(0);  // stepped back at a tick's pass, which makes the next deadline anew
    Tick();
    const uint64_t tickAt = gNextTick.Load();
    WaitNode* staleHead = QueueAt(tickAt + 400000, true);
    WaitNode* earliest = QueueAt(tickAt + 500000, false);
    ASSERT_EQ(gWaitList.load(), staleHead);
    SetOffset(-1);
    PassAt(tickAt);
    EXPECT_EQ(h.timer->LastArmed(), tickAt + 500000) << "armed for the stale head or the tick";
    SetOffset(0);
    PassAt(tickAt + 500000);
    EXPECT_NE(Fired(staleHead) * Fired(earliest), 0u);

    WaitNode* first = QueueAt(h.Now() + 2 * kSecond, false);  // stepped forward
    WaitNode* stepped = QueueAt(h.Now() + 3 * kSecond, true);
    ASSERT_EQ(gWaitList.load(), first);
    SetOffset(2);
    PassAt(h.Now() + 1500 * kMs);
    EXPECT_NE(Fired(stepped), 0u) << "a stepped global node waited for the node before it";
    EXPECT_EQ(Fired(first), 0u);
}

}  // namespace
