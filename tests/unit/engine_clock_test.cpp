// The timing engine's clock reads and units. Reads on a fake kernel clock:
// the epoch offset, the kernel's 64-bit seconds, what a failed read
// yields, the last-read cells under concurrent readers (which clock each slot
// reads is checked by slot position in the vtable test). Units: slot 21
// against its defining formula evaluated in full 128-bit arithmetic, slot 22
// against exact division, slots 19 and 20 against wrapping multiplication.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <random>
#include <thread>

#include "engine_test_helpers.h"

using namespace enginetest;

namespace {

constexpr int32_t kEpoch1904 = 2082844800;

// floor((x * 4294967 + H * 1271310319 + 2^31) / 2^32), H the high word of x,
// with a 128-bit intermediate built from 64-bit halves (the 32-bit target has
// no 128-bit type). False when the quotient would not fit in 64 bits.
bool ReferenceClocksToMicroseconds(uint64_t x, uint64_t& out) {
    struct U128 {
        uint64_t hi, lo;
        void Add(uint64_t b) {
            lo += b;
            if (lo < b) ++hi;
        }
    };
    const uint32_t h = static_cast<uint32_t>(x >> 32);
    const uint64_t high = (x >> 32) * 4294967u;  // weight 2^32
    U128 v{high >> 32, high << 32};
    v.Add((x & 0xFFFFFFFFu) * 4294967u);
    v.Add(static_cast<uint64_t>(h) * 1271310319u);
    v.Add(0x80000000u);
#ifdef __SIZEOF_INT128__
    // Cross-check the decomposition itself where a native type exists.
    const unsigned __int128 n = static_cast<unsigned __int128>(x) * 4294967u +
                                static_cast<unsigned __int128>(h) * 1271310319u + 0x80000000u;
    EXPECT_EQ(static_cast<uint64_t>(n >> 64), v.hi);
    EXPECT_EQ(static_cast<uint64_t>(n), v.lo);
#endif
    if ((v.hi >> 32) != 0) return false;
    out = (v.hi << 32) | (v.lo >> 32);
    return true;
}

class EngineClockTest : public ::testing::Test {
protected:
    void TearDown() override { delete engine; }
    uint64_t Read(void (iKPusTimingEngine::*slot)(ClockTime&)) {
        ClockTime t{0xDEAD, 0xBEEF};
        (e->*slot)(t);
        return U64(t);
    }
    uint64_t Us64(uint64_t ns) { return U64(e->ClocksToMicroseconds64(CT(ns))); }

