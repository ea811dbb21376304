// Every slot of the timing engine, called the way the runtime calls it: entry
// k of the raw virtual table, cast to the slot's function type with the
// object first. Each call checks an effect that sets the slot apart from its
// neighbours, so a slot out of place or a changed signature fails here. The
// per-area tests cover the semantics through the named slots.
#include <gtest/gtest.h>
#include <malloc.h>

#include <algorithm>
#include <cstring>
#include <new>

#include "SchedulerHarness.h"
#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/WaitList.h"
#include "engine_test_helpers.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

using namespace enginetest;

namespace {

constexpr uint64_t kMs = 1000000ull;
constexpr int32_t kEpoch = 1000;  // seconds; tells the global base from the monotonic one

template <typename R, typename... A>
R Slot(iKPusTimingEngine* e, int k, A... args) {
    using Fn = R (*)(iKPusTimingEngine*, A...);
    return reinterpret_cast<Fn>((*reinterpret_cast<void***>(e))[k])(e, args...);
}
uint64_t Read(iKPusTimingEngine* e, int k) {
    ClockTime t{};
    Slot<void, ClockTime&>(e, k, t);
    return U64(t);
}
uint64_t Convert(iKPusTimingEngine* e, int k, uint64_t v) {
    const ClockTime in = CT(v);
    return U64(Slot<ClockTime, const ClockTime&>(e, k, in));
}
uint32_t Convert32(iKPusTimingEngine* e, int k, uint32_t v) { return Slot<uint32_t, const uint32_t&>(e, k, v); }

struct Tracked : tKPusTimingEngine {
    bool* destroyed = nullptr;
    ~Tracked() override { *destroyed = true; }
};

uint32_t NeverCalled(void*) { return 0; }
void TickFn(uint64_t) {}

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
    testsupport::SchedulerHarness harness;  // pool, fake timer, gEngine; converts by the offset alone
    tKPusTimingEngine* engine = nullptr;
    iKPusTimingEngine* e = nullptr;
    uint32_t savedCpuSpeed = 0;
};

// (The real clocks are read by the waits below: 36-42 and 49 against
// CLOCK_MONOTONIC, 52 and 53 against CLOCK_REALTIME.)
TEST_F(EngineVtableTest, ClockReads0To9AndLastReadCells45To48) {
    UseFakeClock();
    uint64_t cells[2] = {Read(e, 46), Read(e, 48)};
    for (int k = 0; k <= 9; ++k) {
        SCOPED_TRACE(k);
        gFake.monotonic = Ts(100 + k, 1);
        gFake.realtime = Ts(200 + k, 2);
        gFake.raw = Ts(300 + k, 3);
        const int kind = k >= 8 ? 2 : (k / 2) % 2;  // 0 monotonic, 1 global, 2 raw
        const uint64_t want[3] = {(100 + k) * kNs + 1, (200 + k + kEpoch) * kNs + 2, (300 + k) * kNs + 3};
        EXPECT_EQ(Read(e, k), want[kind]);
        if (kind < 2) cells[kind] = want[kind];  // raw reads are not recorded
        for (int c : {45, 46}) EXPECT_EQ(Read(e, c), cells[0]) << c;
        for (int c : {47, 48}) EXPECT_EQ(Read(e, c), cells[1]) << c;
    }
}

TEST_F(EngineVtableTest, Slots10To14And56ConstantsRateAndStep) {
    EXPECT_EQ(U64(Slot<ClockTime>(e, 10)), kNs);
    quelta::gSystemClock.getRes = [](clockid_t id, timespec* ts) {
        *ts = Ts(id == CLOCK_MONOTONIC_RAW ? 2 : 9, 3);
        return 0;
    };
    EXPECT_EQ(U64(Slot<ClockTime>(e, 11)), 2 * kNs + 3);
    quelta::gSystemClock.getRes = [](clockid_t, timespec*) { return -1; };
    EXPECT_EQ(U64(Slot<ClockTime>(e, 11)), 0u);

    UseFakeKernel();
    testing::internal::CaptureStdout();
    EXPECT_EQ(Slot<double>(e, 12), 100.0);
    Slot<void, double>(e, 13, 101.0);
    EXPECT_EQ(gFake.lastSet.modes, 0x4002u);
    EXPECT_EQ(gFake.lastSet.tick, 10100);
    Slot<void, double>(e, 56, 50.0 / 1e6);  // ticks per microsecond
    EXPECT_EQ(gFake.lastSet.tick, 5000);
    testing::internal::GetCapturedStdout();

    UseFakeClock();
    gFake.realtime = Ts(1700000000, 0);
    const ClockTime back = CT(uint64_t(0) - kNs);
    EXPECT_EQ((Slot<int32_t, const ClockTime&>(e, 14, back)), 0);
    EXPECT_EQ(gFake.setTimeArg.tv_sec, 1699999999);
    EXPECT_EQ(gFake.setTimeArg.tv_nsec, 0);
}

