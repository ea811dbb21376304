/**
 * \file
 * \brief iKPusTimingEngine: the timing engine as the runtime sees it.
 *
 * The runtime calls this object by virtual-slot position, so the order of the
 * declarations below is the interface: never reorder, insert or remove one.
 * The slot number of each operation is given in its comment. The virtual
 * destructor sits between slots 49 and 52 and takes slots 50 and 51.
 *
 * In C the engine is an opaque type: a C program uses the exported functions
 * of `<quelta/quelta.h>`, which cover the waits; the slots are reached from
 * C++.
 */
#ifndef QUELTA_IKPUSTIMINGENGINE_H
#define QUELTA_IKPUSTIMINGENGINE_H

#include "quelta/ClockTime.h"

#ifdef __cplusplus

/**
 * \brief The timing engine: clock reads, conversions, clock rate, statistics
 *        and the waits, by virtual slot.
 *
 * The library creates one engine when it is loaded and deletes it when it is
 * unloaded; GetEngine__MERIDOX() lends it out. The runtime never deletes it.
 *
 * **Units.** Every ClockTime is in nanoseconds ("clocks"): on the monotonic
 * base (`CLOCK_MONOTONIC`) unless the operation says global (`CLOCK_REALTIME`
 * counted from 1904-01-01 00:00:00 UTC). Microsecond values are nanoseconds
 * divided by 1000.
 *
 * **Threads.** Any thread may call any slot at any time, all at once, and
 * the timer thread calls the clock reads and conversions itself. Clock
 * reads, loads, conversions and the unit slots take no lock, never block and
 * never allocate; they may be called from callbacks on the timer thread. The
 * waits (slots 33 to 42, 49, 52) block the calling thread; they must never be
 * called from a callback.
 *
 * **Failures** are results, never exceptions; where a slot has no result,
 * the slot says what a failure leaves behind.
 */
