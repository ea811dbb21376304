// The library's own 64-bit multiply and divide against the compiler's.
#include <gtest/gtest.h>

#include <random>
#include <utility>
#include <vector>

#include "engine/ClockTimeOps.h"
#include "engine/U64Arith.h"

namespace quelta {
namespace {

using QR = std::pair<uint64_t, uint64_t>;  // quotient, remainder

uint64_t Mul(uint64_t x, uint32_t m) {
    ClockTime v = FromU64(x);
    return U64MulU32(v, m), ToU64(v);
}

QR Div(uint64_t n, uint64_t d) {
    ClockTime q = FromU64(n), r = FromU64(d);
    U64DivMod(q, r);
    return {ToU64(q), ToU64(r)};
}

// Plain division plus the two rules that differ from it.
QR Reference(uint64_t n, uint64_t d) {
    if (d == 0 || ((n >> 32) == 0xFFFFFFFFu && (d >> 32) != 0xFFFFFFFFu)) return {0, n};
    return {n / d, n % d};
}

TEST(U64Arith, DocumentedExamples) {
    EXPECT_EQ(Mul(0x0123456789ABCDEFull, 0), 0u);
    EXPECT_EQ(Mul(0x0123456789ABCDEFull, 1), 0x0123456789ABCDEFull);
    EXPECT_EQ(Mul(0xFFFFFFFFFFFFFFFFull, 3), 0xFFFFFFFFFFFFFFFDull);
    EXPECT_EQ(Mul(0x0123456789ABCDEFull, 1000), 0x71C71C71C71C6D98ull);

    EXPECT_EQ(Div(10, 0), QR(0, 10));
    EXPECT_EQ(Div(5, 7), QR(0, 5));
    EXPECT_EQ(Div(7, 7), QR(1, 0));
    EXPECT_EQ(Div(5000000007ull, 1000000000ull), QR(5, 7));
    EXPECT_EQ(Div(0xFFFFFFFEFFFFFFFFull, 1000000), QR(18446744069414ull, 584319));
    EXPECT_EQ(Div(0xFFFFFFFF12345678ull, 16), QR(0, 0xFFFFFFFF12345678ull));
    EXPECT_EQ(Div(0x8000000000000000ull, 0x8000000000000001ull), QR(0, 0x8000000000000000ull));
    EXPECT_EQ(Div(0x8000000000000001ull, 0x8000000000000000ull), QR(1, 1));
    EXPECT_EQ(Div(5, 0xFFFFFFFF00000001ull), QR(0, 5));
    EXPECT_EQ(Div(0xFFFFFFFF00000010ull, 0xFFFFFFFF00000001ull), QR(1, 15));
}

// Word boundaries, powers of two and neighbours crossed with each other, then
// random operands of random bit length so that quotients of every size occur.
TEST(U64Arith, MatchesNativeArithmetic) {
    std::vector<uint64_t> values = {0, 3, 10, 999999, 1000000000, 0xFFFFFFFEFFFFFFFFull,
                                    0xFFFFFFFF00000000ull, 0xFFFFFFFF00000001ull};
    for (int bit = 0; bit < 64; bit += 5) {
        for (int delta : {-1, 0, 1}) values.push_back((uint64_t(1) << bit) + delta);
    }
    values.push_back(~uint64_t(0));
    std::mt19937_64 rng(20240611);
    auto random = [&rng] {
        const unsigned bits = static_cast<unsigned>(rng() % 65);
        return bits == 64 ? rng() : rng() & ((uint64_t(1) << bits) - 1);
    };
    std::vector<QR> pairs;
    for (uint64_t a : values) {
        for (uint64_t b : values) pairs.emplace_back(a, b);
    }
    for (int i = 0; i < 200000; ++i) pairs.emplace_back(random(), random());
    for (const auto& [a, b] : pairs) {
        const uint32_t m = static_cast<uint32_t>(b);
        ASSERT_EQ(Mul(a, m), a * m) << std::hex << a << " * " << m;  // unsigned: modulo 2^64
        ASSERT_EQ(Div(a, b), Reference(a, b)) << std::hex << a << " / " << b;
    }
}

}  // namespace
}  // namespace quelta
