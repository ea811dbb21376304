// The tick scheduler driven deterministically: tick passes at chosen times,
// a fake timer that records its arming, callbacks that record their calls.
#include <gtest/gtest.h>

#include <vector>

#include "SchedulerHarness.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TickService.h"
#include "engine/tKPusTimingEngine.h"
#include "engine/WaitList.h"
#include "quelta/quelta.h"

using namespace quelta;
using testsupport::SchedulerHarness;

namespace {

constexpr uint64_t kMs = 1000000;

std::vector<uint64_t> gTicks;
void RecordTick(uint64_t serial) { gTicks.push_back(serial); }

struct CallbackCall {
    void* arg;
    uint64_t nowSeen;  // the ClockTime behind arg when arg is the pass's now
};
std::vector<CallbackCall> gCalls;
void RecordCallback(void* arg) {
    gCalls.push_back({arg, ToU64(*static_cast<ClockTime*>(arg))});
}

std::vector<int> gFired;
uint32_t gReleaseDecision = 0;
uint32_t RecordFire(void* arg) {
    gFired.push_back(static_cast<int>(reinterpret_cast<intptr_t>(arg)));
    return gReleaseDecision;
}

class SchedulerTest : public ::testing::Test {
protected:
    void SetUp() override {
        gTicks.clear();
        gCalls.clear();
        gFired.clear();
        gReleaseDecision = 0;
    }
    uint32_t Queue(WaitNode* node, uint64_t deadline, int tag, QueltaWaitCallbackFn cb = RecordFire) {
        ClockTime d = FromU64(deadline);
        return InsertWaitNode(node, &d, cb, reinterpret_cast<void*>(static_cast<intptr_t>(tag)));
    }
    // The controlled clock at `now`, the next tick one period ahead.
    void MoveTo(uint64_t now) {
        h.SetNow(now);
        gNextTick.Store(now + kMs);
        gNextDeadline.Store(now + kMs);
    }
    std::vector<WaitNode*> ListOrder() {
        std::vector<WaitNode*> out;
        for (WaitNode* n = gWaitList.load(); n != nullptr; n = n->next.load()) out.push_back(n);
        return out;
    }
    SchedulerHarness h;
};

TEST_F(SchedulerTest, TickAtItsTimeHasZeroJitterAndKeepsTheGrid) {
    auto* engine = gEngine.load();
    engine->statsCount.store(0);
    engine->statsEnabled.store(1);
    h.SetNow(gNextTick.Load());
    h.Pass();
    EXPECT_EQ(engine->statsCount.load(), 1);
    EXPECT_EQ(engine->stats.jitterSamples[0].load(), 0u);
    EXPECT_EQ(gNextTick.Load(), h.Now() + kMs);
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + kMs);
}

TEST_F(SchedulerTest, LatePassServesOneTickThenRestartsTheGrid) {
    gTickCallback.store(RecordTick);
    const uint64_t late = gNextTick.Load() + 3 * kMs + kMs / 2;  // 3.5 periods late
    h.SetNow(late);
    h.Pass();
    EXPECT_EQ(gNextTick.Load(), late);        // missed ticks are not replayed
    EXPECT_EQ(h.timer->LastArmed(), late);    // next tick due at once
    h.SetNow(late + 1000);
    h.Pass();
    EXPECT_EQ(gNextTick.Load(), late + kMs);  // one period past the served tick
    EXPECT_EQ(gTicks, (std::vector<uint64_t>{0, 1}));  // two calls, not four
}

TEST_F(SchedulerTest, TickSerialCountsOnlyWhileRegistered) {
    for (int i = 0; i < 500; ++i) {
        h.SetNow(gNextTick.Load());
        h.Pass();
    }
    gTickCallback.store(RecordTick);
    h.SetNow(gNextTick.Load());
    h.Pass();
    h.SetNow(h.Now() + kMs / 2);  // no tick due on this pass
    h.Pass();
    EXPECT_EQ(gTicks, (std::vector<uint64_t>{0}));
}

