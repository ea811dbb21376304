// The kernel clock calls of the engine, and the library's 32-bit view of a
// kernel time point.
#include "engine/SystemClock.h"

#include <sys/timex.h>
#include <time.h>
#include <unistd.h>

namespace quelta {

namespace {

constexpr uint64_t kNsPerSecond = 1000000000ull;

long RealClockTicksPerSecond() { return sysconf(_SC_CLK_TCK); }

// The real calls are taken by address, so a production read costs one
// indirect call and no wrapper.
constexpr SystemClockHooks kRealHooks = {
    &::clock_gettime,
    &::clock_getres,
    &::clock_settime,
    &::adjtimex,
    &RealClockTicksPerSecond,
};

}  // namespace

SystemClockHooks gSystemClock = kRealHooks;

void ResetSystemClockHooks() { gSystemClock = kRealHooks; }

Timespec32 SplitNanoseconds(uint64_t ns) {
    const uint64_t seconds = ns / kNsPerSecond;
    Timespec32 ts;
    // Only the low 32 bits of the seconds survive (inputs from about 136
    // years on wrap), the same on a 64-bit build as on the 32-bit target.
    ts.sec = static_cast<int32_t>(static_cast<uint32_t>(seconds));
    ts.nsec = static_cast<int32_t>(ns - seconds * kNsPerSecond);
    return ts;
}

uint64_t JoinNanoseconds(const Timespec32& ts) {
    // Unsigned arithmetic on the sign-extended words: two's-complement
    // wrap-around without signed overflow.
    return static_cast<uint64_t>(static_cast<int64_t>(ts.sec)) * kNsPerSecond +
           static_cast<uint64_t>(static_cast<int64_t>(ts.nsec));
}

}  // namespace quelta
