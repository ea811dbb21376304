// 64-bit multiplication and division on ClockTime records from 32-bit
// operations only. On the 32-bit target a plain 64-bit division would call the
// runtime's division routine; these stay within shifts, adds and compares,
// with a bounded number of steps (31 adds, 64 subtracts).
#include "engine/U64Arith.h"

namespace quelta {

namespace {

// A 64-bit quantity as two 32-bit words, with the few operations the long
// division needs.
struct Words {
    uint32_t low;
    uint32_t high;
};

inline bool IsZero(const Words& a) { return (a.low | a.high) == 0; }

// Plain unsigned 64-bit a > b.
inline bool Above(const Words& a, const Words& b) {
    return a.high > b.high || (a.high == b.high && a.low > b.low);
}

inline Words ShiftLeft(const Words& a, uint32_t bits) {  // bits 0..63
    if (bits == 0) return a;
    if (bits >= 32) return Words{0, a.low << (bits - 32)};
    return Words{a.low << bits, (a.high << bits) | (a.low >> (32 - bits))};
}

inline Words ShiftLeftOne(const Words& a) {
    return Words{a.low << 1, (a.high << 1) | (a.low >> 31)};
}

inline Words ShiftRightOne(const Words& a) {
    return Words{(a.low >> 1) | (a.high << 31), a.high >> 1};
}

inline Words Subtract(const Words& a, const Words& b) {
    const uint32_t borrow = a.low < b.low ? 1u : 0u;
    return Words{a.low - b.low, a.high - b.high - borrow};
}

// Number of significant bits of a 32-bit word (0 for 0), by halving.
inline uint32_t BitLength32(uint32_t x) {
    uint32_t n = 0;
    if (x >> 16) { n += 16; x >>= 16; }
    if (x >> 8) { n += 8; x >>= 8; }
    if (x >> 4) { n += 4; x >>= 4; }
    if (x >> 2) { n += 2; x >>= 2; }
    if (x >> 1) { n += 1; x >>= 1; }
    return n + x;
}

inline uint32_t BitLength64(const Words& a) {
    return a.high != 0 ? 32 + BitLength32(a.high) : BitLength32(a.low);
}

}  // namespace

void U64MulU32(ClockTime& value, uint32_t multiplier) {
    const uint32_t xLow = value.low;
    const uint32_t xHigh = value.high;
    uint32_t accLow = 0;
    uint32_t accHigh = 0;
    if (multiplier & 1u) {
        accLow = xLow;
        accHigh = xHigh;
    }
    // One add of x << k per further set bit; `rest` is the multiplier shifted
    // right by k, so k never reaches 32.
    uint32_t k = 1;
    for (uint32_t rest = multiplier >> 1; rest != 0; rest >>= 1, ++k) {
        if ((rest & 1u) == 0) continue;
        const uint32_t addLow = xLow << k;
        const uint32_t addHigh = (xHigh << k) | (xLow >> (32 - k));
        accLow += addLow;
        accHigh += addHigh + (accLow < addLow ? 1u : 0u);
    }
    value.low = accLow;
    value.high = accHigh;
}

void U64DivMod(ClockTime& dividend, ClockTime& divisor) {
    const Words n{dividend.low, dividend.high};
    const Words d{divisor.low, divisor.high};

    // Division by zero and a dividend below the divisor both leave everything
    // in the remainder. In ClockTime order a high word of 0xFFFFFFFF sorts
    // before every other, so such a dividend counts as below any divisor
    // whose high word is not also 0xFFFFFFFF.
    if (IsZero(d) || (n.high == 0xFFFFFFFFu && d.high != 0xFFFFFFFFu) || Above(d, n)) {
        divisor.low = n.low;
        divisor.high = n.high;
        dividend.low = 0;
        dividend.high = 0;
        return;
    }

    // Align the divisor under the dividend's top bit: start one bit short of
    // the bit-length difference, then move up while twice the shifted divisor
    // still fits.
    uint32_t shift = BitLength64(n) - BitLength64(d);
    if (shift != 0) --shift;
    Words shifted = ShiftLeft(d, shift);
    while (!Above(shifted, Subtract(n, shifted))) {
        shifted = ShiftLeftOne(shifted);
        ++shift;
    }

    // Shift and subtract. Every subtraction leaves less than the shifted
    // divisor, so each quotient bit is set at most once.
    Words quotient{0, 0};
    Words rest = n;
    while (!Above(d, rest)) {
        while (Above(shifted, rest)) {
            shifted = ShiftRightOne(shifted);
            --shift;
        }
        rest = Subtract(rest, shifted);
        if (shift >= 32) {
            quotient.high |= uint32_t(1) << (shift - 32);
        } else {
            quotient.low |= uint32_t(1) << shift;
        }
    }

    dividend.low = quotient.low;
    dividend.high = quotient.high;
    divisor.low = rest.low;
    divisor.high = rest.high;
}

}  // namespace quelta
