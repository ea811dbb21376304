// The kernel clock calls the engine and the plain waits make, behind one seam.
//
// Production uses the real calls; tests replace single entries to check
// exact arithmetic (rates, steps, deadlines, failures) without touching the machine's
// clock. The table is written only while no other thread uses the engine.
#ifndef QUELTA_ENGINE_SYSTEMCLOCK_H
#define QUELTA_ENGINE_SYSTEMCLOCK_H

#include <sys/timex.h>
#include <time.h>

#include <cstdint>

#include "quelta/ClockTime.h"

namespace quelta {

// The layout the kernel's clock calls of the old interface use: seconds and
// nanoseconds as wide as the kernel's long, so 32-bit seconds on a 32-bit
// target. Only the clock conversion call of the kernel extension takes it.
struct KernelTimespec {
    long tv_sec;
    long tv_nsec;
};

struct SystemClockHooks {
    int (*getTime)(clockid_t, struct timespec*);
    int (*getRes)(clockid_t, struct timespec*);
    int (*setTime)(clockid_t, const struct timespec*);
    int (*adjustTime)(struct timex*);
    long (*clockTicksPerSecond)();  // sysconf(_SC_CLK_TCK)
    // The kernel's clock conversion call: syscall(number, from, to, time).
    long (*convertTime)(long number, int32_t fromClock, int32_t toClock, KernelTimespec* time);
    // clock_nanosleep: the plain waits' sleeps, absolute and relative. A
    // test that scripts the time sees the exact deadline the wait asked for
    // (the 32-bit arithmetic of the next-multiple waits only runs while the
    // clock is below 2^32 ns, which no real sleep can show).
    int (*sleep)(clockid_t, int flags, const struct timespec* request, struct timespec* remaining);
};

extern SystemClockHooks gSystemClock;

// Restores the real calls.
void ResetSystemClockHooks();

// Wall-clock seconds are 64-bit on every target (32-bit targets build with
// the C library's 64-bit time interfaces), so the global clock goes on past
// 2038-01-19 there too. Wherever the seconds fit in 31 bits the results are
// those of the kernel's 32-bit fields.
static_assert(sizeof(time_t) == 8, "32-bit targets build with _TIME_BITS=64");

// Splitting: unsigned division by 1e9; the seconds are the whole quotient.
timespec SplitNanoseconds(uint64_t ns);
// Joining: sec * 1e9 + nsec in 64-bit arithmetic, wrapping modulo 2^64, so
// that JoinNanoseconds(SplitNanoseconds(n)) == n for every n.
uint64_t JoinNanoseconds(const timespec& ts);

}  // namespace quelta

#endif
