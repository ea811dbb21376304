// The kernel clock calls the engine makes, behind one seam.
//
// Production uses the real calls; tests replace single entries to check
// exact arithmetic (rates, steps, failures) without touching the machine's
// clock. The table is written only while no other thread uses the engine.
#ifndef QUELTA_ENGINE_SYSTEMCLOCK_H
#define QUELTA_ENGINE_SYSTEMCLOCK_H

#include <sys/timex.h>
#include <time.h>

#include <cstdint>

#include "quelta/ClockTime.h"

namespace quelta {

struct SystemClockHooks {
    int (*getTime)(clockid_t, struct timespec*);
    int (*getRes)(clockid_t, struct timespec*);
    int (*setTime)(clockid_t, const struct timespec*);
    int (*adjustTime)(struct timex*);
    long (*clockTicksPerSecond)();  // sysconf(_SC_CLK_TCK)
};

extern SystemClockHooks gSystemClock;

// Restores the real calls.
void ResetSystemClockHooks();

// A kernel time point as the library treats it: 32-bit signed seconds and
// nanoseconds on every target.
struct Timespec32 {
    int32_t sec;
    int32_t nsec;
};

// Splitting: unsigned division by 1e9; seconds = low 32 bits of the quotient.
Timespec32 SplitNanoseconds(uint64_t ns);
// Joining: sec * 1e9 + nsec, both sign-extended from 32 bits, 64-bit wrap.
uint64_t JoinNanoseconds(const Timespec32& ts);

}  // namespace quelta

#endif