// Both callback times due in one pass, each exactly at the pass's time (a
// time equal to now is due): the callback is called twice. (The two calls
// carry the same function, argument and now, so which comes first cannot be
// told from outside.)
TEST_F(SchedulerTest, BothCallbackTimesDueInOnePassCallTwice) {
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    ClockTime t = FromU64(h.Now() + 100);
    ASSERT_EQ(quelta_iTSC_SetCallbackTime(&t, 0), 1u);
    ASSERT_EQ(quelta_iTSC_SetCallbackTime(&t, -1), 1u);  // global == monotonic here
    EXPECT_EQ(h.timer->LastArmed(), ToU64(t));           // earlier than the tick: armed
    h.SetNow(ToU64(t));
    h.Pass();
    ASSERT_EQ(gCalls.size(), 2u);
    // With no argument set, the callback receives the pass's own `now`.
    EXPECT_EQ(gCalls[0].nowSeen, h.Now());
    EXPECT_EQ(gCalls[1].nowSeen, h.Now());
    EXPECT_TRUE(IsNever(gMonotonicCallbackTime.Load()));
    EXPECT_TRUE(IsNever(gGlobalCallbackTime.Load()));
}

// A callback time between ticks, several ticks ahead, is stored without
// arming; each pass folds it into the next deadline, so the pass before it
// arms the timer for the time itself, not for the tick after it. `clock` 0 is
// the monotonic callback time, -1 the global one (global == monotonic here).
void ExpectFoldedAndArmedExactly(SchedulerHarness& h, int32_t clock) {
    SCOPED_TRACE(clock == 0 ? "monotonic callback time" : "global callback time");
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    const uint64_t when = h.Now() + 5 * kMs + 300000;  // between ticks, 5 ms ahead
    ClockTime t = FromU64(when);
    const size_t armedBefore = h.timer->armed.size();
    ASSERT_EQ(quelta_iTSC_SetCallbackTime(&t, clock), 1u);
    EXPECT_EQ(h.timer->armed.size(), armedBefore);  // stored without arming
    // Ticks until the pass before it: that pass arms for the callback time itself.
    while (gNextTick.Load() + kMs <= when) {
        h.SetNow(gNextTick.Load());
        h.Pass();
    }
    h.SetNow(gNextTick.Load());
    h.Pass();
    EXPECT_EQ(h.timer->LastArmed(), when);
    EXPECT_TRUE(gCalls.empty());
    h.SetNow(when);
    h.Pass();
    EXPECT_EQ(gCalls.size(), 1u);
}

TEST_F(SchedulerTest, MonotonicCallbackTimeLaterThanTheTickIsFoldedAndArmedExactly) {
    ExpectFoldedAndArmedExactly(h, 0);
}

TEST_F(SchedulerTest, GlobalCallbackTimeLaterThanTheTickIsFoldedAndArmedExactly) {
    ExpectFoldedAndArmedExactly(h, -1);
}

void ReArmingCallback(void* arg) {
    gCalls.push_back({arg, 0});
    if (gCalls.size() < 3) {
        ClockTime next = FromU64(ToU64(*static_cast<ClockTime*>(arg)) + 250000);
        quelta_iTSC_SetCallbackTime(&next, 0);
    }
}

TEST_F(SchedulerTest, CallbackSettingItsNextTimeIsArmedAtOnce) {
    quelta_iTSC_SetCallback(ReArmingCallback, nullptr);
    ClockTime t = FromU64(h.Now() + 100000);
    quelta_iTSC_SetCallbackTime(&t, 0);
    h.SetNow(h.Now() + 100000);
    h.Pass();
    EXPECT_EQ(gCalls.size(), 1u);
    EXPECT_EQ(ToU64(gMonotonicCallbackTime.LoadTime()), h.Now() + 250000);
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + 250000);  // the pass kept the earlier time
    h.SetNow(h.Now() + 250000);
    h.Pass();
    EXPECT_EQ(gCalls.size(), 2u);
}

