// Sleep routines shared by the clock and microsecond waits: plain sleeps of
// the calling thread on CLOCK_MONOTONIC, restarted after EINTR.
#ifndef QUELTA_ENGINE_CLOCKWAITS_H
#define QUELTA_ENGINE_CLOCKWAITS_H

#include "quelta/ClockTime.h"

namespace quelta {

void SleepUntilClocks(ClockTime deadline);  // absolute
void SleepClocks(ClockTime duration);       // relative, resumes the remainder

// The first multiple of `period` (not 0) strictly later than `now`, modulo
// 2^64: one 32-bit division while the high word is 0, the library's 64-bit
// routines otherwise.
ClockTime NextMultiple(const ClockTime& now, uint32_t period);

// Engine slot 49: sleeps until the next multiple of a 64-bit period and
// returns the monotonic time read after the wait.
ClockTime WaitUntilNextMultipleClocks64Impl(const ClockTime& period);

}  // namespace quelta

#endif
