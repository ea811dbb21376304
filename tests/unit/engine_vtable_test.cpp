// Every slot of the timing engine, called the way the runtime calls it: the
// entry at index k of the raw virtual table, cast to the slot's exact
// function type with the object as first parameter. Each call checks an
// effect only that slot has, so a slot out of place or a changed signature
// shows up as a failure here.
#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/timex.h>

#include <cstring>
#include <new>

#include "SchedulerHarness.h"
#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "engine_test_helpers.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

using namespace enginetest;
using quelta::tKPusTimingEngine;

namespace {

constexpr uint64_t kNs = 1000000000ull;
constexpr uint64_t kMs = 1000000ull;
constexpr int32_t kEpoch = 1000;  // seconds; distinguishes the two bases

// Calls virtual slot k of `e` as a plain function taking the object first.
template <typename R, typename... A>
R Slot(iKPusTimingEngine* e, int k, A... args) {
    using Fn = R (*)(iKPusTimingEngine*, A...);
    void** table = *reinterpret_cast<void***>(e);
    return reinterpret_cast<Fn>(table[k])(e, args...);
}

// Shorthands for the slot shapes.
void Read(iKPusTimingEngine* e, int k, ClockTime& out) { Slot<void, ClockTime&>(e, k, out); }
ClockTime Convert(iKPusTimingEngine* e, int k, uint64_t v) {
    const ClockTime in = CT(v);
    return Slot<ClockTime, const ClockTime&>(e, k, in);
}
uint32_t Convert32(iKPusTimingEngine* e, int k, uint32_t v) { return Slot<uint32_t, const uint32_t&>(e, k, v); }
uint32_t Wait32(iKPusTimingEngine* e, int k, uint32_t v) { return Slot<uint32_t, uint32_t>(e, k, v); }

uint64_t LastMonotonic(iKPusTimingEngine* e) {
    ClockTime t;
    Read(e, 46, t);
    return U64(t);
}
uint64_t LastGlobal(iKPusTimingEngine* e) {
    ClockTime t;
    Read(e, 48, t);
    return U64(t);
}

// Records which of the overridable slots ran; each delegates to the engine.
class SpyEngine : public tKPusTimingEngine {
public:
    uint64_t calls = 0;
    double lastMHz = 0;
    bool* destroyed = nullptr;

    ~SpyEngine() override {
        if (destroyed != nullptr) *destroyed = true;
    }
    void Mark(int slot) { calls |= uint64_t(1) << slot; }
    ClockTime MonotonicToGlobal(const ClockTime& t) override { return Mark(15), tKPusTimingEngine::MonotonicToGlobal(t); }
    ClockTime MonotonicToGlobalImpl(const ClockTime& t) override { return Mark(16), tKPusTimingEngine::MonotonicToGlobalImpl(t); }
    ClockTime GlobalToMonotonic(const ClockTime& t) override { return Mark(17), tKPusTimingEngine::GlobalToMonotonic(t); }
    ClockTime GlobalToMonotonicImpl(const ClockTime& t) override { return Mark(18), tKPusTimingEngine::GlobalToMonotonicImpl(t); }
    ClockTime MicrosecondsToClocks64(const ClockTime& u) override { return Mark(19), tKPusTimingEngine::MicrosecondsToClocks64(u); }
    uint32_t MicrosecondsToClocks32(const uint32_t& u) override { return Mark(20), tKPusTimingEngine::MicrosecondsToClocks32(u); }
    ClockTime ClocksToMicroseconds64(const ClockTime& n) override { return Mark(21), tKPusTimingEngine::ClocksToMicroseconds64(n); }
    uint32_t ClocksToMicroseconds32(const uint32_t& n) override { return Mark(22), tKPusTimingEngine::ClocksToMicroseconds32(n); }
    void LoadLastMonotonic(ClockTime& out) override { Mark(46), tKPusTimingEngine::LoadLastMonotonic(out); }
    void LoadLastGlobal(ClockTime& out) override { Mark(48), tKPusTimingEngine::LoadLastGlobal(out); }
    void SetClockRateMHz(double r) override {
        Mark(56);
        lastMHz = r;
    }
};

uint64_t Bits(std::initializer_list<int> slots) {
    uint64_t m = 0;
    for (int s : slots) m |= uint64_t(1) << s;
    return m;
}

// A fake adjtimex: reads report tick 10000 / freq 0; writes are captured.
struct timex gSetTimex;
int FakeAdjust(struct timex* tx) {
    if (tx->modes == 0) {
        tx->tick = 10000;
        tx->freq = 0;
    } else {
        std::memcpy(&gSetTimex, tx, sizeof *tx);
    }
    return 0;
}
timespec gSetTime;
int FakeSetTime(clockid_t, const timespec* ts) {
    gSetTime = *ts;
    return 0;
}

uint32_t NeverCalled(void*) { return 0; }
int gTickCalls = 0;
void TickFn(uint64_t) { ++gTickCalls; }

class EngineVtableTest : public ::testing::Test {
protected:
    void SetUp() override {
        engine = quelta::gEngine.load();
        engine->SetEpochOffset(kEpoch);
        e = engine;
        savedCpuSpeed = quelta::gCpuSpeed.load();
        quelta::gCpuSpeed.store(1000);
        quelta::gKernelTickRate.store(-1.0);
    }
    void TearDown() override { quelta::gCpuSpeed.store(savedCpuSpeed); }

