// The library's own 64-bit multiply and divide against the compiler's.
#include <gtest/gtest.h>

#include <random>
#include <vector>

#include "engine/ClockTimeOps.h"
#include "engine/U64Arith.h"

namespace quelta {
namespace {

uint64_t Mul(uint64_t x, uint32_t m) {
    ClockTime v = FromU64(x);
    U64MulU32(v, m);
    return ToU64(v);
}

struct DivResult {
    uint64_t quotient;
    uint64_t remainder;
};

DivResult Div(uint64_t n, uint64_t d) {
    ClockTime q = FromU64(n);
    ClockTime r = FromU64(d);
    U64DivMod(q, r);
    return DivResult{ToU64(q), ToU64(r)};
}

// What the division must give, from the compiler's own 64-bit operations and
// the two rules that differ from plain division.
DivResult Reference(uint64_t n, uint64_t d) {
    if (d == 0) return DivResult{0, n};
    if ((n >> 32) == 0xFFFFFFFFu && (d >> 32) != 0xFFFFFFFFu) return DivResult{0, n};
    return DivResult{n / d, n % d};
}

uint64_t ReferenceProduct(uint64_t x, uint32_t m) {
#if defined(__SIZEOF_INT128__)
    return static_cast<uint64_t>(static_cast<unsigned __int128>(x) * m);
#else
    return x * m;  // unsigned: defined to wrap modulo 2^64
#endif
}

// Operands worth crossing with each other: word boundaries, powers of two and
// their neighbours, NeverTime, and the high word that sorts first.
std::vector<uint64_t> BoundaryValues() {
    std::vector<uint64_t> v = {0,
                               1,
                               2,
                               3,
                               7,
                               10,
                               1000,
                               999999,
                               1000000,
                               1000000000,
                               0x7FFFFFFFull,
                               0x80000000ull,
                               0xFFFFFFFFull,
                               0x100000000ull,
                               0x100000001ull,
                               0x1FFFFFFFFull,
                               0x7FFFFFFFFFFFFFFFull,
                               0x8000000000000000ull,
                               0x8000000000000001ull,
                               0xFFFFFFFEFFFFFFFFull,
                               0xFFFFFFFF00000000ull,
                               0xFFFFFFFF00000001ull,
                               0xFFFFFFFF12345678ull,
                               0xFFFFFFFFFFFFFFFEull,
                               0xFFFFFFFFFFFFFFFFull};
    for (int bit = 0; bit < 64; bit += 7) {
        v.push_back((uint64_t(1) << bit) - 1);
        v.push_back(uint64_t(1) << bit);
        v.push_back((uint64_t(1) << bit) + 1);
    }
    return v;
}

// A random value of random bit length, so that quotients of every size occur.
uint64_t RandomOperand(std::mt19937_64& rng) {
    const unsigned bits = static_cast<unsigned>(rng() % 65);
    if (bits == 0) return 0;
    const uint64_t value = rng();
    return bits == 64 ? value : (value & ((uint64_t(1) << bits) - 1));
}

TEST(U64MulU32, DocumentedProducts) {
    EXPECT_EQ(Mul(0x0123456789ABCDEFull, 0), 0u);
    EXPECT_EQ(Mul(0x0123456789ABCDEFull, 1), 0x0123456789ABCDEFull);
    EXPECT_EQ(Mul(0xFFFFFFFFFFFFFFFFull, 3), 0xFFFFFFFFFFFFFFFDull);
    EXPECT_EQ(Mul(0x0123456789ABCDEFull, 1000), 0x71C71C71C71C6D98ull);
    EXPECT_EQ(Mul(0xFFFFFFFFull, 0xFFFFFFFFu), 0xFFFFFFFE00000001ull);
    EXPECT_EQ(Mul(1, 0x80000000u), 0x80000000ull);  // the top multiplier bit alone
    EXPECT_EQ(Mul(0x80000001ull, 0x80000000u), 0x4000000080000000ull);
}

TEST(U64MulU32, MatchesWideMultiplication) {
    const std::vector<uint64_t> values = BoundaryValues();
    for (uint64_t x : values) {
        for (uint64_t m64 : values) {
            const uint32_t m = static_cast<uint32_t>(m64);
            ASSERT_EQ(Mul(x, m), ReferenceProduct(x, m)) << std::hex << x << " * " << m;
        }
    }
    std::mt19937_64 rng(20240611);
    for (int i = 0; i < 200000; ++i) {
        const uint64_t x = RandomOperand(rng);
        const uint32_t m = static_cast<uint32_t>(RandomOperand(rng));
        ASSERT_EQ(Mul(x, m), ReferenceProduct(x, m)) << std::hex << x << " * " << m;
    }
}

TEST(U64DivMod, DocumentedResults) {
    auto expect = [](uint64_t n, uint64_t d, uint64_t q, uint64_t r) {
        const DivResult got = Div(n, d);
        EXPECT_EQ(got.quotient, q) << std::hex << n << " / " << d;
        EXPECT_EQ(got.remainder, r) << std::hex << n << " % " << d;
    };
    expect(10, 0, 0, 10);
    expect(5, 7, 0, 5);
    expect(7, 7, 1, 0);
    expect(5000000007ull, 1000000000ull, 5, 7);
    expect(0xFFFFFFFEFFFFFFFFull, 1000000, 18446744069414ull, 584319);
    expect(0xFFFFFFFF12345678ull, 16, 0, 0xFFFFFFFF12345678ull);
    expect(0x8000000000000000ull, 0x8000000000000001ull, 0, 0x8000000000000000ull);
    expect(0x8000000000000001ull, 0x8000000000000000ull, 1, 1);
    expect(5, 0xFFFFFFFF00000001ull, 0, 5);
    expect(0xFFFFFFFF00000010ull, 0xFFFFFFFF00000001ull, 1, 15);
    // Both high words 0xFFFFFFFF: plain division again.
    expect(0xFFFFFFFFFFFFFFFFull, 0xFFFFFFFF00000000ull, 1, 0xFFFFFFFF);
    // Quotients that need every one of the 64 bits.
    expect(0xFFFFFFFEFFFFFFFFull, 1, 0xFFFFFFFEFFFFFFFFull, 0);
    expect(0x8000000000000000ull, 1, 0x8000000000000000ull, 0);
}

TEST(U64DivMod, MatchesNativeDivision) {
    const std::vector<uint64_t> values = BoundaryValues();
    for (uint64_t n : values) {
        for (uint64_t d : values) {
            const DivResult got = Div(n, d);
            const DivResult want = Reference(n, d);
            ASSERT_EQ(got.quotient, want.quotient) << std::hex << n << " / " << d;
            ASSERT_EQ(got.remainder, want.remainder) << std::hex << n << " % " << d;
        }
    }
    std::mt19937_64 rng(777);
    for (int i = 0; i < 200000; ++i) {
        const uint64_t n = RandomOperand(rng);
        const uint64_t d = RandomOperand(rng);
        const DivResult got = Div(n, d);
        const DivResult want = Reference(n, d);
        ASSERT_EQ(got.quotient, want.quotient) << std::hex << n << " / " << d;
        ASSERT_EQ(got.remainder, want.remainder) << std::hex << n << " % " << d;
    }
}

// The callers' pattern: next multiple = (n / p + 1) * p, divided and multiplied
// back with the two routines, lands on the first multiple strictly above n.
TEST(U64Arith, NextMultipleRoundTrip) {
    std::mt19937_64 rng(99);
    for (int i = 0; i < 50000; ++i) {
        const uint64_t n = rng() >> (1 + rng() % 40);
        const uint32_t p = static_cast<uint32_t>(rng() >> (32 + rng() % 32)) | 1u;
        ClockTime q = FromU64(n);
        ClockTime r = FromU64(p);
        U64DivMod(q, r);
        if (++q.low == 0) ++q.high;
        U64MulU32(q, p);
        const uint64_t next = ToU64(q);
        ASSERT_GT(next, n);
        ASSERT_EQ(next % p, 0u);
        ASSERT_LE(next - n, p);
    }
}

}  // namespace
}  // namespace quelta
