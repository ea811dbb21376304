// The library's exported interface: C-linkage waits, queries, callback
// registration, and the two accessors that hand out the timing engine and the
// log engine. Everything here is resolved by name (dlsym) by a runtime.
#ifndef QUELTA_QUELTA_H
#define QUELTA_QUELTA_H

#include "quelta/ClockTime.h"
#include "quelta/PalSemaphore.h"
#include "quelta/iKPLogEngine.h"
#include "quelta/iKPusLinuxTimer.h"
#include "quelta/iKPusTimingEngine.h"

extern "C" {

// Clock waits (monotonic clocks = nanoseconds). Results: low word of the
// monotonic time read after the wait.
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilClocks_C(uint32_t target);
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilClocks64_C(const ClockTime* target);
QUELTA_EXPORT uint32_t quelta_iTSC_WaitClocks_C(uint32_t duration);
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilNextMultipleClocks_C(uint32_t period);

// Microsecond waits and queries.
QUELTA_EXPORT uint32_t quelta_iTSC_WaitMicroSeconds_C(uint32_t duration);
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilMicroSeconds_C(uint32_t target);
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(uint32_t period);
QUELTA_EXPORT uint32_t quelta_iTSC_GetCPUSpeed_C(void);
QUELTA_EXPORT uint32_t quelta_iTSC_GetCPUTicksPerMS_C(void);

// Global-clock and event waits.
QUELTA_EXPORT void quelta_iTSC_WaitUntilGlobalClocks64_C(const ClockTime* target,
                                                         uint32_t* abortFlag,
                                                         ClockTime* timeAfter,
                                                         uint32_t generation);
QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_C(PalSemaphore* semaphore, uint32_t timeout);
QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_Callback_C(PalSemaphore* semaphore,
                                                        const ClockTime* deadline,
                                                        QueltaWaitCallbackFn callback,
                                                        void* callbackArg,
                                                        uint32_t isGlobal,
                                                        WaitNode** nodeOut);

// Callback and its monotonic (selector >= 0) or global (selector < 0) time.
QUELTA_EXPORT void quelta_iTSC_SetCallback(QueltaCallbackFn fn, void* arg);
QUELTA_EXPORT uint32_t quelta_iTSC_SetCallbackTime(const ClockTime* when, int32_t selector);

// Accessors: null before a successful start, after a failed one, after stop.
QUELTA_EXPORT iKPusTimingEngine* GetEngine__MERIDOX(void);
QUELTA_EXPORT iKPLogEngine* GetLogEngine__MERIDOX(void);

}  // extern "C"

#endif