    EngineSeamGuard seams;
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;
};

TEST_F(EngineClockTest, FreshEngineReadsZeroEverywhere) {
    EXPECT_EQ(Read(&iKPusTimingEngine::LoadLastMonotonic), 0u);
    EXPECT_EQ(Read(&iKPusTimingEngine::LoadLastGlobal), 0u);
    uint32_t block[3004];
    e->CopyStatistics(block, 1);
    for (uint32_t w : block) ASSERT_EQ(w, 0u);
}

// The results are (offset + sec) * 1e9 + nsec with the kernel's 64-bit
// seconds; wherever the seconds fit in 31 bits that is bit for bit the
// formula on 32-bit kernel fields, sign-extended.
uint64_t Formula32(int32_t offset, int32_t sec, int32_t nsec) {
    return (static_cast<uint64_t>(static_cast<int64_t>(offset)) + static_cast<uint64_t>(static_cast<int64_t>(sec))) *
               kNs +
           static_cast<uint64_t>(static_cast<int64_t>(nsec));
}

TEST_F(EngineClockTest, ExactArithmeticWithTheOffsetAnd64BitSeconds) {
    UseFakeClock();
    const struct {
        timespec kernel;
        int32_t offset;
        uint64_t want;
    } global[] = {
        {Ts(1700000000, 123456789), kEpoch1904, Formula32(kEpoch1904, 1700000000, 123456789)},
        {Ts(1700000000, 123456789), -1000, Formula32(-1000, 1700000000, 123456789)},
        {Ts(5, 250), -10, Formula32(-10, 5, 250)},  // before the clock's zero: wraps
        {Ts(0x7FFFFFFF, 999999999), kEpoch1904, Formula32(kEpoch1904, 0x7FFFFFFF, 999999999)},
        // Past 2038-01-19 the seconds go on instead of turning negative.
        {Ts(0x80000000ll, 0), kEpoch1904, (0x80000000ull + 2082844800u) * kNs},
        {Ts(4102444800ll, 5), kEpoch1904, (4102444800ull + 2082844800u) * kNs + 5},  // 2100
    };
    for (const auto& c : global) {
        gFake.realtime = c.kernel;
        engine->SetEpochOffset(c.offset);
        EXPECT_EQ(Read(&iKPusTimingEngine::ReadGlobal6), c.want) << c.offset << " " << c.kernel.tv_sec;
    }
    const struct {
        timespec kernel;
        uint64_t want;
    } monotonic[] = {
        {Ts(86400, 5), 86400 * kNs + 5},
        {Ts(0x80000000ll, 0), 2147483648ull * kNs},
        {Ts(0x100000005ll, 7), 0x100000005ull * kNs + 7},
    };
    for (const auto& c : monotonic) {
        gFake.monotonic = c.kernel;
        EXPECT_EQ(Read(&iKPusTimingEngine::ReadMonotonic0), c.want);
    }
    gFake.raw = Ts(86399, 999999999);
    EXPECT_EQ(Read(&iKPusTimingEngine::ReadRaw8), 86400 * kNs - 1);
}

TEST_F(EngineClockTest, FailedReadYieldsLastRecordedValueOrZeroForRaw) {
    UseFakeClock();
    gFake.monotonic = Ts(10, 1);
    gFake.realtime = Ts(20, 2);
    gFake.raw = Ts(30, 3);
    gFake.failReads = true;  // before any good read: the cells' 0
    EXPECT_EQ(Read(&iKPusTimingEngine::ReadMonotonic4), 0u);
    gFake.failReads = false;
    Read(&iKPusTimingEngine::ReadMonotonic4);
    Read(&iKPusTimingEngine::ReadGlobal6);

    gFake.failReads = true;
    gFake.monotonic = Ts(99, 0);  // would be read if the call succeeded
    EXPECT_EQ(Read(&iKPusTimingEngine::ReadMonotonic5), 10 * kNs + 1);
    EXPECT_EQ(Read(&iKPusTimingEngine::LoadLastMonotonic), 10 * kNs + 1);
    EXPECT_EQ(Read(&iKPusTimingEngine::ReadGlobal3), 20 * kNs + 2);
    EXPECT_EQ(Read(&iKPusTimingEngine::LoadLastGlobal), 20 * kNs + 2);
    EXPECT_EQ(Read(&iKPusTimingEngine::ReadRaw9), 0u);
}

// Two readers store values that differ in both words; a torn store or load
// would show a mix of them in the cell. Only a 32-bit target can tear a
// 64-bit word (two 32-bit stores), so only there can the test fail.
#if UINTPTR_MAX == 0xFFFFFFFFu
TEST_F(EngineClockTest, LastReadCellIsNeverTorn) {
    constexpr uint64_t kA = 0x00000000FFFFFFFFull, kB = 0x0000000100000000ull;
    static std::atomic<int> which{0};
    quelta::gSystemClock.getTime = [](clockid_t, timespec* ts) {
        const uint64_t v = which.fetch_add(1, std::memory_order_relaxed) % 2 ? kA : kB;
        *ts = Ts(static_cast<int64_t>(v / kNs), static_cast<long>(v % kNs));
        return 0;
    };
    Read(&iKPusTimingEngine::ReadMonotonic0);
    std::atomic<bool> stop{false};
    auto reader = [&] {
        ClockTime t;
        while (!stop.load(std::memory_order_relaxed)) e->ReadMonotonic1(t);
    };
    std::thread r1(reader), r2(reader);
    int torn = 0;
    for (int i = 0; i < 200000; ++i) {
        const uint64_t v = Read(&iKPusTimingEngine::LoadLastMonotonicFwd);
        if (v != kA && v != kB) ++torn;
    }
    stop.store(true);
    r1.join();
    r2.join();
    EXPECT_EQ(torn, 0);
}
#endif

TEST_F(EngineClockTest, UnitExamples) {
    const struct {
        uint64_t ns, us;
    } toUs64[] = {
        {0, 0},       {499, 0},     {500, 0}, {501, 1}, {1000, 1}, {1500, 1}, {1501, 2}, {4294967295ull, 4294967},
        {4294967795ull, 4294968}, {14510501ull, 14510}, {0xFFFFFFFFFFFFFFFFull, 18446744073709551ull},
    };
    for (const auto& c : toUs64) EXPECT_EQ(Us64(c.ns), c.us) << c.ns;
    EXPECT_EQ(e->ClocksToMicroseconds32(999), 0u);
    EXPECT_EQ(e->ClocksToMicroseconds32(1000), 1u);
    EXPECT_EQ(e->ClocksToMicroseconds32(0xFFFFFFFFu), 4294967u);
    EXPECT_EQ(e->MicrosecondsToClocks32(4294968u), 704u);  // wraps modulo 2^32
    EXPECT_EQ(e->MicrosecondsToClocks32(4294967u), 4294967000u);
    EXPECT_EQ(U64(e->MicrosecondsToClocks64(CT(0x0123456789ABCDEFull))), 0x71C71C71C71C6D98ull);
    EXPECT_EQ(U64(e->MicrosecondsToClocks64(CT(4294967296ull))), 4294967296000ull);
}

// Everywhere: the formula, within (-1.5, +0.5] us of the exact quotient; below
// 14,510,501 ns exactly x / 1000 rounded to nearest, ties down.
TEST_F(EngineClockTest, ClocksToMicroseconds64MatchesItsFormulaEverywhere) {
    uint32_t bad = 0;
    auto check = [&](uint64_t x) {
        uint64_t ref = 0;
        ASSERT_TRUE(ReferenceClocksToMicroseconds(x, ref)) << x;
        const uint64_t got = Us64(x);
        const int64_t d = static_cast<int64_t>(got * 1000 - x);
        const bool ok = got == ref && d > -1500 && d <= 500 && (x >= 14510501u || got == (x + 499) / 1000);
        if (!ok && ++bad < 5) ADD_FAILURE() << "x=" << x << " got " << got << " want " << ref;
    };
    for (uint64_t x = 0; x < 14510501u; x += 7) check(x);
    for (uint64_t x = 14509000; x < 14510501u; ++x) check(x);
    // Around every power of two and below the top, where carries happen.
    for (int bit = 0; bit < 64; ++bit) {
        const uint64_t p = uint64_t(1) << bit;
        for (uint64_t delta = 0; delta < 2002; ++delta) {
            check(p + delta - 1001);
            check(p - 1 - delta);
        }
    }
    for (uint64_t delta = 0; delta < 100000; ++delta) check(~uint64_t(0) - delta);
    // Random inputs: the full range, and each magnitude equally often.
    std::mt19937_64 rng(0x5EED1234u);
    for (int i = 0; i < 1500000; ++i) {
        const uint64_t r = rng();
        check(r);
        check(r >> (r % 64));
    }
    EXPECT_EQ(bad, 0u);
}

TEST_F(EngineClockTest, ClocksToMicroseconds32IsExactDivision) {
    uint32_t bad = 0;
    auto check = [&](uint64_t x) {
        const uint32_t v = static_cast<uint32_t>(x);
        if (e->ClocksToMicroseconds32(v) != v / 1000u && ++bad < 5) ADD_FAILURE() << v;
    };
    // An odd stride visits all residues mod 1000; the ends of the range are
    // where a reciprocal's error is largest.
    for (uint64_t x = 0; x <= 0xFFFFFFFFu; x += 4099) check(x);
    for (uint64_t k = 4294000; k <= 4294967; ++k) {
        check(k * 1000 - 1);
        check(k * 1000);
    }
    for (uint64_t x = 0; x < 200000; ++x) {
        check(x);
        check(0xFFFFFFFFu - x);
    }
    EXPECT_EQ(bad, 0u);
}

TEST_F(EngineClockTest, MicrosecondsToClocksWrapLikeTheIntegers) {
    std::mt19937_64 rng(42);
    for (int i = 0; i < 200000; ++i) {
        const uint64_t x = rng();
        ASSERT_EQ(U64(e->MicrosecondsToClocks64(CT(x))), x * 1000u) << x;
        const uint32_t y = static_cast<uint32_t>(x);
        ASSERT_EQ(e->MicrosecondsToClocks32(y), y * 1000u) << y;
    }
}

}  // namespace
