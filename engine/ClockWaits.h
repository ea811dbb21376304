// Sleep routines shared by the clock and microsecond waits: plain sleeps of
// the calling thread on CLOCK_MONOTONIC, restarted after EINTR.
#ifndef QUELTA_ENGINE_CLOCKWAITS_H
#define QUELTA_ENGINE_CLOCKWAITS_H

#include "quelta/ClockTime.h"

namespace quelta {

void SleepUntilClocks(ClockTime deadline);  // absolute
void SleepClocks(ClockTime duration);       // relative, resumes the remainder

}  // namespace quelta

#endif
