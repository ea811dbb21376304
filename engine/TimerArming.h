// ArmTimer: the one place where the scheduler programs the timer.
#ifndef QUELTA_ENGINE_TIMERARMING_H
#define QUELTA_ENGINE_TIMERARMING_H

#include <cstdint>

#include "quelta/ClockTime.h"

namespace quelta {

// 1 when a serving timer exists (armed, or ExpireNow for NeverTime), 0 when
// there is none: gTimer null, or its thread ended (no real-time privilege).
uint32_t ArmTimer(const ClockTime& when);

// True when a timer exists and its thread serves expiries.
bool TimerServing();

}  // namespace quelta

#endif
