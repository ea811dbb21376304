// The tick scheduler driven deterministically (passes at chosen times, a fake timer, recording callbacks),
// and the event and global-clock waits on it, each blocking wait on a thread of its own.
#include <gtest/gtest.h>
#include <pthread.h>
#include <time.h>
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
using testsupport::Eventually, testsupport::MonoNowNs;

namespace {

constexpr uint64_t kMs = 1000000, kSecond = 1000 * kMs;
using Nodes = std::vector<WaitNode*>; using Tags = std::vector<int>;
uint32_t State(const WaitNode* n) { return n->state.load(); }
uint32_t Fired(const WaitNode* n) { return n->fireCount.load(); }
constexpr uint32_t kFree = uint32_t(NodeState::kFree), kHeld = uint32_t(NodeState::kHeld), kDone = uint32_t(NodeState::kFired);

std::vector<uint64_t> gTicks;
void RecordTick(uint64_t serial) { gTicks.push_back(serial); }
struct Call { void* arg; uint64_t seen; };  // seen: the ClockTime behind arg
std::vector<Call> gCalls;
bool gReArm = false;  // RecordCallback sets its next time to the time it was given, once
void RecordCallback(void* arg) {
    if (gCalls.push_back({arg, ToU64(*static_cast<ClockTime*>(arg))}), std::exchange(gReArm, false)) quelta_iTSC_SetCallbackTime(static_cast<ClockTime*>(arg), 0);
}
Tags gFired;
uint32_t gRelease = 0;  // what the wait callback asks for
uint32_t RecordFire(void* arg) { return gFired.push_back(int(reinterpret_cast<intptr_t>(arg))), gRelease; }

class Scheduler : public ::testing::Test {
protected:
    void SetUp() override { gTicks.clear(), gCalls.clear(), gFired.clear(), gRelease = 0; }
    void TearDown() override { ResetSystemClockHooks(); }
    uint32_t Queue(WaitNode* n, uint64_t deadline, int tag = 0, QueltaWaitCallbackFn cb = RecordFire) {  // tag: for RecordFire
        const ClockTime d = FromU64(deadline);
        return InsertWaitNode(n, &d, cb, reinterpret_cast<void*>(intptr_t(tag)));
    }
    WaitNode* QueueAt(uint64_t deadline, bool global, uint64_t selfWake = 0) {  // released as it fires
        WaitNode* n = h.Take(global, 1, 0, selfWake);  // its waiter wakes by itself at selfWake (0: never)
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
// from it; the tick serial counts only while a tick callback is registered. The jitter samples fill an
// array of 1000: a count at its end or below 0 records nothing, nor beside it.
TEST_F(Scheduler, TicksKeepTheGridAndAreNeverReplayed) {
    auto* engine = gEngine.load();
    engine->statsCount.store(0), engine->statsEnabled.store(1);
    for (int i = 0; i < 500; ++i) Tick();
    EXPECT_EQ(std::tuple(engine->statsCount.load(), engine->stats.jitterSamples[0].load()), std::tuple(500, 0u));
    EXPECT_EQ(std::tuple(gNextTick.Load(), h.timer->LastArmed()), std::tuple(h.Now() + kMs, h.Now() + kMs));
    engine->RegisterTickCallback(RecordTick);
    const uint64_t late = gNextTick.Load() + 3 * kMs + kMs / 2;
    PassAt(late);
    EXPECT_EQ(std::tuple(gNextTick.Load(), h.timer->LastArmed()), std::tuple(late, late));  // next tick at once
    PassAt(late + 1000);
    EXPECT_EQ(gNextTick.Load(), late + kMs);
    PassAt(late + kMs / 2);  // no tick due
    EXPECT_EQ(gTicks, (std::vector<uint64_t>{0, 1}));
    engine->stats.globalReadExtra.store(0x5A5A5A5Au), engine->stats.rawReadSamples[0].store(0xA5A5A5A5u);
    for (int32_t count : {999, 1000, -1}) {
        engine->statsCount.store(count);
        PassAt(gNextTick.Load() + 123);
        EXPECT_EQ(engine->statsCount.load(), count == 999 ? 1000 : count);
    }
    EXPECT_EQ(std::tuple(engine->stats.jitterSamples[999].load(), engine->stats.rawReadSamples[0].load(),
                         engine->stats.globalReadExtra.load()), std::tuple(123u, 0xA5A5A5A5u, 0x5A5A5A5Au));
}

// Callback times are due at a pass exactly at them, given its now when no argument is set; NeverTime
// cancels one; a null time is refused; a set argument is what the callback gets.
TEST_F(Scheduler, CallbackTimesAreDueAtTheirTimeAndNeverTimeCancels) {
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    const uint64_t t = h.Now() + 100;
    EXPECT_EQ(quelta_iTSC_SetCallbackTime(nullptr, 0) + quelta_iTSC_SetCallbackTime(nullptr, -1), 0u);  // nothing stored
    EXPECT_EQ(SetCallbackTime(t, 0) + SetCallbackTime(t, -1), 2u);
    EXPECT_EQ(h.timer->LastArmed(), t);  // earlier than the tick: armed
    PassAt(t);
    ASSERT_EQ(gCalls.size(), 2u);
    EXPECT_EQ(std::tuple(gCalls[0].seen, gCalls[1].seen), std::tuple(t, t));
    EXPECT_TRUE(IsNever(gMonotonicCallbackTime.Load()) && IsNever(gGlobalCallbackTime.Load()));
    gReArm = true, SetCallbackTime(t + 50, 0), PassAt(t + 50);  // a time set by the callback to its now: due in that pass
    ClockTime token{42, 0};
    quelta_iTSC_SetCallback(RecordCallback, &token);
    SetCallbackTime(t + 10, 0);
    EXPECT_EQ(SetCallbackTime(kNeverTime64, 0), 1u);
    PassAt(t + 100);
    SetCallbackTime(t + 10, 0), h.Pass();
    ASSERT_EQ(gCalls.size(), 5u) << "a cancelled time was called, or a due one not";
    EXPECT_EQ(std::tuple(gCalls[4].arg, gCalls[4].seen), std::tuple((void*)&token, 42ull));
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
        EXPECT_EQ(std::tuple(h.timer->LastArmed(), gCalls.size()), std::tuple(when, size_t(0))) << clock;
        PassAt(when);
        EXPECT_EQ(gCalls.size(), 1u) << clock;
    }
}

// A NeverTime global callback time is neither converted (at +100 s it would arm early) nor folded.
TEST_F(Scheduler, NeverTimeGlobalCallbackTimeIsNeitherConvertedNorFolded) {
    SetOffset(100);
    MoveTo(kNeverTime64 - 100 * kSecond - 400000);
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    EXPECT_EQ(SetCallbackTime(kNeverTime64, -1), 1u);
    EXPECT_TRUE(h.timer->armed.empty() && IsNever(gGlobalCallbackTime.Load())) << "armed for a cancelled time";
    h.Pass();
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + kMs) << "a cancelled callback time was folded";
    EXPECT_TRUE(gCalls.empty());
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
    EXPECT_EQ(std::tuple(gFired, h.ListOrder(), h.timer->LastArmed()), std::tuple(Tags{4, 1, 2, 3}, Nodes{d}, now + 600000));
    for (WaitNode* n : {x, y, z, a}) EXPECT_EQ(std::tuple(Fired(n), State(n)), std::tuple(1u, kDone));
    for (WaitNode* n : {x, y, z, a, d}) ReleaseWaitNode(n);  // d: cancels the queued wait
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

// Whether a fired node goes back to the pool: the callback's answer, or autoRelease without one.
TEST_F(Scheduler, ReleaseDecisionComesFromTheCallbackOrAutoRelease) {
    WaitNode *keep = h.Take(0, 0), *back = h.Take(0, 0), *plain = h.Take(0, 1);
    Queue(keep, h.Now() + 1), PassAt(h.Now() + 2), gRelease = 1;
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
    EXPECT_EQ(std::tuple(gMonotonicCallbackTime.Load(), gNextDeadline.Load()), std::tuple(kNeverTime64, deadline));
    EXPECT_EQ(SetCallbackTime(h.Now() + 50 * kMs, 0), 1u);
    EXPECT_EQ(gMonotonicCallbackTime.Load(), h.Now() + 50 * kMs);
    EXPECT_EQ(Queue(held, h.Now() + 100) + Queue(autoNode, h.Now() + 100) + Queue(behind, h.Now() + 900000), 3u);
    EXPECT_EQ(std::tuple(State(held), gFreeList.load(), h.ListOrder()), std::tuple(kHeld, autoNode, Nodes{queued}));
    for (WaitNode* n : {behind, held, queued}) ReleaseWaitNode(n);
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

// NeverTime is one value: a time with only one of its words is an ordinary time; so is a tick there.
TEST_F(Scheduler, NeverTimeIsRecognisedOnlyWhenBothWordsMatch) {
    for (uint64_t t : {0x00000005FFFFFFFFull, 0xFFFFFFFE00000005ull}) {
        gFired.clear(), MoveTo(t - 400000), h.Pass();
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

// A global deadline before the monotonic zero, or with high word 0xFFFFFFFF, is past: armed at once
// and fired; one beyond the monotonic range (within the offset of NeverTime) is the latest time.
TEST_F(Scheduler, GlobalDeadlinesOutsideTheMonotonicRangeArePastOrLatest) {
    const struct { int32_t offset; uint64_t at; bool past; } rows[] = {
        {100, 50 * kSecond, true}, {100, 0xFFFFFFFF00000005, true}, {100, 200 * kSecond, false},
        {-100, kNeverTime64 - 100 * kSecond + 6, false}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.at);
        SetOffset(row.offset), h.timer->armed.clear(), gFired.clear();
        WaitNode* n = h.Take(1, 0);
        Queue(n, row.at, 1);
        EXPECT_EQ(h.timer->LastArmed(), row.past ? 0 : kNeverTime64);
        h.Pass();
        EXPECT_EQ(gFired, row.past ? Tags{1} : Tags{});
        EXPECT_EQ(gNextDeadline.Load(), h.Now() + kMs) << "the tick comes first";
        ReleaseWaitNode(n);
    }
}

// A global waiter that wakes by itself costs the timer nothing (no arming, no post), unless a wall
// clock step puts its deadline well before that wake; a node behind it that needs the timer is armed for.
TEST_F(Scheduler, AWaiterThatWakesByItselfCostsTheTimerThreadNothing) {
    ASSERT_EQ(PalInitialize(), 1u);
    PalSemaphore* semaphore = nullptr;
    ASSERT_EQ(PalSemaphoreCreate(&semaphore), 0);
    const uint64_t tick = gNextDeadline.Load();
    auto queue = [&](uint64_t at) {
        WaitNode* n = h.Take(1, 0, 0, at);
        n->semaphore.store(semaphore), Queue(n, at, 0, nullptr);
        return n;
    };
    WaitNode* n = queue(h.Now() + 400000);
    EXPECT_EQ(h.timer->LastArmed(), kNeverTime64) << "armed for a waiter that wakes by itself";
    PassAt(h.Now() + 100000);
    EXPECT_EQ(h.timer->LastArmed(), tick) << "a pass armed for it rather than for the tick";
    QueueAt(h.Now() + 400000, false);
    EXPECT_EQ(std::tuple(h.timer->LastArmed(), gWaitList.load()), std::tuple(h.Now() + 400000, n)) << "behind the head";
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

// After a wall clock step the list's order is stale: a pass fires every due node wherever it stands,
// never arms for a past time, and arms for the earliest node that needs the timer.
TEST_F(Scheduler, AfterAWallClockStepEveryDueNodeFiresWhereverItStands) {
    SetOffset(1);  // placed with the wall clock 1 s ahead, then stepped back
    WaitNode* global = QueueAt(h.Now() + kSecond + 400000, true, h.Now() + 400000);
    WaitNode* monotonic = QueueAt(h.Now() + 600000, false);
    ASSERT_EQ(gWaitList.load(), global);
    SetOffset(0), PassAt(h.Now() + 700000);
    EXPECT_EQ(std::tuple(Fired(monotonic), Fired(global)), std::tuple(1u, 0u)) << "the due node behind a stepped head";
    EXPECT_FALSE(Earlier(h.timer->LastArmed(), h.Now())) << "armed for a time already past";
    SetOffset(1), PassAt(h.Now() + 1000);
    EXPECT_NE(Fired(global), 0u);

    SetOffset(0), Tick();  // stepped back at a tick's pass, which makes the next deadline anew
    const uint64_t tickAt = gNextTick.Load();
    WaitNode* staleHead = QueueAt(tickAt + 400000, true);
    WaitNode* earliest = QueueAt(tickAt + 500000, false);
    ASSERT_EQ(gWaitList.load(), staleHead);
    SetOffset(-1), PassAt(tickAt);
    EXPECT_EQ(h.timer->LastArmed(), tickAt + 500000) << "armed for the stale head or the tick";
    SetOffset(0), PassAt(tickAt + 500000);
    EXPECT_NE(Fired(staleHead) * Fired(earliest), 0u);

    WaitNode* first = QueueAt(h.Now() + 2 * kSecond, false);  // stepped forward
    WaitNode* stepped = QueueAt(h.Now() + 3 * kSecond, true);
    ASSERT_EQ(gWaitList.load(), first);
    SetOffset(2), PassAt(h.Now() + 1500 * kMs);
    EXPECT_EQ(std::tuple(Fired(stepped), Fired(first)), std::tuple(1u, 0u)) << "a stepped node waited for the one before it";
}


// A wait on a thread of its own; one given up on is ended as unloading does, else the process fails.
class Waiter {
public:
    template <typename F>
    explicit Waiter(F wait) : thread_([this, wait] { wait(), done_.store(true); }) {}
    ~Waiter() { ReturnsWithin(0); }
    bool ReturnsWithin(uint32_t ms) {
        if (!thread_.joinable()) return true;
        const bool returned = Eventually([this] { return done_.load(); }, ms * kMs);
        if (!returned) gStopping.store(true), WakeBlockedWaiters();
        if (!Eventually([this] { return done_.load(); }, 2000 * kMs)) std::fprintf(stderr, "unstoppable wait\n"), _exit(1);
        thread_.join(), gStopping.store(false);
        return returned;
    }
    std::atomic<bool> done_{false};
    std::thread thread_;
};

uint64_t GlobalNow() { ClockTime g; return gEngine.load()->ReadGlobal6(g), ToU64(g); }
uint64_t MonotonicNow() { ClockTime m; return gEngine.load()->ReadMonotonic0(m), ToU64(m); }
uint32_t WaitOwn(uint64_t deadline, PalSemaphore* s = nullptr) {  // on the node's own semaphore by default
    const ClockTime d = FromU64(deadline);
    return quelta_iTSCEvent_Wait_Callback_C(s, &d, nullptr, nullptr, 0, nullptr);
}

class EventWaits : public Scheduler {
protected:
    void SetUp() override {
        h.GiveNodesSemaphores();
        ASSERT_EQ(PalSemaphoreCreate(&semaphore), 0);
        gConvertStandInEnabled.store(true);  // the wall clock, converted for real: a waiter's own wake is on time
        h.Pass();  // the first pass notes the generation
    }
    void TearDown() override { gGeneration.store(0), PalSemaphoreDestroy(semaphore), ResetSystemClockHooks(); }
    PalSemaphore* semaphore = nullptr;
};

std::atomic<uint32_t> gRestoredGeneration{0};
uint32_t RestoreGeneration(void*) { return gGeneration.store(gRestoredGeneration.load()), 1; }

// Never early unless the result says why: a new generation ends a queued global wait with an abort flag
// (flag 1); without a flag, or changed back before the waiter looks (by a node fired before its), it lasts.
// (A target's low word of 0 is a time: only both words 0 mean "no wait".)
TEST_F(EventWaits, ANewGenerationEndsOnlyAnAbortableGlobalWait) {
    const struct { bool flag, changedBack; uint64_t ahead; } rows[] = {
        {true, false, 0}, {false, false, 150 * kMs}, {true, true, 150 * kMs}};  // 0: low word 0, 4.3 to 8.6 s ahead
    for (const auto& row : rows) {
        SCOPED_TRACE(testing::Message() << row.flag << row.changedBack);
        const uint32_t generation = gGeneration.load(), aborted = row.flag && !row.changedBack;
        const uint64_t before = GlobalNow();
        const ClockTime target = row.ahead ? FromU64(before + row.ahead) : ClockTime{0, uint32_t(before >> 32) + 2};
        uint32_t abortFlag = 77;
        ClockTime after{1, 2};
        Waiter waiter([&] { quelta_iTSC_WaitUntilGlobalClocks64_C(&target, row.flag ? &abortFlag : nullptr, &after, generation); });
        ASSERT_TRUE(Eventually([] { return gWaitList.load() != nullptr; }, 1000 * kMs)) << "the wait was not queued";
        if (row.changedBack) {  // an abortable global node ahead of the waiter's, fired first
            gRestoredGeneration.store(generation);
            ASSERT_EQ(Queue(h.Take(1, 1, 1), before + 100 * kMs, 0, RestoreGeneration), 0u);
        }
        gGeneration.store(generation + 1), h.SetNow(h.Now() + 1000), h.Pass();
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
    ASSERT_TRUE(Eventually([&] { for (WaitNode& n : h.pool) held = State(&n) == kHeld ? &n : held; return held != nullptr; }, 1000 * kMs));
    PalSemaphorePost(held->ownSemaphore.load());
    ASSERT_TRUE(waiter.ReturnsWithin(2000));
    EXPECT_EQ(std::tuple(r, MonoNowNs() >= deadline), std::tuple(0u, true)) << "ended early";
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
    EXPECT_EQ(std::tuple(quelta_iTSCEvent_Wait_C(semaphore, 1000), WaitOwn(ToU64(target), semaphore)), std::tuple(3u, 3u));
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
        if (past) { EXPECT_EQ(h.FreeNodes(), kWaitNodeCount); }
    }
}

// An event timeout becomes a 32-bit clock count: 4,294,968 us wraps to 704 clocks.
TEST_F(EventWaits, TimeoutsWrapAsA32BitClockCount) {
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(quelta_iTSCEvent_Wait_C(semaphore, 4294968u), 1u);
    EXPECT_LT(MonoNowNs() - t0, 500 * kMs);
}

// Over up to fifty tries `wait` never takes under `ms`, and some try under `ms + 1` (an extra
// millisecond shows in every try, noise not).
template <typename F>
void ExpectMilliseconds(uint32_t ms, F wait) {
    SCOPED_TRACE(testing::Message() << ms << " ms");
    uint64_t least = ~uint64_t(0);
    for (int i = 0; i < 50 && least >= (ms + 1) * kMs; ++i) {
        uint64_t elapsed = 0;
        Waiter timed([&] {
            sched_param p{1};
            pthread_setschedparam(pthread_self(), SCHED_FIFO, &p);  // where allowed: fewer late wakes
            const uint64_t t0 = MonoNowNs();
            wait(), elapsed = MonoNowNs() - t0;
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
TEST_F(EventWaits, WithoutTickServiceWaitsSleepWholeMillisecondsPlusOne) {
    gEngine.load()->serviceMode.store(1), gSystemClock.getTime = &FixedWallClock;
    const uint64_t now = GlobalNow();
    for (auto [ahead, ms] : {std::pair{int64_t(2300000), 3u}, {int64_t(2600000), 4u}, {-int64_t(1000 * kMs), 0u}}) {
        const ClockTime target = FromU64(now + static_cast<uint64_t>(ahead));
        ExpectMilliseconds(ms, [&] {
            uint32_t abortFlag = 7;
            ClockTime after{1, 2};
            quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, gGeneration.load());
            EXPECT_EQ(std::tuple(abortFlag, ToU64(after)), std::tuple(0u, now));
        });
    }
    // An event wait's timeout is cut to whole ms, plus one; 0xFFFFFFFF waits for a post; waits on the
    // list are refused (3) and take no node.
    for (auto [timeout, ms] : {std::pair{999u, 1u}, {1000u, 2u}, {0u, 1u}}) {
        ExpectMilliseconds(ms, [&, timeout = timeout] { EXPECT_EQ(quelta_iTSCEvent_Wait_C(semaphore, timeout), 1u); });
    }
    std::atomic<uint32_t> r{99};
    Waiter forever([&] { r.store(quelta_iTSCEvent_Wait_C(semaphore, 0xFFFFFFFFu)); });
    EXPECT_FALSE(Eventually([&] { return r.load() != 99u; }, 30 * kMs)) << "no timeout, yet it ended";
    PalSemaphorePost(semaphore);
    EXPECT_TRUE(forever.ReturnsWithin(1000));
    EXPECT_EQ(r.load(), 0u);
    EXPECT_EQ(std::tuple(WaitOwn(MonotonicNow() + 20 * kMs), WaitOwn(MonotonicNow() + 20 * kMs, semaphore)), std::tuple(3u, 3u));
    EXPECT_EQ(h.FreeNodes(), kWaitNodeCount);
}

}  // namespace
