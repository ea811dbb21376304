// The unit slots (clocks <-> microseconds), through the virtual table, and
// their forwarding twins. Slot 21 is checked against its defining formula
// evaluated in full 128-bit arithmetic; slot 22 against exact division.
#include <gtest/gtest.h>

#include <cstdint>
#include <random>

#include "engine/tKPusTimingEngine.h"
#include "engine_test_helpers.h"

using namespace enginetest;
using quelta::tKPusTimingEngine;

namespace {

// floor((x * 4294967 + H * 1271310319 + 2^31) / 2^32) with a 128-bit
// intermediate built from 64-bit halves (the 32-bit target has no 128-bit type).
struct U128 {
    uint64_t hi, lo;
};

U128 Add(U128 a, uint64_t b) {
    U128 r{a.hi, a.lo + b};
    if (r.lo < a.lo) ++r.hi;
    return r;
}

U128 Mul64x32(uint64_t a, uint32_t b) {
    const uint64_t low = (a & 0xFFFFFFFFu) * b;   // < 2^64
    const uint64_t high = (a >> 32) * b;          // < 2^64, weight 2^32
    U128 r{high >> 32, 0};
    r.lo = high << 32;
    return Add(r, low);
}

// Returns false when the quotient would not fit in 64 bits.
bool ReferenceClocksToMicroseconds(uint64_t x, uint64_t& out) {
    const uint32_t h = static_cast<uint32_t>(x >> 32);
    U128 v = Mul64x32(x, 4294967u);
    v = Add(v, static_cast<uint64_t>(h) * 1271310319u);
    v = Add(v, 0x80000000u);
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

class EngineUnitsTest : public ::testing::Test {
protected:
    void TearDown() override { delete engine; }

    uint64_t Us64(uint64_t ns) { return U64(e->ClocksToMicroseconds64(CT(ns))); }
    uint32_t Us32(uint32_t ns) { return e->ClocksToMicroseconds32(ns); }

    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;
};

TEST_F(EngineUnitsTest, ClocksToMicroseconds64Examples) {
    const struct {
        uint64_t ns, us;
    } cases[] = {
        {0, 0},
        {499, 0},
        {500, 0},
        {501, 1},
        {1000, 1},
        {1500, 1},
        {1501, 2},
        {4294967295ull, 4294967},
        {4294967795ull, 4294968},
        {14510501ull, 14510},
        {0xFFFFFFFFFFFFFFFFull, 18446744073709551ull},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(Us64(c.ns), c.us) << c.ns;
        EXPECT_EQ(U64(e->ClocksToMicroseconds64Fwd(CT(c.ns))), c.us) << c.ns;
    }
}

TEST_F(EngineUnitsTest, OtherUnitExamples) {
    EXPECT_EQ(Us32(999), 0u);
    EXPECT_EQ(Us32(1000), 1u);
    EXPECT_EQ(Us32(0xFFFFFFFFu), 4294967u);
    EXPECT_EQ(e->ClocksToMicroseconds32Fwd(0xFFFFFFFFu), 4294967u);

    EXPECT_EQ(e->MicrosecondsToClocks32(4294968u), 704u);  // wraps modulo 2^32
    EXPECT_EQ(e->MicrosecondsToClocks32Fwd(4294968u), 704u);
    EXPECT_EQ(e->MicrosecondsToClocks32(4294967u), 4294967000u);

    EXPECT_EQ(U64(e->MicrosecondsToClocks64(CT(0x0123456789ABCDEFull))), 0x71C71C71C71C6D98ull);
    EXPECT_EQ(U64(e->MicrosecondsToClocks64Fwd(CT(0x0123456789ABCDEFull))), 0x71C71C71C71C6D98ull);
    EXPECT_EQ(U64(e->MicrosecondsToClocks64(CT(4294967296ull))), 4294967296000ull);
}

// Below 14,510,501 the result is x / 1000 rounded to nearest, ties down.
TEST_F(EngineUnitsTest, ClocksToMicroseconds64RoundsToNearestBelowTheBound) {
    uint32_t bad = 0;
    for (uint64_t x = 0; x < 14510501u; x += 7) {
        if (Us64(x) != (x + 499) / 1000 && ++bad < 5) ADD_FAILURE() << x;
    }
    for (uint64_t x = 14509000; x < 14510501u; ++x) {
        if (Us64(x) != (x + 499) / 1000 && ++bad < 5) ADD_FAILURE() << x;
    }
    EXPECT_EQ(bad, 0u);
}

TEST_F(EngineUnitsTest, ClocksToMicroseconds64MatchesItsFormulaEverywhere) {
    std::mt19937_64 rng(0x5EED1234u);
    uint32_t bad = 0;
    uint32_t outOfBounds = 0;
    auto check = [&](uint64_t x) {
        uint64_t ref = 0;
        ASSERT_TRUE(ReferenceClocksToMicroseconds(x, ref)) << x;
        const uint64_t got = Us64(x);
        if (got != ref && ++bad < 5) ADD_FAILURE() << "x=" << x << " got " << got << " want " << ref;
        // Within (-1.5, +0.5] of the exact quotient: 1000*got - x in (-1500, 500].
        const int64_t d = static_cast<int64_t>(got * 1000 - x);
        if ((d <= -1500 || d > 500) && ++outOfBounds < 5) ADD_FAILURE() << "x=" << x << " off by " << d;
    };
    // Boundaries: around every power of two, word edges, multiples of 1000.
    for (int bit = 0; bit < 64; ++bit) {
        const uint64_t p = uint64_t(1) << bit;
        for (uint64_t delta = 0; delta < 2002; ++delta) {
            check(p + delta - 1001);
            check(p - 1 - delta);
        }
    }
    for (uint64_t delta = 0; delta < 100000; ++delta) check(~uint64_t(0) - delta);
    // Random inputs: full range, and each magnitude equally often.
    const int kRandom = 1500000;
    for (int i = 0; i < kRandom; ++i) {
        const uint64_t r = rng();
        check(r);
        check(r >> (r % 64));
    }
    EXPECT_EQ(bad, 0u);
    EXPECT_EQ(outOfBounds, 0u);
}

TEST_F(EngineUnitsTest, ClocksToMicroseconds32IsExactDivision) {
    uint32_t bad = 0;
    auto check = [&](uint32_t x) {
        if (Us32(x) != x / 1000u && ++bad < 5) ADD_FAILURE() << x;
    };
    // Every 4099th value (odd stride: all residues mod 1000 get visited)...
    for (uint64_t x = 0; x <= 0xFFFFFFFFu; x += 4099) check(static_cast<uint32_t>(x));
    // ...and both sides of every 1000-boundary in the top and bottom ranges,
    // where a reciprocal's error is largest.
    for (uint64_t k = 4294000; k <= 4294967; ++k) {
        check(static_cast<uint32_t>(k * 1000 - 1));
        if (k * 1000 <= 0xFFFFFFFFu) check(static_cast<uint32_t>(k * 1000));
    }
    for (uint32_t x = 0; x < 200000; ++x) check(x);
    for (uint32_t d = 0; d < 200000; ++d) check(0xFFFFFFFFu - d);
    EXPECT_EQ(bad, 0u);
}

TEST_F(EngineUnitsTest, MicrosecondsToClocksWrapLikeTheIntegers) {
    std::mt19937_64 rng(42);
    for (int i = 0; i < 200000; ++i) {
        const uint64_t x = rng();
        ASSERT_EQ(U64(e->MicrosecondsToClocks64(CT(x))), x * 1000u) << x;
        const uint32_t y = static_cast<uint32_t>(x);
        ASSERT_EQ(e->MicrosecondsToClocks32(y), y * 1000u) << y;
    }
}

}  // namespace