    EngineSeamGuard seams;
    testsupport::SchedulerHarness harness;  // pool, fake timer, gEngine
    tKPusTimingEngine* engine = nullptr;
    iKPusTimingEngine* e = nullptr;
    uint32_t savedCpuSpeed = 0;
};

TEST_F(EngineVtableTest, Slots0To9ReadTheirClockAndRecordOrNot) {
    for (int k : {0, 1, 4, 5}) {
        SCOPED_TRACE(k);
        const uint64_t globalBefore = LastGlobal(e);
        const uint64_t before = testsupport::MonoNowNs();
        ClockTime t;
        Read(e, k, t);
        EXPECT_GE(U64(t), before);
        EXPECT_LE(U64(t), testsupport::MonoNowNs());
        EXPECT_EQ(LastMonotonic(e), U64(t));
        EXPECT_EQ(LastGlobal(e), globalBefore);
    }
    for (int k : {2, 3, 6, 7}) {
        SCOPED_TRACE(k);
        const uint64_t monoBefore = LastMonotonic(e);
        const uint64_t before = testsupport::RealNowNs() + kEpoch * kNs;
        ClockTime t;
        Read(e, k, t);
        EXPECT_GE(U64(t), before);
        EXPECT_LE(U64(t), testsupport::RealNowNs() + kEpoch * kNs);
        EXPECT_EQ(LastGlobal(e), U64(t));
        EXPECT_EQ(LastMonotonic(e), monoBefore);
    }
    UseFakeClock();
    gFake.raw = Ts(77, 7);
    for (int k : {8, 9}) {
        SCOPED_TRACE(k);
        const uint64_t mono = LastMonotonic(e), global = LastGlobal(e);
        ClockTime t;
        Read(e, k, t);
        EXPECT_EQ(U64(t), 77 * kNs + 7);
        EXPECT_EQ(LastMonotonic(e), mono);
        EXPECT_EQ(LastGlobal(e), global);
    }
}

TEST_F(EngineVtableTest, Slots10To14ConstantsRateAndStep) {
    EXPECT_EQ(U64(Slot<ClockTime>(e, 10)), 1000000000u);

    quelta::gSystemClock.getRes = [](clockid_t id, timespec* ts) {
        ts->tv_sec = 0;
        ts->tv_nsec = id == CLOCK_MONOTONIC_RAW ? 7 : 999;
        return 0;
    };
    EXPECT_EQ(U64(Slot<ClockTime>(e, 11)), 7u);

    quelta::gSystemClock.adjustTime = &FakeAdjust;
    quelta::gSystemClock.clockTicksPerSecond = [] { return 100L; };
    testing::internal::CaptureStdout();
    EXPECT_EQ(Slot<double>(e, 12), 100.0);
    Slot<void, double>(e, 13, 101.0);
    testing::internal::GetCapturedStdout();
    EXPECT_EQ(gSetTimex.modes, 0x4002u);
    EXPECT_EQ(gSetTimex.tick, 10100);

    UseFakeClock();
    gFake.realtime = Ts(1700000000, 0);
    quelta::gSystemClock.setTime = &FakeSetTime;
    const ClockTime back = CT(uint64_t(0) - kNs);
    EXPECT_EQ((Slot<int32_t, const ClockTime&>(e, 14, back)), 0);
    EXPECT_EQ(gSetTime.tv_sec, 1699999999);
    EXPECT_EQ(gSetTime.tv_nsec, 0);
}

TEST_F(EngineVtableTest, Slots15To30ConvertInTheirDirectionAndUnit) {
    // The harness converts by the epoch offset alone.
    for (int k : {15, 16, 23, 24}) EXPECT_EQ(U64(Convert(e, k, 5 * kNs)), (5 + kEpoch) * kNs) << k;
    for (int k : {17, 18, 25, 26}) EXPECT_EQ(U64(Convert(e, k, (5 + kEpoch) * kNs)), 5 * kNs) << k;
    for (int k : {19, 27}) EXPECT_EQ(U64(Convert(e, k, 0x0123456789ABCDEFull)), 0x71C71C71C71C6D98ull) << k;
    for (int k : {20, 28}) EXPECT_EQ(Convert32(e, k, 4294968u), 704u) << k;
    for (int k : {21, 29}) EXPECT_EQ(U64(Convert(e, k, 1501)), 2u) << k;
    for (int k : {22, 30}) EXPECT_EQ(Convert32(e, k, 1999u), 1u) << k;
}

TEST_F(EngineVtableTest, ForwardingSlotsGoThroughTheVirtualTable) {
    SpyEngine spy;
    iKPusTimingEngine* s = &spy;
    const struct {
        int slot;
        uint64_t reached;
    } cases[] = {
        {15, Bits({15, 16})}, {16, Bits({16})},     {17, Bits({17, 18})}, {18, Bits({18})},
        {23, Bits({15, 16})}, {24, Bits({16})},     {25, Bits({17, 18})}, {26, Bits({18})},
        {27, Bits({19})},     {29, Bits({21})},
    };
    for (const auto& c : cases) {
        spy.calls = 0;
        Convert(s, c.slot, 1234);
        EXPECT_EQ(spy.calls, c.reached) << "slot " << c.slot;
    }
    spy.calls = 0;
    Convert32(s, 28, 5);
    EXPECT_EQ(spy.calls, Bits({20}));
    spy.calls = 0;
    Convert32(s, 30, 5);
    EXPECT_EQ(spy.calls, Bits({22}));

    ClockTime t;
    spy.calls = 0;
    Read(s, 45, t);
    EXPECT_EQ(spy.calls, Bits({46}));
    spy.calls = 0;
    Read(s, 47, t);
    EXPECT_EQ(spy.calls, Bits({48}));

    spy.calls = 0;
    Slot<void, double>(s, 13, 250.0);
    EXPECT_EQ(spy.calls, Bits({56}));
    EXPECT_DOUBLE_EQ(spy.lastMHz, 250.0 / 1e6);
    spy.calls = 0;
    Slot<void, double>(s, 56, 3.5);
    EXPECT_EQ(spy.calls, Bits({56}));
    EXPECT_EQ(spy.lastMHz, 3.5);
}

TEST_F(EngineVtableTest, Slots31And32Statistics) {
    engine->stats.jitterMode.store(0xABCDu);
    engine->stats.jitterSamples[0].store(0x1234u);
    unsigned char buf[24];
    std::memset(buf, 0xA5, sizeof buf);
    Slot<void, void*, uint32_t>(e, 31, buf, 0u);
    uint32_t words[4];
    std::memcpy(words, buf, 16);
    EXPECT_EQ(words[1], 0xABCDu);
    EXPECT_EQ(buf[16], 0xA5);  // header only

    const uint32_t samples[] = {15, 25, 25, 35};
    EXPECT_EQ((Slot<uint32_t, const uint32_t*, uint32_t, uint32_t, uint32_t>(e, 32, samples, 4u, 10u, 100u)), 30u);
}

TEST_F(EngineVtableTest, Slots33To35EventWaitsAndRelease) {
    // 33: a null semaphore is refused; a posted one is taken at once.
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, uint32_t>(e, 33, nullptr, 5u)), 3u);
    ASSERT_NE(quelta::PalInitialize(), 0u);
    PalSemaphore* sem = nullptr;
    ASSERT_EQ(quelta::PalSemaphoreCreate(&sem), 0);
    quelta::PalSemaphorePost(sem);
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, uint32_t>(e, 33, sem, 0xFFFFFFFFu)), 0u);

    // 34: queues a node with a copy of the deadline and hands it out.
    const ClockTime deadline = CT(harness.Now() + 5 * kMs);
    WaitNode* node = nullptr;
    int marker = 0;
    const uint32_t r = Slot<uint32_t, PalSemaphore*, const ClockTime&, QueltaWaitCallbackFn, void*, uint32_t,
                            WaitNode**>(e, 34, sem, deadline, &NeverCalled, &marker, 1u, &node);
    EXPECT_EQ(r, 0u);
    ASSERT_NE(node, nullptr);
    EXPECT_EQ(node->deadline.load(), U64(deadline));
    EXPECT_EQ(node->callbackArg.load(), &marker);
    EXPECT_EQ(node->semaphore.load(), sem);
    EXPECT_EQ(node->isGlobal.load(), 1u);
    uint32_t freeCount = 0, queued = 0, held = 0;
    ASSERT_TRUE(quelta::AuditWaitNodes(&freeCount, &queued, &held));
    EXPECT_EQ(queued, 1u);

    // 35: releasing the queued node cancels it and returns it to the pool.
    Slot<void, WaitNode*>(e, 35, node);
    ASSERT_TRUE(quelta::AuditWaitNodes(&freeCount, &queued, &held));
    EXPECT_EQ(queued, 0u);
    EXPECT_EQ(freeCount, quelta::kWaitNodeCount);
    quelta::PalSemaphoreDestroy(sem);
}

