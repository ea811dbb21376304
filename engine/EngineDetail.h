// Small helpers shared by the timing engine's source files: the 32-bit view
// of a kernel time point and saturating double-to-integer conversions.
#ifndef QUELTA_ENGINE_ENGINEDETAIL_H
#define QUELTA_ENGINE_ENGINEDETAIL_H

#include <time.h>

#include <cstdint>

#include "engine/SystemClock.h"

namespace quelta {

// The kernel's fields as the library treats them: signed 32-bit seconds and
// nanoseconds. On a build with a 64-bit time_t the seconds are cut to their
// low 32 bits, so every target computes the same results.
inline Timespec32 NarrowTimespec(const timespec& ts) {
    Timespec32 t;
    t.sec = static_cast<int32_t>(static_cast<uint32_t>(ts.tv_sec));
    t.nsec = static_cast<int32_t>(static_cast<uint32_t>(ts.tv_nsec));
    return t;
}

inline timespec WidenTimespec(const Timespec32& t) {
    timespec ts{};
    ts.tv_sec = static_cast<time_t>(t.sec);
    ts.tv_nsec = static_cast<long>(t.nsec);
    return ts;
}

// Truncation toward zero, saturated at the type's limits; NaN gives 0.
inline uint32_t SaturateToU32(double v) {
    if (!(v > 0.0)) return 0;  // also NaN and (-1, 0], which truncate to 0
    if (v >= 4294967296.0) return UINT32_MAX;
    return static_cast<uint32_t>(v);
}

inline int64_t SaturateToI64(double v) {
    if (v != v) return 0;
    if (v >= 9223372036854775808.0) return INT64_MAX;
    if (v <= -9223372036854775808.0) return INT64_MIN;
    return static_cast<int64_t>(v);
}

}  // namespace quelta

#endif
