// Helpers on ClockTime shared by every subsystem: conversion to and from a
// 64-bit integer, NeverTime, and the scheduler's order.
//
// The order: a is earlier than b when (a + 2^32) mod 2^64 < (b + 2^32) mod 2^64,
// unsigned. So a time whose high word is 0xFFFFFFFF comes before every other
// time (0 included) and NeverTime after every other. No time comparison in the
// library is signed; use these helpers everywhere.
#ifndef QUELTA_ENGINE_CLOCKTIMEOPS_H
#define QUELTA_ENGINE_CLOCKTIMEOPS_H

#include <atomic>
#include <cstdint>

#include "quelta/ClockTime.h"

namespace quelta {

constexpr uint64_t kNeverTime64 = 0xFFFFFFFEFFFFFFFFull;
constexpr ClockTime kNeverTime = {QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};

inline constexpr uint64_t ToU64(const ClockTime& t) {
    return (static_cast<uint64_t>(t.high) << 32) | t.low;
}

inline constexpr ClockTime FromU64(uint64_t v) {
    return ClockTime{static_cast<uint32_t>(v), static_cast<uint32_t>(v >> 32)};
}

inline constexpr bool IsNever(const ClockTime& t) {
    return t.low == QUELTA_NEVER_LOW && t.high == QUELTA_NEVER_HIGH;
}

inline constexpr bool IsNever(uint64_t t) { return t == kNeverTime64; }

inline constexpr bool Equal(const ClockTime& a, const ClockTime& b) {
    return a.low == b.low && a.high == b.high;
}

// Key whose plain unsigned order is the ClockTime order.
inline constexpr uint64_t OrderKey(uint64_t t) { return t + (uint64_t(1) << 32); }

// a strictly earlier than b in ClockTime order.
inline constexpr bool Earlier(uint64_t a, uint64_t b) { return OrderKey(a) < OrderKey(b); }
inline constexpr bool Earlier(const ClockTime& a, const ClockTime& b) {
    return Earlier(ToU64(a), ToU64(b));
}

// T is due at now when now is not earlier than T (a time equal to now is due).
inline constexpr bool Due(uint64_t t, uint64_t now) { return !Earlier(now, t); }
inline constexpr bool Due(const ClockTime& t, const ClockTime& now) {
    return Due(ToU64(t), ToU64(now));
}

// Folding T into deadline D: D becomes T when T is strictly earlier.
inline constexpr void Fold(uint64_t t, uint64_t& d) {
    if (Earlier(t, d)) d = t;
}

// A ClockTime shared between threads. Stored as one 64-bit atomic so that no
// reader ever sees one word of an old value with one of a new one (lock-free
// on ARMv7 too: ldrexd/strexd).
class AtomicClockTime {
public:
    constexpr AtomicClockTime() : value_(0) {}
    constexpr explicit AtomicClockTime(uint64_t v) : value_(v) {}
    uint64_t Load(std::memory_order mo = std::memory_order_relaxed) const {
        return value_.load(mo);
    }
    void Store(uint64_t v, std::memory_order mo = std::memory_order_relaxed) {
        value_.store(v, mo);
    }
    bool CompareExchange(uint64_t expected, uint64_t desired) {
        return value_.compare_exchange_strong(expected, desired, std::memory_order_acq_rel,
                                              std::memory_order_relaxed);
    }
    ClockTime LoadTime() const { return FromU64(Load()); }
    void StoreTime(const ClockTime& t) { Store(ToU64(t)); }

private:
    std::atomic<uint64_t> value_;
};

static_assert(std::atomic<uint64_t>::is_always_lock_free,
              "shared ClockTime cells must be lock-free 64-bit atomics");

}  // namespace quelta

#endif