TEST_F(EngineVtableTest, Slots36To38MicrosecondWaits) {
    uint64_t before = testsupport::MonoNowNs();
    uint32_t r = Wait32(e, 36, 2000);  // sleep 2000 us
    uint64_t after = testsupport::MonoNowNs();
    EXPECT_GE(after - before, 2000 * 1000u);
    EXPECT_LE(r - static_cast<uint32_t>(before / 1000), (after - before) / 1000 + 1);

    before = testsupport::MonoNowNs();
    const uint64_t period = 3000;
    const uint32_t multiple = static_cast<uint32_t>((before / 1000 / period + 1) * period);
    r = Wait32(e, 37, static_cast<uint32_t>(period));  // until the next multiple of 3000 us
    after = testsupport::MonoNowNs();
    EXPECT_LE(r - multiple, (after - before) / 1000 + 1) << "woke at the next multiple, not before";
    EXPECT_GE(after / 1000 + 1, (before / 1000 / period + 1) * period);

    before = testsupport::MonoNowNs();
    const uint32_t target = static_cast<uint32_t>(before / 1000 + 1500);
    r = Wait32(e, 38, target);  // until that microsecond
    after = testsupport::MonoNowNs();
    EXPECT_GE(after / 1000 + 1, before / 1000 + 1500);
    EXPECT_LE(r - target, (after - before) / 1000 + 1);

    // A target that has just passed (500 us ago) is not waited for. (Taken
    // as a duration or a period it would mean a long sleep.)
    before = testsupport::MonoNowNs();
    r = Wait32(e, 38, static_cast<uint32_t>(before / 1000 - 500));
    after = testsupport::MonoNowNs();
    EXPECT_LT(after - before, 500 * kMs);
    EXPECT_LE(r - static_cast<uint32_t>(before / 1000), (after - before) / 1000 + 1);
}