void RecordArgument(void* arg) { gCalls.push_back({arg, 0}); }

TEST_F(SchedulerTest, CallbackArgumentAndNeverTimeCancel) {
    int token = 0;
    quelta_iTSC_SetCallback(RecordArgument, &token);
    ClockTime t = FromU64(h.Now() + 10);
    quelta_iTSC_SetCallbackTime(&t, 0);
    ClockTime never = kNeverTime;
    EXPECT_EQ(quelta_iTSC_SetCallbackTime(&never, 0), 1u);  // cancels
    h.SetNow(h.Now() + 100);
    h.Pass();
    EXPECT_TRUE(gCalls.empty());
    quelta_iTSC_SetCallbackTime(&t, 0);
    h.Pass();
    ASSERT_EQ(gCalls.size(), 1u);
    EXPECT_EQ(gCalls[0].arg, &token);
}

TEST_F(SchedulerTest, CallbackTimeWithoutTimerIsRefusedOnlyWhenItWouldArm) {
    h.RemoveTimer();
    const uint64_t deadlineBefore = gNextDeadline.Load();
    ClockTime early = FromU64(h.Now() + 10);
    EXPECT_EQ(quelta_iTSC_SetCallbackTime(&early, 0), 0u);
    EXPECT_TRUE(IsNever(gMonotonicCallbackTime.Load()));
    EXPECT_EQ(gNextDeadline.Load(), deadlineBefore);
    ClockTime late = FromU64(h.Now() + 50 * kMs);
    EXPECT_EQ(quelta_iTSC_SetCallbackTime(&late, 0), 1u);
    EXPECT_EQ(gMonotonicCallbackTime.Load(), ToU64(late));
}

// Three equal deadlines queued into an empty list, one earlier and one later:
// a pass exactly at the equal deadline finds them due (a deadline equal to
// now is due) and fires them in list order, the equal ones in the order they
// arrived; the later one stays and is folded into the arming.
TEST_F(SchedulerTest, ExpiredNodesFireInListOrderAndTheNextIsFolded) {
    const uint64_t now = h.Now();
    WaitNode* x = h.Take();
    WaitNode* y = h.Take();
    WaitNode* z = h.Take();
    WaitNode* a = h.Take();
    WaitNode* d = h.Take();
    ASSERT_EQ(Queue(x, now + 300, 1), 0u);
    ASSERT_EQ(Queue(y, now + 300, 2), 0u);
    ASSERT_EQ(Queue(z, now + 300, 3), 0u);
    ASSERT_EQ(Queue(a, now + 100, 4), 0u);
    ASSERT_EQ(Queue(d, now + 600000, 5), 0u);
    EXPECT_EQ(ListOrder(), (std::vector<WaitNode*>{a, x, y, z, d}));
    h.SetNow(now + 300);
    h.Pass();
    EXPECT_EQ(gFired, (std::vector<int>{4, 1, 2, 3}));
    EXPECT_EQ(ListOrder(), (std::vector<WaitNode*>{d}));
    EXPECT_EQ(h.timer->LastArmed(), now + 600000);  // earlier than the next tick
    for (WaitNode* n : {x, y, z, a}) {
        EXPECT_EQ(n->fireCount.load(), 1u);
        EXPECT_EQ(n->state.load(), static_cast<uint32_t>(NodeState::kFired));
        ReleaseWaitNode(n);
    }
    ReleaseWaitNode(d);  // cancels the queued wait
    uint32_t freeCount = 0;
    EXPECT_TRUE(AuditWaitNodes(&freeCount, nullptr, nullptr));
    EXPECT_EQ(freeCount, kWaitNodeCount);
}

