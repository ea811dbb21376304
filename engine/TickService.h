// The tick service routine: the library's only time-driven code, run by the
// timer thread at every expiry.
#ifndef QUELTA_ENGINE_TICKSERVICE_H
#define QUELTA_ENGINE_TICKSERVICE_H

#include <cstdint>

namespace quelta {

void TickServiceRoutine();

// Seam for deterministic tests: when set, a pass takes `now` from this
// function instead of the engine's ReadMonotonic5.
extern uint64_t (*gTickNowOverride)();

// Resets the routine's own state (lastGeneration, tickSerial) for tests.
void ResetTickServiceState();

}  // namespace quelta

#endif