TEST_F(EngineVtableTest, Slots39To42ClockWaits) {
    uint64_t before = testsupport::MonoNowNs();
    uint32_t r = Wait32(e, 39, 2 * kMs);  // sleep 2 ms
    uint64_t after = testsupport::MonoNowNs();
    EXPECT_GE(after - before, 2 * kMs);
    EXPECT_LE(r - static_cast<uint32_t>(before), after - before);
    EXPECT_EQ(static_cast<uint32_t>(LastMonotonic(e)), r);

    before = testsupport::MonoNowNs();
    const uint64_t period = 3 * kMs;
    const uint64_t multiple = (before / period + 1) * period;
    r = Wait32(e, 40, static_cast<uint32_t>(period));
    after = testsupport::MonoNowNs();
    EXPECT_GE(after, multiple);
    EXPECT_LE(r - static_cast<uint32_t>(multiple), after - before);

    before = testsupport::MonoNowNs();
    const ClockTime target = CT(before + 1500000);
    r = Slot<uint32_t, const ClockTime*>(e, 41, &target);
    after = testsupport::MonoNowNs();
    EXPECT_GE(after, U64(target));
    EXPECT_LE(r - target.low, after - before);

    before = testsupport::MonoNowNs();
    const uint32_t target32 = static_cast<uint32_t>(before + 1500000);
    r = Wait32(e, 42, target32);
    after = testsupport::MonoNowNs();
    EXPECT_GE(after, before + 1500000);
    EXPECT_LE(r - target32, after - before);

    // A target that has just passed (0.5 ms ago) is not waited for.
    before = testsupport::MonoNowNs();
    r = Wait32(e, 42, static_cast<uint32_t>(before - 500000));
    after = testsupport::MonoNowNs();
    EXPECT_LT(after - before, 500 * kMs);
    EXPECT_LE(r - static_cast<uint32_t>(before), after - before);
}