class QUELTA_EXPORT iKPusTimingEngine {
public:
    /**
     * \brief Slot 0: the monotonic time now.
     *
     * One `clock_gettime(CLOCK_MONOTONIC)` in nanoseconds, also stored as one
     * atomic 64-bit value in the engine's last-monotonic cell (LoadLastMonotonic()).
     * Slots 0, 1, 4 and 5 behave identically. If the kernel read fails, the
     * previous value in the cell is returned and the cell is left as it is.
     * \param[out] out the monotonic time in nanoseconds.
     */
    virtual void ReadMonotonic0(ClockTime& out) = 0;                       // 0
    /** \brief Slot 1: the same as slot 0, ReadMonotonic0(). \param[out] out the monotonic time in nanoseconds. */
    virtual void ReadMonotonic1(ClockTime& out) = 0;                       // 1
    /**
     * \brief Slot 2: the global time now.
     *
     * `clock_gettime(CLOCK_REALTIME)` plus the span from 1904-01-01 to
     * 1970-01-01, in nanoseconds, also stored as one atomic 64-bit value in
     * the engine's last-global cell (LoadLastGlobal()). Slots 2, 3, 6 and 7
     * behave identically. If the kernel read fails, the previous value in the
     * cell is returned and the cell is left as it is.
     * \param[out] out the global time in nanoseconds since 1904-01-01.
     */
    virtual void ReadGlobal2(ClockTime& out) = 0;                          // 2
    /** \brief Slot 3: the same as slot 2, ReadGlobal2(). \param[out] out the global time in nanoseconds since 1904-01-01. */
    virtual void ReadGlobal3(ClockTime& out) = 0;                          // 3
    /** \brief Slot 4: the same as slot 0, ReadMonotonic0(). \param[out] out the monotonic time in nanoseconds. */
    virtual void ReadMonotonic4(ClockTime& out) = 0;                       // 4
    /** \brief Slot 5: the same as slot 0, ReadMonotonic0(). \param[out] out the monotonic time in nanoseconds. */
    virtual void ReadMonotonic5(ClockTime& out) = 0;                       // 5
    /** \brief Slot 6: the same as slot 2, ReadGlobal2(). \param[out] out the global time in nanoseconds since 1904-01-01. */
    virtual void ReadGlobal6(ClockTime& out) = 0;                          // 6
    /** \brief Slot 7: the same as slot 2, ReadGlobal2(). \param[out] out the global time in nanoseconds since 1904-01-01. */
    virtual void ReadGlobal7(ClockTime& out) = 0;                          // 7
    /**
     * \brief Slot 8: the raw hardware time now.
     *
     * `clock_gettime(CLOCK_MONOTONIC_RAW)` in nanoseconds (not slewed by the
     * kernel's clock discipline). Not recorded in any cell. Slots 8 and 9
     * behave identically. 0 if the kernel read fails.
     * \param[out] out the raw monotonic time in nanoseconds.
     */
    virtual void ReadRaw8(ClockTime& out) = 0;                             // 8
    /** \brief Slot 9: the same as slot 8, ReadRaw8(). \param[out] out the raw monotonic time in nanoseconds. */
    virtual void ReadRaw9(ClockTime& out) = 0;                             // 9
    /**
     * \brief Slot 10: clocks per second.
     * \return 1,000,000,000 (low word 1000000000, high word 0): a clock is a
     *         nanosecond.
     */
    virtual ClockTime GetClocksPerSecond() = 0;                            // 10
    /**
     * \brief Slot 11: the resolution of the raw clock.
     * \return `clock_getres(CLOCK_MONOTONIC_RAW)` in nanoseconds (typically
     *         1); 0 if the kernel call fails.
     */
    virtual ClockTime GetRawClockResolution() = 0;                         // 11
    /**
     * \brief Slot 12: the kernel clock's current rate.
     *
     * Reads the kernel's `tick` and `freq` with `adjtimex` (read only) and
     * returns the rate they give, in kernel ticks per second: the nominal
     * value, `sysconf(_SC_CLK_TCK)` (100 on most kernels), for an undisturbed
     * clock. The first rate operation of a process prints
     * "ticks_per_sec= %ld\n" on standard output.
     * \return kernel ticks per second.
     */
    virtual double GetClockRate() = 0;                                     // 12
    /**
     * \brief Slot 13: sets the kernel clock's rate.
     *
     * Sets the kernel's `tick` and `freq` (`adjtimex`, `ADJ_TICK` |
     * `ADJ_FREQUENCY`) so that the clock runs at the given rate relative to
     * the nominal one; GetClockRate() then reads back the rate to within the
     * kernel's resolution. This changes the system's clock for every process
     * and outlives the library. It needs `CAP_SYS_TIME`; a refusal is
     * reported only by the line
     * "unable to update frequency [adjtimex(tick= %ld, freq= %ld) failed]\n"
     * on standard output. A rate whose `tick` or `freq` does not fit is
     * saturated, NaN taken as 0.
     * \param ticksPerSecond the wanted rate in kernel ticks per second (the
     *        nominal value is `sysconf(_SC_CLK_TCK)`).
     */
    virtual void SetClockRate(double ticksPerSecond) = 0;                  // 13
    /**
     * \brief Slot 14: steps the wall clock.
     *
     * Reads `CLOCK_REALTIME`, adds delta and sets the result with
     * `clock_settime`. The global clock follows at once: global-clock waits
     * and a global callback time end at the new instant (a step forward ends
     * them sooner in monotonic terms, a step back later). System-wide; needs
     * `CAP_SYS_TIME`.
     * \param delta the step in nanoseconds, as a signed 64-bit value in two's
     *        complement (high word 0xFFFFFFFF, low word 0xC4653600 steps one
     *        second back).
     * \return 0 on success; -1 with `errno` set when the clock could not be
     *         read or set (the clock is then unchanged).
     */
    virtual int32_t StepGlobalClock(const ClockTime& delta) = 0;           // 14
    /**
     * \brief Slot 15: the global time of a monotonic instant.
     *
     * Converts at the moment of the call: through the kernel's
     * `clock_converttime` call when the system offers it, otherwise by
     * bracketing one monotonic read between two wall-clock reads, so it
     * follows every step and slew of the wall clock up to the call. Costs a
     * system call or three clock reads; no lock, no allocation. Slots 15, 16,
     * 23 and 24 give the same result.
     * \param t a monotonic time in nanoseconds.
     * \return the global time of the same instant, nanoseconds since 1904.
     */
    virtual ClockTime MonotonicToGlobal(const ClockTime& t) = 0;           // 15
    /** \brief Slot 16: the conversion behind slot 15, MonotonicToGlobal(). \param t a monotonic time in nanoseconds. \return the global time of the same instant. */
    virtual ClockTime MonotonicToGlobalImpl(const ClockTime& t) = 0;       // 16
    /**
     * \brief Slot 17: the monotonic time of a global instant.
     *
     * The reverse of MonotonicToGlobal(), under the same rules; slots 17, 18,
     * 25 and 26 give the same result.
     * \param t a global time in nanoseconds since 1904-01-01.
     * \return the monotonic time of the same instant, as the wall clock
     *         stands at the call.
     */
    virtual ClockTime GlobalToMonotonic(const ClockTime& t) = 0;           // 17
    /** \brief Slot 18: the conversion behind slot 17, GlobalToMonotonic(). \param t a global time in nanoseconds since 1904-01-01. \return the monotonic time of the same instant. */
    virtual ClockTime GlobalToMonotonicImpl(const ClockTime& t) = 0;       // 18
    /**
     * \brief Slot 19: microseconds to clocks, 64-bit.
     * \param us a count of microseconds.
     * \return us × 1000 modulo 2^64, in nanoseconds.
     */
    virtual ClockTime MicrosecondsToClocks64(const ClockTime& us) = 0;     // 19
    /**
     * \brief Slot 20: microseconds to clocks, 32-bit.
     * \param us a count of microseconds.
     * \return us × 1000 modulo 2^32: it wraps above 4,294,967 µs (4,294,968
     *         gives 704).
     */
    virtual uint32_t MicrosecondsToClocks32(const uint32_t& us) = 0;       // 20
    /**
     * \brief Slot 21: clocks to microseconds, 64-bit, by reciprocal
     *        multiplication (no division).
     * \param ns a count of nanoseconds.
     * \return ns / 1000 rounded to nearest with ties downward for every ns
     *         below 14,510,501 (500 gives 0, 501 gives 1, 1500 gives 1);
     *         above that less than 1.5 below and at most 0.5 above the exact
     *         quotient. Use slot 22 where an exact floor of a 32-bit count is
     *         needed.
     */
    virtual ClockTime ClocksToMicroseconds64(const ClockTime& ns) = 0;     // 21
    /**
     * \brief Slot 22: clocks to microseconds, 32-bit.
     * \param ns a count of nanoseconds.
     * \return ⌊ns / 1000⌋, exact.
     */
    virtual uint32_t ClocksToMicroseconds32(const uint32_t& ns) = 0;       // 22
    /** \brief Slot 23: the same as slot 15, MonotonicToGlobal(). \param t a monotonic time in nanoseconds. \return the global time of the same instant. */
    virtual ClockTime MonotonicToGlobalFwd(const ClockTime& t) = 0;        // 23
    /** \brief Slot 24: the same as slot 16, MonotonicToGlobalImpl(). \param t a monotonic time in nanoseconds. \return the global time of the same instant. */
    virtual ClockTime MonotonicToGlobalImplFwd(const ClockTime& t) = 0;    // 24
    /** \brief Slot 25: the same as slot 17, GlobalToMonotonic(). \param t a global time in nanoseconds since 1904-01-01. \return the monotonic time of the same instant. */
    virtual ClockTime GlobalToMonotonicFwd(const ClockTime& t) = 0;        // 25
    /** \brief Slot 26: the same as slot 18, GlobalToMonotonicImpl(). \param t a global time in nanoseconds since 1904-01-01. \return the monotonic time of the same instant. */
    virtual ClockTime GlobalToMonotonicImplFwd(const ClockTime& t) = 0;    // 26
    /** \brief Slot 27: the same as slot 19, MicrosecondsToClocks64(). \param us a count of microseconds. \return us × 1000 modulo 2^64. */
    virtual ClockTime MicrosecondsToClocks64Fwd(const ClockTime& us) = 0;  // 27
    /** \brief Slot 28: the same as slot 20, MicrosecondsToClocks32(). \param us a count of microseconds. \return us × 1000 modulo 2^32. */
    virtual uint32_t MicrosecondsToClocks32Fwd(const uint32_t& us) = 0;    // 28
    /** \brief Slot 29: the same as slot 21, ClocksToMicroseconds64(). \param ns a count of nanoseconds. \return ns / 1000 as slot 21 rounds it. */
    virtual ClockTime ClocksToMicroseconds64Fwd(const ClockTime& ns) = 0;  // 29
    /** \brief Slot 30: the same as slot 22, ClocksToMicroseconds32(). \param ns a count of nanoseconds. \return ⌊ns / 1000⌋. */
    virtual uint32_t ClocksToMicroseconds32Fwd(const uint32_t& ns) = 0;    // 30
    /**
     * \brief Slot 31: copies the timing statistics.
     *
     * The record is 12016 bytes of 32-bit words, in order: a reserved 0, the
     * most frequent tick lateness (ns, in 10 ns steps, 0 if none), the mean
     * cost of a raw clock read (ns), the extra cost of a global read (ns),
     * then 1000 tick latenesses, 1000 raw-read costs and 1000 global-read
     * costs. It is filled by the engine's calibration, which is not part of
     * this interface and which the library does not run by itself; until then
     * it is all zero. No lock: a copy taken during a calibration may mix old
     * and new samples.
     * \param destination where to copy; room for 12016 bytes, or 16 when
     *        full is 0. Not checked.
     * \param full nonzero: the whole record; 0: its first four words.
     */
    virtual void CopyStatistics(void* destination, uint32_t full) = 0;     // 31
    /**
     * \brief Slot 32: the most frequent value of a sample set.
     *
     * Sorts the samples into buckets of bucketWidth (sample / width rounded
     * to nearest) and returns the centre of the bucket that first reached the
     * highest count. It allocates 40,000 bytes for each call: not for a
     * timing path.
     * \param samples count values; not checked.
     * \param count the number of samples.
     * \param bucketWidth the width of a bucket; 0 gives 0.
     * \param bucketLimit buckets counted (at most 10000); samples in higher
     *        buckets are ignored.
     * \return the bucket index times bucketWidth; 0 when count is 0, when
     *         the most frequent bucket is the first or the last one, or when
     *         the counters cannot be allocated.
     */
    virtual uint32_t HistogramMode(const uint32_t* samples, uint32_t count,
                                   uint32_t bucketWidth,
                                   uint32_t bucketLimit) = 0;              // 32
    /**
     * \brief Slot 33: quelta_iTSCEvent_Wait_C(), the same contract.
     * \param semaphore the caller's semaphore.
     * \param timeout microseconds; 0xFFFFFFFF waits without a timeout.
     * \return 0 posted, 1 timed out, 2 failed, 3 cannot be served.
     */
    virtual uint32_t EventWait(PalSemaphore* semaphore, uint32_t timeout) = 0; // 33
    /**
     * \brief Slot 34: quelta_iTSCEvent_Wait_Callback_C(), the same contract,
     *        with the deadline by reference.
     * \param semaphore posted when the node fires; may be null.
     * \param deadline when the node fires (copied at the call).
     * \param callback called on the timer thread when the node fires; may be
     *        null.
     * \param callbackArg passed to callback.
     * \param isGlobal nonzero: deadline is a global time.
     * \param nodeOut receives the node; may be null.
     * \return 0 queued, 1 no timer, 3 cannot be served.
     */
    virtual uint32_t EventWaitCallback(PalSemaphore* semaphore,
                                       const ClockTime& deadline,
                                       QueltaWaitCallbackFn callback,
                                       void* callbackArg, uint32_t isGlobal,
                                       WaitNode** nodeOut) = 0;            // 34
    /**
     * \brief Slot 35: gives a wait node back to the pool; cancels it if it
     *        has not fired.
     *
     * Releases a node received through `nodeOut` of
     * quelta_iTSCEvent_Wait_Callback_C() (once per node; not one that its
     * callback already gave back by returning nonzero). Once this returns,
     * the library no longer touches the node's semaphore or callback, so both
     * may go away. Releasing a node whose firing is in progress waits for its
     * callback to finish; it may therefore block for as long as that
     * callback runs. A callback may release its own node (the release then
     * completes when the firing ends). A node released twice, or a pointer
     * that is not a node of the pool, is refused with one diagnostic line on
     * standard error and the lists stay intact; a null pointer does nothing.
     * \param node the node to give back.
     */
    virtual void ReleaseWait(WaitNode* node) = 0;                          // 35
    /** \brief Slot 36: quelta_iTSC_WaitMicroSeconds_C(). \param us the duration in microseconds. \return the low word of the monotonic time in µs after the wait. */
    virtual uint32_t WaitMicroSeconds(uint32_t us) = 0;                    // 36
    /** \brief Slot 37: quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(). \param us the period in microseconds. \return the low word of the monotonic time in µs after the wait. */
    virtual uint32_t WaitUntilNextMultipleMicroSeconds(uint32_t us) = 0;   // 37
    /** \brief Slot 38: quelta_iTSC_WaitUntilMicroSeconds_C(). \param us the target, low word of a monotonic time in µs. \return the low word of the monotonic time in µs after the wait. */
    virtual uint32_t WaitUntilMicroSeconds(uint32_t us) = 0;               // 38
    /** \brief Slot 39: quelta_iTSC_WaitClocks_C(). \param clocks the duration in nanoseconds. \return the low word of the monotonic time after the wait. */
    virtual uint32_t WaitClocks(uint32_t clocks) = 0;                      // 39
    /** \brief Slot 40: quelta_iTSC_WaitUntilNextMultipleClocks_C(). \param clocks the period in nanoseconds. \return the low word of the monotonic time after the wait. */
    virtual uint32_t WaitUntilNextMultipleClocks(uint32_t clocks) = 0;     // 40
    /** \brief Slot 41: quelta_iTSC_WaitUntilClocks64_C(). \param target a monotonic time. \return the low word of the monotonic time after the wait. */
    virtual uint32_t WaitUntilClocks64(const ClockTime* target) = 0;       // 41
    /** \brief Slot 42: quelta_iTSC_WaitUntilClocks_C(). \param target the low word of a monotonic time. \return the low word of the monotonic time after the wait. */
    virtual uint32_t WaitUntilClocks(uint32_t target) = 0;                 // 42
    /**
     * \brief Slot 43: sets or clears the control flag.
     *
     * A word kept for the runtime; nothing in the library reads it.
     * \param action 1 sets the flag, 2 clears it, any other value does
     *        nothing.
     */
    virtual void SetControlFlag(uint32_t action) = 0;                      // 43
    /**
     * \brief Slot 44: whether the event and global-clock waits go through the
     *        tick service.
     * \return 1 (always, in this library): those waits queue a wait node that
     *         the timer thread fires; 0 would mean plain sleeps with
     *         millisecond timeouts.
     */
    virtual uint32_t UsesTickService() = 0;                                // 44
    /** \brief Slot 45: the same as slot 46, LoadLastMonotonic(). \param[out] out the last recorded monotonic time. */
    virtual void LoadLastMonotonicFwd(ClockTime& out) = 0;                 // 45
    /**
     * \brief Slot 46: the last monotonic time recorded by a monotonic read.
     *
     * One atomic 64-bit load, never torn, also on 32-bit processors. Reads
     * on several threads race for the cell: it holds the value of whichever
     * read stored last, not necessarily the largest. 0 before the first
     * read. Reads the clock itself never.
     * \param[out] out the value of the last-monotonic cell.
     */
    virtual void LoadLastMonotonic(ClockTime& out) = 0;                    // 46
    /** \brief Slot 47: the same as slot 48, LoadLastGlobal(). \param[out] out the last recorded global time. */
    virtual void LoadLastGlobalFwd(ClockTime& out) = 0;                    // 47
    /**
     * \brief Slot 48: the last global time recorded by a global read (slots
     *        2, 3, 6, 7 and 53, and the event log's time stamps).
     *
     * Under the same rules as LoadLastMonotonic().
     * \param[out] out the value of the last-global cell.
     */
    virtual void LoadLastGlobal(ClockTime& out) = 0;                       // 48
    /**
     * \brief Slot 49: waits until the next multiple of a 64-bit period.
     *
     * A plain wait on the calling thread (`clock_nanosleep` on
     * `CLOCK_MONOTONIC`, absolute, restarted after signals): it ends at the
     * first multiple of period strictly later than the call, so a call made
     * exactly on a multiple waits one whole period. Never early.
     * \param period the period in nanoseconds; 0: no wait.
     * \return the monotonic time after the wait.
     */
    virtual ClockTime WaitUntilNextMultipleClocks64(const ClockTime& period) = 0; // 49
    /**
     * \brief Slots 50 and 51: the destructors.
     *
     * The library deletes its engine when it is unloaded; the runtime must
     * never delete the object it borrowed from GetEngine__MERIDOX().
     */
    virtual ~iKPusTimingEngine() {}                                        // 50, 51
    /**
     * \brief Slot 52: quelta_iTSC_WaitUntilGlobalClocks64_C().
     * \param target a global time.
     * \param abortFlag receives the abort flag; may be null.
     * \param timeAfter receives the global time after the wait; may be null.
     * \param generation the generation read with the time the target is based on.
     */
    virtual void WaitUntilGlobalClocks64(const ClockTime* target,
                                         uint32_t* abortFlag,
                                         ClockTime* timeAfter,
                                         uint32_t generation) = 0;         // 52
    /**
     * \brief Slot 53: the global time now, with the global clock's generation.
     *
     * A global read exactly as ReadGlobal2() (recorded in the last-global
     * cell), then the current generation, not under one lock. Pass the pair
     * on to quelta_iTSC_WaitUntilGlobalClocks64_C(), which reports a wait as
     * aborted when the generation no longer matches. The library itself never
     * changes the generation.
     * \param[out] out the global time in nanoseconds since 1904-01-01.
     * \param[out] generation the generation that belongs to it.
     */
    virtual void ReadGlobalWithGeneration(ClockTime& out,
                                          uint32_t& generation) = 0;       // 53
    /**
     * \brief Slot 54: registers the tick callback, replacing any earlier one.
     *
     * The function runs on the timer thread at each 1 ms tick served, under
     * the rules of #QueltaTickCallbackFn. Ticks the timer thread served late
     * are not replayed: after a long delay the tick grid restarts from the
     * present.
     * \param fn the callback; null removes it.
     */
    virtual void RegisterTickCallback(QueltaTickCallbackFn fn) = 0;        // 54
    /**
     * \brief Slot 55: removes the tick callback.
     *
     * The callback is cleared whatever fn is; a fn that is not the registered
     * one also writes one diagnostic line on standard error. A call already
     * running on the timer thread may still be finishing when this returns.
     * \param fn the callback that was registered.
     */
    virtual void UnregisterTickCallback(QueltaTickCallbackFn fn) = 0;      // 55
};

#else
/** \brief In C, the timing engine is opaque. */
typedef struct iKPusTimingEngine iKPusTimingEngine;
#endif

#endif
