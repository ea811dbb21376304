// Clock reads of the timing engine, through its virtual slots: which clock
// each slot reads, the epoch offset, the 32-bit view of the kernel's fields,
// the last-read cells, and what a failed read yields.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "engine/tKPusTimingEngine.h"
#include "engine_test_helpers.h"

using namespace enginetest;
using quelta::tKPusTimingEngine;

namespace {

constexpr uint64_t kNs = 1000000000ull;
constexpr int32_t kEpoch1904 = 2082844800;

uint64_t KernelNowNs(clockid_t clock) {
    timespec ts{};
    clock_gettime(clock, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * kNs + static_cast<uint64_t>(ts.tv_nsec);
}

class EngineClockTest : public ::testing::Test {
protected:
    ClockTime LastMonotonic() {
        ClockTime t{1, 1};
        e->LoadLastMonotonic(t);
        return t;
    }
    ClockTime LastGlobal() {
        ClockTime t{1, 1};
        e->LoadLastGlobal(t);
        return t;
    }

    EngineSeamGuard seams;
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;  // the runtime's view: virtual slots only

    void TearDown() override { delete engine; }
};

TEST_F(EngineClockTest, FreshEngineIsAllZero) {
    EXPECT_EQ(U64(LastMonotonic()), 0u);
    EXPECT_EQ(U64(LastGlobal()), 0u);
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
    EXPECT_EQ(engine->statsCount.load(), 0);
    EXPECT_EQ(engine->serviceMode.load(), 0u);
    EXPECT_EQ(engine->epochOffset.load(), 0);
    uint32_t block[3004];
    e->CopyStatistics(block, 1);
    for (uint32_t w : block) ASSERT_EQ(w, 0u);
}

TEST_F(EngineClockTest, EachReadFollowsItsKernelClockAndOnlyMonotonicAndGlobalRecord) {
    engine->SetEpochOffset(kEpoch1904);
    const struct {
        void (iKPusTimingEngine::*slot)(ClockTime&);
        clockid_t clock;
        uint64_t offset;
        int cell;  // 0 monotonic, 1 global, -1 none
    } reads[] = {
        {&iKPusTimingEngine::ReadMonotonic0, CLOCK_MONOTONIC, 0, 0},
        {&iKPusTimingEngine::ReadMonotonic1, CLOCK_MONOTONIC, 0, 0},
        {&iKPusTimingEngine::ReadGlobal2, CLOCK_REALTIME, kEpoch1904 * kNs, 1},
        {&iKPusTimingEngine::ReadGlobal3, CLOCK_REALTIME, kEpoch1904 * kNs, 1},
        {&iKPusTimingEngine::ReadMonotonic4, CLOCK_MONOTONIC, 0, 0},
        {&iKPusTimingEngine::ReadMonotonic5, CLOCK_MONOTONIC, 0, 0},
        {&iKPusTimingEngine::ReadGlobal6, CLOCK_REALTIME, kEpoch1904 * kNs, 1},
        {&iKPusTimingEngine::ReadGlobal7, CLOCK_REALTIME, kEpoch1904 * kNs, 1},
        {&iKPusTimingEngine::ReadRaw8, CLOCK_MONOTONIC_RAW, 0, -1},
        {&iKPusTimingEngine::ReadRaw9, CLOCK_MONOTONIC_RAW, 0, -1},
    };
    for (size_t i = 0; i < sizeof reads / sizeof reads[0]; ++i) {
        SCOPED_TRACE(i);
        const uint64_t cells[2] = {U64(LastMonotonic()), U64(LastGlobal())};
        const uint64_t before = KernelNowNs(reads[i].clock) + reads[i].offset;
        ClockTime t{};
        const auto slot = reads[i].slot;  // a local: GCC's bounds check misreads reads[i].slot in the call
        (e->*slot)(t);
        EXPECT_GE(U64(t), before);
        EXPECT_LE(U64(t), KernelNowNs(reads[i].clock) + reads[i].offset);
        const uint64_t after[2] = {U64(LastMonotonic()), U64(LastGlobal())};
        for (int c = 0; c < 2; ++c) EXPECT_EQ(after[c], c == reads[i].cell ? U64(t) : cells[c]) << "cell " << c;
    }
}

TEST_F(EngineClockTest, ExactArithmeticOnAFakeClock) {
    UseFakeClock();
    gFake.realtime = Ts(1700000000, 123456789);
    gFake.monotonic = Ts(86400, 5);
    gFake.raw = Ts(86399, 999999999);

    engine->SetEpochOffset(kEpoch1904);
    ClockTime t;
    e->ReadGlobal2(t);
    EXPECT_EQ(U64(t), (uint64_t(kEpoch1904) + 1700000000u) * kNs + 123456789u);
    EXPECT_EQ(U64(t) - 1700000000123456789ull, 2082844800000000000ull) << "exactly the offset in ns";
    e->ReadMonotonic0(t);
    EXPECT_EQ(U64(t), 86400 * kNs + 5);
    e->ReadRaw8(t);
    EXPECT_EQ(U64(t), 86400 * kNs - 1);

    // A negative offset is added with its sign, and a result before the
    // clock's zero wraps like 64-bit two's complement.
    engine->SetEpochOffset(-1000);
    e->ReadGlobal6(t);
    EXPECT_EQ(U64(t), (1700000000u - 1000u) * kNs + 123456789u);
    gFake.realtime = Ts(5, 250);
    engine->SetEpochOffset(-10);
    e->ReadGlobal7(t);
    EXPECT_EQ(U64(t), uint64_t(0) - 5 * kNs + 250);
    EXPECT_EQ(t.high, 0xFFFFFFFEu);
}

TEST_F(EngineClockTest, KernelFieldsAreReadAsSigned32Bit) {
    UseFakeClock();
    ClockTime t;
    // Seconds with bit 31 set are negative, on a 64-bit time_t build as on
    // the 32-bit target.
    gFake.monotonic = Ts(static_cast<time_t>(sizeof(time_t) > 4 ? 0x80000000ll : INT32_MIN), 0);
    e->ReadMonotonic0(t);
    EXPECT_EQ(U64(t), uint64_t(0) - 2147483648ull * kNs);
    if (sizeof(time_t) > 4) {
        // Bits above 32 of a 64-bit tv_sec are dropped.
        gFake.monotonic = Ts(static_cast<time_t>(0x100000005ll), 7);
        e->ReadMonotonic0(t);
        EXPECT_EQ(U64(t), 5 * kNs + 7);
    }
}

TEST_F(EngineClockTest, FailedReadYieldsLastRecordedValueOrZeroForRaw) {
    UseFakeClock();
    gFake.monotonic = Ts(10, 1);
    gFake.realtime = Ts(20, 2);
    gFake.raw = Ts(30, 3);
    ClockTime t{0xDEAD, 0xBEEF};

    gFake.fail = true;  // before any good read: the cells' 0
    e->ReadMonotonic4(t);
    EXPECT_EQ(U64(t), 0u);
    gFake.fail = false;
    ClockTime good;
    e->ReadMonotonic4(good);
    e->ReadGlobal6(good);

    gFake.fail = true;
    gFake.monotonic = Ts(99, 0);  // would be read if the call succeeded
    t = ClockTime{0xDEAD, 0xBEEF};
    e->ReadMonotonic5(t);
    EXPECT_EQ(U64(t), 10 * kNs + 1);
    EXPECT_EQ(U64(LastMonotonic()), 10 * kNs + 1);
    e->ReadGlobal3(t);
    EXPECT_EQ(U64(t), 20 * kNs + 2);
    EXPECT_EQ(U64(LastGlobal()), 20 * kNs + 2);
    t = ClockTime{0xDEAD, 0xBEEF};
    e->ReadRaw9(t);
    EXPECT_EQ(U64(t), 0u);
}

TEST_F(EngineClockTest, RawClockResolutionIsJoinedAndAFailureGivesZero) {
    timespec res{};
    clock_getres(CLOCK_MONOTONIC_RAW, &res);
    EXPECT_EQ(U64(e->GetRawClockResolution()), static_cast<uint64_t>(res.tv_sec) * kNs + res.tv_nsec);

    quelta::gSystemClock.getRes = [](clockid_t, timespec* ts) {
        ts->tv_sec = 2;
        ts->tv_nsec = 3;
        return 0;
    };
    EXPECT_EQ(U64(e->GetRawClockResolution()), 2 * kNs + 3);
    quelta::gSystemClock.getRes = [](clockid_t, timespec*) { return -1; };
    EXPECT_EQ(U64(e->GetRawClockResolution()), 0u);
}

// Two readers store values that differ in both words; a torn store or load
// would show a mix of them in the cell.
TEST_F(EngineClockTest, LastReadCellIsNeverTorn) {
    UseFakeClock();
    constexpr uint64_t kA = 0x00000000FFFFFFFFull;  // 4.294967295 s
    constexpr uint64_t kB = 0x0000000100000000ull;  // 4.294967296 s
    static std::atomic<int> which{0};
    quelta::gSystemClock.getTime = [](clockid_t, timespec* ts) {
        const uint64_t v = which.fetch_add(1, std::memory_order_relaxed) % 2 ? kA : kB;
        ts->tv_sec = static_cast<time_t>(v / kNs);
        ts->tv_nsec = static_cast<long>(v % kNs);
        return 0;
    };
    ClockTime first;
    e->ReadMonotonic0(first);
    std::atomic<bool> stop{false};
    auto reader = [&] {
        ClockTime t;
        while (!stop.load(std::memory_order_relaxed)) e->ReadMonotonic1(t);
    };
    std::thread r1(reader), r2(reader);
    int torn = 0;
    for (int i = 0; i < 200000; ++i) {
        ClockTime t;
        e->LoadLastMonotonicFwd(t);
        const uint64_t v = U64(t);
        if (v != kA && v != kB) ++torn;
    }
    stop.store(true);
    r1.join();
    r2.join();
    EXPECT_EQ(torn, 0);
}

}  // namespace
