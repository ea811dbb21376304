/**
 * \file
 * \brief iKPusLinuxTimer: the library's one-shot absolute-deadline timer.
 *
 * The timer calls one function on a dedicated real-time thread ("QUELTAisr",
 * top `SCHED_FIFO` priority) when its deadline comes. The library keeps its
 * only timer to itself (no accessor hands it out); the interface is published
 * because its run-time type information is part of the library's exported
 * interface. The order of the virtual slots is part of the interface.
 */
#ifndef QUELTA_IKPUSLINUXTIMER_H
#define QUELTA_IKPUSLINUXTIMER_H

#include "quelta/ClockTime.h"

/** \brief The function a timer calls at each expiry, on its own thread. */
typedef void (*QueltaExpiryCallbackFn)(void);

#ifdef __cplusplus

/**
 * \brief A one-shot timer on `CLOCK_MONOTONIC` that runs a function on a
 *        real-time thread of its own.
 */
class QUELTA_EXPORT iKPusLinuxTimer {
public:
    /** \brief Slots 0 and 1: the destructors; stop and join the thread. */
    virtual ~iKPusLinuxTimer() {}                                  // slots 0, 1
    /**
     * \brief Slot 2: starts the timer thread, parked on a far deadline.
     * \param callback run on the timer thread at each expiry.
     * \return 0 started; 1 not (for instance without `SCHED_FIFO` privilege).
     */
    virtual int32_t Initialize(QueltaExpiryCallbackFn callback) = 0; // slot 2
    /** \brief Slot 3: does nothing. */
    virtual void NoOperation() = 0;                                // slot 3
    /**
     * \brief Slot 4: sets the next expiry and wakes the thread to sleep
     *        towards it. Any thread, the timer thread included.
     * \param when an absolute monotonic time in nanoseconds.
     */
    virtual void SetExpiry(ClockTime when) = 0;                    // slot 4
    /** \brief Slot 5: expires at once (an expiry of time 0). */
    virtual void ExpireNow() = 0;                                  // slot 5
    /** \brief Slot 6: the timer's ticks per microsecond. \return 1000. */
    virtual uint32_t GetTicksPerMicrosecond() = 0;                 // slot 6
};

#else
typedef struct iKPusLinuxTimer iKPusLinuxTimer;
#endif

#endif