TEST_F(EngineVtableTest, Slots43To48FlagServiceAndCells) {
    const uint32_t savedFlag = quelta::gControlFlag.load();
    Slot<void, uint32_t>(e, 43, 1u);
    EXPECT_EQ(quelta::gControlFlag.load(), 1u);
    Slot<void, uint32_t>(e, 43, 3u);
    EXPECT_EQ(quelta::gControlFlag.load(), 1u);
    Slot<void, uint32_t>(e, 43, 2u);
    EXPECT_EQ(quelta::gControlFlag.load(), 0u);
    quelta::gControlFlag.store(savedFlag);

    EXPECT_EQ(Slot<uint32_t>(e, 44), 1u);
    engine->serviceMode.store(2);
    EXPECT_EQ(Slot<uint32_t>(e, 44), 0u);
    engine->serviceMode.store(0);

    UseFakeClock();
    gFake.monotonic = Ts(11, 1);
    gFake.realtime = Ts(22, 2);
    ClockTime t;
    e->ReadMonotonic0(t);
    e->ReadGlobal2(t);
    for (int k : {45, 46}) {
        Read(e, k, t);
        EXPECT_EQ(U64(t), 11 * kNs + 1) << k;
    }
    for (int k : {47, 48}) {
        Read(e, k, t);
        EXPECT_EQ(U64(t), (22 + kEpoch) * kNs + 2) << k;
    }
}

TEST_F(EngineVtableTest, Slot49WaitsForTheNext64BitMultiple) {
    const ClockTime zero = CT(0);
    uint64_t before = testsupport::MonoNowNs();
    ClockTime now = Slot<ClockTime, const ClockTime&>(e, 49, zero);  // no wait: the time
    EXPECT_GE(U64(now), before);
    EXPECT_LE(U64(now), testsupport::MonoNowNs());
    EXPECT_EQ(LastMonotonic(e), U64(now));

    const ClockTime period = CT(2 * kMs);
    before = testsupport::MonoNowNs();
    now = Slot<ClockTime, const ClockTime&>(e, 49, period);
    EXPECT_GE(U64(now), (before / (2 * kMs) + 1) * 2 * kMs);
}