TEST_F(SchedulerTest, ReleaseDecisionComesFromTheCallbackOrAutoRelease) {
    const uint64_t now = h.Now();
    WaitNode* keep = h.Take();
    WaitNode* back = h.Take();
    WaitNode* plain = h.Take();
    keep->autoRelease.store(0);
    back->autoRelease.store(0);
    plain->autoRelease.store(1);
    Queue(keep, now + 1, 1);
    gReleaseDecision = 0;
    h.SetNow(now + 2);
    h.Pass();
    gReleaseDecision = 1;
    Queue(back, now + 3, 2);
    Queue(plain, now + 3, 3, nullptr);
    h.SetNow(now + 4);
    h.Pass();
    EXPECT_EQ(keep->state.load(), static_cast<uint32_t>(NodeState::kFired));
    EXPECT_EQ(back->state.load(), static_cast<uint32_t>(NodeState::kFree));
    EXPECT_EQ(plain->state.load(), static_cast<uint32_t>(NodeState::kFree));
    ReleaseWaitNode(keep);
    uint32_t freeCount = 0, queued = 0, held = 0;
    EXPECT_TRUE(AuditWaitNodes(&freeCount, &queued, &held));
    EXPECT_EQ(freeCount, kWaitNodeCount);
}

TEST_F(SchedulerTest, InsertArmsOnlyForANewEarliestDeadline) {
    const uint64_t now = h.Now();
    const size_t armed0 = h.timer->armed.size();
    WaitNode* late = h.Take();
    Queue(late, now + 5 * kMs, 1);  // later than the next tick: no arming
    EXPECT_EQ(h.timer->armed.size(), armed0);
    WaitNode* early = h.Take();
    Queue(early, now + 200000, 2);
    EXPECT_EQ(h.timer->LastArmed(), now + 200000);
    EXPECT_EQ(gNextDeadline.Load(), now + 200000);
    WaitNode* never = h.Take();
    ClockTime n = kNeverTime;
    InsertWaitNode(never, &n, nullptr, nullptr);
    WaitNode* first = h.Take();
    Queue(first, 0xFFFFFFFF00000000ull, 3);  // high word 0xFFFFFFFF: before every time
    EXPECT_EQ(ListOrder(), (std::vector<WaitNode*>{first, early, late, never}));
    // Armed as already past, not for a time decades ahead.
    EXPECT_EQ(h.timer->LastArmed(), 0u);
    EXPECT_EQ(h.timer->expireNowCalls, 0);
    h.Pass();  // fires at the next pass
    EXPECT_EQ(gFired, (std::vector<int>{3}));
}

TEST_F(SchedulerTest, InsertWithoutTimerIsRefusedAndLeavesTheListAlone) {
    const uint64_t now = h.Now();
    WaitNode* queued = h.Take();
    Queue(queued, now + 500000, 1);
    h.RemoveTimer();
    WaitNode* held = h.Take();
    held->autoRelease.store(0);
    EXPECT_EQ(Queue(held, now + 100, 2), 1u);
    EXPECT_EQ(held->state.load(), static_cast<uint32_t>(NodeState::kHeld));
    WaitNode* autoNode = h.Take();
    autoNode->autoRelease.store(1);
    EXPECT_EQ(Queue(autoNode, now + 100, 3), 1u);
    EXPECT_EQ(gFreeList.load(), autoNode);  // straight back to the pool
    WaitNode* behind = h.Take();  // would not be the earliest: refused all the same
    behind->autoRelease.store(0);
    EXPECT_EQ(Queue(behind, now + 900000, 4), 1u);
    EXPECT_EQ(ListOrder(), (std::vector<WaitNode*>{queued}));
    ReleaseWaitNode(behind);
    ReleaseWaitNode(held);
    ReleaseWaitNode(queued);
    uint32_t freeCount = 0;
    EXPECT_TRUE(AuditWaitNodes(&freeCount, nullptr, nullptr));
    EXPECT_EQ(freeCount, kWaitNodeCount);
}

