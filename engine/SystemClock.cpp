// The kernel clock calls of the engine, and the splitting and joining of
// nanosecond counts.
#include "engine/SystemClock.h"

#include <sys/syscall.h>
#include <sys/timex.h>
#include <time.h>
#include <unistd.h>

namespace quelta {

namespace {

constexpr uint64_t kNsPerSecond = 1000000000ull;

long RealClockTicksPerSecond() { return sysconf(_SC_CLK_TCK); }

long RealConvertTime(long number, int32_t fromClock, int32_t toClock, KernelTimespec* time) {
    return syscall(number, static_cast<long>(fromClock), static_cast<long>(toClock), time);
}

// The real calls are taken by address, so a production read costs one
// indirect call and no wrapper.
constexpr SystemClockHooks kRealHooks = {
    &::clock_gettime,
    &::clock_getres,
    &::clock_settime,
    &::adjtimex,
    &RealClockTicksPerSecond,
    &RealConvertTime,
    &::clock_nanosleep,
};

}  // namespace

SystemClockHooks gSystemClock = kRealHooks;

void ResetSystemClockHooks() { gSystemClock = kRealHooks; }

timespec SplitNanoseconds(uint64_t ns) {
    const uint64_t seconds = ns / kNsPerSecond;
    timespec ts{};
    ts.tv_sec = static_cast<time_t>(seconds);  // below 2^35: fits a 64-bit time_t
    ts.tv_nsec = static_cast<long>(ns - seconds * kNsPerSecond);
    return ts;
}

uint64_t JoinNanoseconds(const timespec& ts) {
    // Unsigned arithmetic on the sign-extended fields: two's-complement
    // wrap-around without signed overflow.
    return static_cast<uint64_t>(static_cast<int64_t>(ts.tv_sec)) * kNsPerSecond +
           static_cast<uint64_t>(static_cast<int64_t>(ts.tv_nsec));
}

}  // namespace quelta