TEST_F(EngineVtableTest, Slots15To30ConvertInTheirDirectionAndUnit) {
    for (int k : {15, 16, 23, 24}) EXPECT_EQ(Convert(e, k, 5 * kNs), (5 + kEpoch) * kNs) << k;
    for (int k : {17, 18, 25, 26}) EXPECT_EQ(Convert(e, k, (5 + kEpoch) * kNs), 5 * kNs) << k;
    for (int k : {19, 27}) EXPECT_EQ(Convert(e, k, 0x0123456789ABCDEFull), 0x71C71C71C71C6D98ull) << k;
    for (int k : {20, 28}) EXPECT_EQ(Convert32(e, k, 4294968u), 704u) << k;
    for (int k : {21, 29}) EXPECT_EQ(Convert(e, k, 1501), 2u) << k;
    for (int k : {22, 30}) EXPECT_EQ(Convert32(e, k, 1999u), 1u) << k;
}

TEST_F(EngineVtableTest, Slots31And32StatisticsAndHistogram) {
    engine->stats.jitterMode.store(0xABCDu);
    unsigned char buf[24];
    std::fill(buf, buf + sizeof buf, 0xA5);
    Slot<void, void*, uint32_t>(e, 31, buf, 0u);
    uint32_t mode = 0;
    std::memcpy(&mode, buf + 4, 4);
    EXPECT_EQ(mode, 0xABCDu);
    EXPECT_EQ(buf[16], 0xA5);  // the header only

    const uint32_t samples[] = {15, 25, 25, 35};
    EXPECT_EQ((Slot<uint32_t, const uint32_t*, uint32_t, uint32_t, uint32_t>(e, 32, samples, 4u, 10u, 100u)), 30u);
}

TEST_F(EngineVtableTest, Slots33To35EventWaitsAndRelease) {
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, uint32_t>(e, 33, nullptr, 5u)), 3u);  // a null semaphore is refused
    ASSERT_NE(quelta::PalInitialize(), 0u);
    PalSemaphore* sem = nullptr;
    ASSERT_EQ(quelta::PalSemaphoreCreate(&sem), 0);
    quelta::PalSemaphorePost(sem);
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, uint32_t>(e, 33, sem, 0xFFFFFFFFu)), 0u);  // taken at once

    // 34 queues a node with a copy of the deadline and hands it out.
    const ClockTime deadline = CT(harness.Now() + 5 * kMs);
    WaitNode* node = nullptr;
    int marker = 0;
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, const ClockTime&, QueltaWaitCallbackFn, void*, uint32_t, WaitNode**>(
                  e, 34, sem, deadline, &NeverCalled, &marker, 1u, &node)),
              0u);
    ASSERT_NE(node, nullptr);
    EXPECT_EQ(node->deadline.load(), U64(deadline));
    EXPECT_EQ(node->callbackArg.load(), &marker);
    EXPECT_EQ(node->semaphore.load(), sem);
    EXPECT_EQ(node->isGlobal.load(), 1u);
    uint32_t freeCount = 0, queued = 0, held = 0;
    ASSERT_TRUE(quelta::AuditWaitNodes(&freeCount, &queued, &held));
    EXPECT_EQ(queued, 1u);

    // 35 cancels the queued node and returns it to the pool.
    Slot<void, WaitNode*>(e, 35, node);
    ASSERT_TRUE(quelta::AuditWaitNodes(&freeCount, &queued, &held));
    EXPECT_EQ(queued, 0u);
    EXPECT_EQ(freeCount, quelta::kWaitNodeCount);
    quelta::PalSemaphoreDestroy(sem);
}

// 36-38 count microseconds, 39-42 clocks (ns); each returns the time after
// the wait (low 32 bits) and never wakes before its target. A target that has
// just passed is not waited for (as a duration or period it would be long).
TEST_F(EngineVtableTest, Slots36To42WaitForTheirTarget) {
    enum Kind { kFor, kNextMultiple, kUntil };
    const struct {
        int slot;
        uint64_t unitNs;
        Kind kind;
        int64_t amount;
    } cases[] = {
        {36, 1000, kFor, 2000},       {37, 1000, kNextMultiple, 3000}, {38, 1000, kUntil, 1500},
        {38, 1000, kUntil, -500},     {39, 1, kFor, 2000000},          {40, 1, kNextMultiple, 3000000},
        {41, 1, kUntil, 1500000},     {42, 1, kUntil, 1500000},        {42, 1, kUntil, -500000},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.slot);
        const uint64_t slack = c.unitNs == 1 ? 0 : 1;  // microseconds are rounded, not truncated
        const uint64_t before = testsupport::MonoNowNs() / c.unitNs;
        uint64_t target = before + static_cast<uint64_t>(c.amount);
        if (c.kind == kNextMultiple) target = (before / c.amount + 1) * c.amount;
        uint32_t r;
        if (c.slot == 41) {
            const ClockTime t = CT(target);
            r = Slot<uint32_t, const ClockTime*>(e, 41, &t);
        } else {
            r = Slot<uint32_t, uint32_t>(e, c.slot, static_cast<uint32_t>(c.kind == kUntil ? target : c.amount));
        }
        const uint64_t after = testsupport::MonoNowNs() / c.unitNs;
        const uint64_t from = c.amount > 0 ? target : before;
        if (c.amount > 0) {
            EXPECT_GE(after + slack, target);
        } else {
            EXPECT_LT(after - before, 500 * kMs / c.unitNs);
        }
        EXPECT_LE(static_cast<uint32_t>(r - static_cast<uint32_t>(from)), after + slack - from);
        EXPECT_TRUE(c.slot != 39 || static_cast<uint32_t>(Read(e, 46)) == r) << "the wait records the time";
    }
}