TEST_F(SchedulerTest, BadReleasesAreRefusedWithoutCorruptingTheLists) {
    WaitNode* fresh = gFreeList.load();
    ReleaseWaitNode(fresh);  // never taken: nothing happens
    WaitNode* n = h.Take();
    ReleaseWaitNode(n);
    ReleaseWaitNode(n);  // twice: refused
    WaitNode foreign{};
    ReleaseWaitNode(&foreign);
    ReleaseWaitNode(reinterpret_cast<WaitNode*>(reinterpret_cast<char*>(n) + 4));
    uint32_t freeCount = 0;
    EXPECT_TRUE(AuditWaitNodes(&freeCount, nullptr, nullptr));
    EXPECT_EQ(freeCount, kWaitNodeCount);
}

TEST_F(SchedulerTest, PoolExhaustionAndUnstartedSystemRefuse) {
    std::vector<WaitNode*> taken;
    while (WaitNode* n = h.Take()) taken.push_back(n);
    EXPECT_EQ(taken.size(), kWaitNodeCount);
    ClockTime d = FromU64(h.Now() + kMs);
    EXPECT_EQ(quelta_iTSCEvent_Wait_Callback_C(nullptr, &d, RecordFire, nullptr, 0, nullptr), 3u);
    for (WaitNode* n : taken) ReleaseWaitNode(n);
    gEventSystemReady.store(0);
    EXPECT_EQ(quelta_iTSCEvent_Wait_Callback_C(nullptr, &d, RecordFire, nullptr, 0, nullptr), 3u);
    gEventSystemReady.store(1);
}

TEST_F(SchedulerTest, TickCallbackRegistrationAndControlFlag) {
    iKPusTimingEngine* e = gEngine.load();
    e->RegisterTickCallback(RecordTick);
    EXPECT_EQ(gTickCallback.load(), &RecordTick);
    e->UnregisterTickCallback(nullptr);  // wrong function: cleared all the same
    EXPECT_EQ(gTickCallback.load(), nullptr);
    e->SetControlFlag(1);
    EXPECT_EQ(gControlFlag.load(), 1u);
    e->SetControlFlag(3);
    EXPECT_EQ(gControlFlag.load(), 1u);
    e->SetControlFlag(2);
    EXPECT_EQ(gControlFlag.load(), 0u);
}

// NeverTime is one value: a time whose low word alone is 0xFFFFFFFF, or whose
// high word alone is 0xFFFFFFFE, is an ordinary time, armed for (not expired
// at once) and fired like any other; so is a tick in that range.
TEST_F(SchedulerTest, NeverTimeIsRecognisedOnlyWhenBothWordsMatch) {
    for (uint64_t t : {0x00000005FFFFFFFFull, 0xFFFFFFFE00000005ull}) {
        SCOPED_TRACE(t);
        gFired.clear();
        MoveTo(t - 400000);
        h.Pass();
        EXPECT_EQ(h.timer->LastArmed(), t + 600000) << "the next tick was not armed";
        const int expiredAtOnce = h.timer->expireNowCalls;
        WaitNode* n = h.Take();
        ASSERT_EQ(Queue(n, t, 7), 0u);
        EXPECT_EQ(h.timer->LastArmed(), t);
        EXPECT_EQ(h.timer->expireNowCalls, expiredAtOnce);
        h.SetNow(t);
        h.Pass();
        EXPECT_EQ(gFired, std::vector<int>{7});
        ReleaseWaitNode(n);
    }
}

