// Small helpers shared by the timing engine's source files: saturating
// double-to-integer conversions.
#ifndef QUELTA_ENGINE_ENGINEDETAIL_H
#define QUELTA_ENGINE_ENGINEDETAIL_H

#include <cstdint>

namespace quelta {

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