TEST_F(EngineVtableTest, Slots43To44And54To55FlagServiceAndTickCallback) {
    const uint32_t savedFlag = quelta::gControlFlag.load();
    Slot<void, uint32_t>(e, 43, 1u);
    EXPECT_EQ(quelta::gControlFlag.load(), 1u);
    Slot<void, uint32_t>(e, 43, 3u);
    EXPECT_EQ(quelta::gControlFlag.load(), 1u);
    Slot<void, uint32_t>(e, 43, 2u);
    EXPECT_EQ(quelta::gControlFlag.load(), 0u);
    quelta::gControlFlag.store(savedFlag);

    EXPECT_EQ(Slot<uint32_t>(e, 44), 1u);
    for (uint32_t mode : {1u, 2u, 0xFFFFFFFFu}) {  // any mode but 0: no tick service
        engine->serviceMode.store(mode);
        EXPECT_EQ(Slot<uint32_t>(e, 44), 0u) << mode;
    }
    engine->serviceMode.store(0);

    Slot<void, QueltaTickCallbackFn>(e, 54, &TickFn);
    EXPECT_EQ(quelta::gTickCallback.load(), &TickFn);
    Slot<void, QueltaTickCallbackFn>(e, 55, &TickFn);
    EXPECT_EQ(quelta::gTickCallback.load(), nullptr);
}

TEST_F(EngineVtableTest, Slot49WaitsForTheNext64BitMultiple) {
    const ClockTime zero = CT(0), period = CT(2 * kMs);
    const uint64_t before = testsupport::MonoNowNs();
    const uint64_t now = U64(Slot<ClockTime, const ClockTime&>(e, 49, zero));  // period 0: no wait, the time
    EXPECT_GE(now, before);
    EXPECT_EQ(Read(e, 46), now);
    EXPECT_GE(U64(Slot<ClockTime, const ClockTime&>(e, 49, period)), (now / (2 * kMs) + 1) * 2 * kMs);
    EXPECT_LE(now, testsupport::MonoNowNs());
}

TEST_F(EngineVtableTest, Slots50And51DestroyAndDelete) {
    // 50 destroys without freeing (were it 51, freeing storage on the stack
    // would abort); 51 destroys and returns the storage.
    bool destroyed = false;
    alignas(Tracked) unsigned char storage[sizeof(Tracked)];
    Tracked* placed = ::new (storage) Tracked();
    placed->destroyed = &destroyed;
    Slot<void>(placed, 50);
    EXPECT_TRUE(destroyed);

    destroyed = false;
    Tracked* heap = new Tracked();
    heap->destroyed = &destroyed;
    Slot<void>(heap, 51);
    EXPECT_TRUE(destroyed);
    // Where the allocator's statistics see it (not under a sanitizer), the
    // storage is back.
    const size_t m0 = mallinfo2().uordblks;
    tKPusTimingEngine* plain = new tKPusTimingEngine();
    const size_t m1 = mallinfo2().uordblks;
    Slot<void>(plain, 51);
    if (m1 >= m0 + sizeof(tKPusTimingEngine)) {
        EXPECT_GE(m1 - mallinfo2().uordblks, sizeof(tKPusTimingEngine));
    }
}

TEST_F(EngineVtableTest, Slots52And53GlobalWaitAndGeneration) {
    const uint32_t saved = quelta::gGeneration.load();
    quelta::gGeneration.store(5);
    const ClockTime target = CT(0);
    uint32_t abortFlag = 77;
    ClockTime after = CT(0xDEADBEEFull);
    Slot<void, const ClockTime*, uint32_t*, ClockTime*, uint32_t>(e, 52, &target, &abortFlag, &after, 4u);
    EXPECT_EQ(abortFlag, 1u) << "a stale generation aborts";
    EXPECT_EQ(U64(after), 0xDEADBEEFull);
    uint64_t before = testsupport::RealNowNs() + kEpoch * kNs;
    Slot<void, const ClockTime*, uint32_t*, ClockTime*, uint32_t>(e, 52, &target, &abortFlag, &after, 5u);
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_GE(U64(after), before);  // target 0: no wait, the time after
    EXPECT_LE(U64(after), testsupport::RealNowNs() + kEpoch * kNs);

    quelta::gGeneration.store(0x600Du);
    ClockTime t = CT(0);
    uint32_t generation = 0;
    before = testsupport::RealNowNs() + kEpoch * kNs;
    Slot<void, ClockTime&, uint32_t&>(e, 53, t, generation);
    EXPECT_EQ(generation, 0x600Du);
    EXPECT_GE(U64(t), before);
    EXPECT_EQ(Read(e, 48), U64(t));
    quelta::gGeneration.store(saved);
}

}  // namespace