TEST_F(EngineVtableTest, Slots50And51DestroyAndDelete) {
    // 50 destroys without freeing: on storage the engine never allocated.
    bool destroyed = false;
    alignas(SpyEngine) unsigned char storage[sizeof(SpyEngine)];
    SpyEngine* placed = ::new (storage) SpyEngine();
    placed->destroyed = &destroyed;
    Slot<void>(placed, 50);
    EXPECT_TRUE(destroyed);

    // 51 destroys and returns the storage.
    destroyed = false;
    SpyEngine* spy = new SpyEngine();
    spy->destroyed = &destroyed;
    Slot<void>(spy, 51);
    EXPECT_TRUE(destroyed);

    // The plain engine's storage goes back to the heap (visible where the
    // allocator's statistics see it; not under a sanitizer's allocator).
    const size_t m0 = mallinfo2().uordblks;
    tKPusTimingEngine* plain = new tKPusTimingEngine();
    const size_t m1 = mallinfo2().uordblks;
    Slot<void>(plain, 51);
    const size_t m2 = mallinfo2().uordblks;
    if (m1 >= m0 + sizeof(tKPusTimingEngine)) {
        EXPECT_GE(m1 - m2, sizeof(tKPusTimingEngine));
    }
}

TEST_F(EngineVtableTest, Slot52GlobalWaitAbortsOnAStaleGeneration) {
    const uint32_t saved = quelta::gGeneration.load();
    quelta::gGeneration.store(5);
    const ClockTime target = CT(0);
    uint32_t abortFlag = 77;
    ClockTime after = CT(0xDEADBEEFull);
    Slot<void, const ClockTime*, uint32_t*, ClockTime*, uint32_t>(e, 52, &target, &abortFlag, &after, 4u);
    EXPECT_EQ(abortFlag, 1u);
    EXPECT_EQ(U64(after), 0xDEADBEEFull);

    // The current generation and a target of 0: no wait, the time after.
    const uint64_t before = testsupport::RealNowNs() + kEpoch * kNs;
    Slot<void, const ClockTime*, uint32_t*, ClockTime*, uint32_t>(e, 52, &target, &abortFlag, &after, 5u);
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_GE(U64(after), before);
    EXPECT_LE(U64(after), testsupport::RealNowNs() + kEpoch * kNs);
    quelta::gGeneration.store(saved);
}

TEST_F(EngineVtableTest, Slot53ReadsGlobalWithGeneration) {
    const uint32_t saved = quelta::gGeneration.load();
    quelta::gGeneration.store(0x600Du);
    ClockTime t = CT(0);
    uint32_t generation = 0;
    const uint64_t before = testsupport::RealNowNs() + kEpoch * kNs;
    Slot<void, ClockTime&, uint32_t&>(e, 53, t, generation);
    EXPECT_EQ(generation, 0x600Du);
    EXPECT_GE(U64(t), before);
    EXPECT_EQ(LastGlobal(e), U64(t));
    quelta::gGeneration.store(saved);
}

TEST_F(EngineVtableTest, Slots54And55TickCallback) {
    Slot<void, QueltaTickCallbackFn>(e, 54, &TickFn);
    EXPECT_EQ(quelta::gTickCallback.load(), &TickFn);
    Slot<void, QueltaTickCallbackFn>(e, 55, &TickFn);
    EXPECT_EQ(quelta::gTickCallback.load(), nullptr);
}

TEST_F(EngineVtableTest, Slot56SetsTheKernelRateInTicksPerMicrosecond) {
    quelta::gSystemClock.adjustTime = &FakeAdjust;
    quelta::gSystemClock.clockTicksPerSecond = [] { return 100L; };
    testing::internal::CaptureStdout();
    Slot<void, double>(e, 56, 50.0 / 1e6);
    testing::internal::GetCapturedStdout();
    EXPECT_EQ(gSetTimex.tick, 5000);
}

}  // namespace
