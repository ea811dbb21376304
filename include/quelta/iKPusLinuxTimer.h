// iKPusLinuxTimer: a one-shot absolute-deadline timer that calls one function
// on a dedicated real-time thread. The order of the virtual slots is part of
// the interface.
#ifndef QUELTA_IKPUSLINUXTIMER_H
#define QUELTA_IKPUSLINUXTIMER_H

#include "quelta/ClockTime.h"

typedef void (*QueltaExpiryCallbackFn)(void);

class QUELTA_EXPORT iKPusLinuxTimer {
public:
    virtual ~iKPusLinuxTimer() {}                                  // slots 0, 1
    virtual int32_t Initialize(QueltaExpiryCallbackFn callback) = 0; // slot 2
    virtual void NoOperation() = 0;                                // slot 3
    virtual void SetExpiry(ClockTime when) = 0;                    // slot 4
    virtual void ExpireNow() = 0;                                  // slot 5
    virtual uint32_t GetTicksPerMicrosecond() = 0;                 // slot 6
};

#endif
