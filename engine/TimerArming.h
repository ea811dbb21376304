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

// Bodies of engine slots 54, 55 and 43.
void RegisterTickCallbackImpl(QueltaTickCallbackFn fn);
void UnregisterTickCallbackImpl(QueltaTickCallbackFn fn);  // mismatch: cleared, one diagnostic
void SetControlFlagImpl(uint32_t action);

}  // namespace quelta

#endif