// A NeverTime global callback time is no time: it is neither converted to
// the monotonic clock nor folded into the next arming. With an epoch offset
// of 100 s, NeverTime taken for a time would read as one 100 s before it on
// the monotonic clock; the clock stands just before that here, so such a
// time would be armed ahead of the next tick.
TEST_F(SchedulerTest, NeverTimeGlobalCallbackTimeIsNeitherConvertedNorFolded) {
    gEngine.load()->SetEpochOffset(100);
    MoveTo(kNeverTime64 - 100 * 1000 * kMs - 400000);
    quelta_iTSC_SetCallback(RecordCallback, nullptr);
    const size_t armed = h.timer->armed.size();
    const ClockTime never = kNeverTime;
    EXPECT_EQ(quelta_iTSC_SetCallbackTime(&never, -1), 1u);
    EXPECT_EQ(h.timer->armed.size(), armed) << "armed for a cancelled callback time";
    EXPECT_TRUE(IsNever(gGlobalCallbackTime.Load()));
    h.Pass();
    EXPECT_EQ(h.timer->LastArmed(), h.Now() + kMs) << "a cancelled callback time was folded";
    EXPECT_TRUE(gCalls.empty());
}

// The jitter samples fill an array of 1000: the last sample goes to index
// 999; a count at the end, or below 0, records nothing, and nothing is ever
// written beside the array (the statistics fields just before and after it).
TEST_F(SchedulerTest, JitterSamplesStayInsideTheirArray) {
    auto* engine = gEngine.load();
    engine->stats.globalReadExtra.store(0x5A5A5A5Au);
    engine->stats.rawReadSamples[0].store(0xA5A5A5A5u);
    engine->statsEnabled.store(1);
    for (int32_t count : {999, 1000, -1}) {
        engine->statsCount.store(count);
        h.SetNow(gNextTick.Load() + 123);
        h.Pass();
        EXPECT_EQ(engine->statsCount.load(), count == 999 ? 1000 : count);
    }
    EXPECT_EQ(engine->stats.jitterSamples[999].load(), 123u);
    EXPECT_EQ(engine->stats.rawReadSamples[0].load(), 0xA5A5A5A5u);
    EXPECT_EQ(engine->stats.globalReadExtra.load(), 0x5A5A5A5Au);
}

// A new generation of the global clock (no operation of the library makes
// one; the test stores it) fires every abortable global-clock node at once,
// whatever its deadline. A global node that is not abortable and an
// abortable monotonic one stay queued. The change is seen once: a node
// queued after it is not fired by the passes that follow.
TEST_F(SchedulerTest, ANewGenerationFiresOnlyAbortableGlobalNodesOnce) {
    const uint32_t saved = gGeneration.load();
    h.Pass();  // the routine's first pass notes the generation
    const uint64_t far = h.Now() + 3600 * 1000 * kMs;
    auto queue = [&](uint32_t isGlobal, uint8_t abortable, int tag) {
        WaitNode* n = h.Take();
        n->isGlobal.store(isGlobal);
        n->abortable.store(abortable);
        EXPECT_EQ(Queue(n, far, tag), 0u);
        return n;
    };
    WaitNode* aborted = queue(1, 1, 1);
    WaitNode* global = queue(1, 0, 2);
    WaitNode* monotonic = queue(0, 1, 3);
    gGeneration.store(saved + 1);
    h.SetNow(h.Now() + 1000);
    h.Pass();
    EXPECT_EQ(gFired, std::vector<int>{1});
    WaitNode* later = queue(1, 1, 4);
    h.SetNow(h.Now() + 1000);
    h.Pass();
    EXPECT_EQ(gFired, std::vector<int>{1}) << "an old change of generation fired a new wait";
    EXPECT_EQ(ListOrder(), (std::vector<WaitNode*>{global, monotonic, later}));
    for (WaitNode* n : {aborted, global, monotonic, later}) ReleaseWaitNode(n);
    gGeneration.store(saved);
    uint32_t freeCount = 0;
    EXPECT_TRUE(AuditWaitNodes(&freeCount, nullptr, nullptr));
    EXPECT_EQ(freeCount, kWaitNodeCount);
}

}  // namespace
