// The global clock's epoch offset: seconds from 1904-01-01 00:00:00 to
// 1970-01-01 00:00:00 in the local zone, from two mktime calls.
//
// 1904 lies before the range of a 32-bit time_t: like the whole library, this
// uses the C library's 64-bit time functions on 32-bit targets too.
#include <time.h>

#include <cstdint>

#include "engine/EpochOffset.h"

namespace quelta {

int32_t ComputeEpochOffset() {
    struct tm tm = {};
    tm.tm_mday = 1;
    tm.tm_year = 4;  // 1904-01-01 00:00:00, no daylight saving
    const time_t t1 = mktime(&tm);
    tm.tm_year = 70;  // the rest as the first call normalised it
    const time_t t2 = mktime(&tm);
    return static_cast<int32_t>(static_cast<int64_t>(t2) - static_cast<int64_t>(t1));
}

}  // namespace quelta
