/**
 * \file
 * \brief The library's exported interface: C-linkage waits, queries, callback
 *        registration, and the two accessors that hand out the timing engine
 *        and the log engine.
 *
 * A runtime resolves each of these by name (`dlsym`) after loading
 * `libquelta.so.6`; loading starts the library, there is no initialisation
 * call. This header compiles as C (C11) and as C++; in C the two engines are
 * opaque.
 *
 * **Two kinds of wait.**
 * - *Plain waits* (the clock and microsecond waits) sleep on the calling
 *   thread with `clock_nanosleep` on `CLOCK_MONOTONIC`, restarted after a
 *   signal, and never involve the timer thread. They report no error: each
 *   returns the time read after waking, so an early end (which only a
 *   failing kernel call can cause) shows in the result.
 * - *Tick-service waits* (quelta_iTSCEvent_Wait_C(),
 *   quelta_iTSCEvent_Wait_Callback_C(), quelta_iTSC_WaitUntilGlobalClocks64_C())
 *   queue one of 128 pooled wait nodes that the timer thread fires at the
 *   deadline; a blocking one also bounds its own semaphore wait by the
 *   deadline. Without real-time privilege the library has no timer thread:
 *   these waits then return at once with their "no timer" result and no
 *   callback ever fires; plain waits, clock reads and the log work as usual.
 *
 * **Never early.** No wait returns before its deadline unless its result
 * says why. Lateness is the machine's wake-up latency for the waiting
 * thread (tens of microseconds typically).
 *
 * **Threads.** Every function may be called from any number of threads at
 * once. The blocking ones must not be called from a callback, which runs on
 * the timer thread. No function allocates memory on its timing path.
 */
#ifndef QUELTA_QUELTA_H
#define QUELTA_QUELTA_H

#include "quelta/ClockTime.h"
#include "quelta/PalSemaphore.h"
#include "quelta/iKPLogEngine.h"
#include "quelta/iKPusLinuxTimer.h"
#include "quelta/iKPusTimingEngine.h"

#ifdef __cplusplus
extern "C" {
#endif

/**
 * \name Clock waits
 * Plain waits in clocks (nanoseconds of `CLOCK_MONOTONIC`) on the calling
 * thread. Each returns the low word of the monotonic time read after the
 * wait.
 * @{
 */

/**
 * \brief Waits until a 32-bit monotonic time.
 *
 * The target is placed in the current 2^32-clock span (about 4.29 s) when it
 * lies ahead of the current low word. A target that passed less than 1 ms ago
 * returns at once; one further back is taken to lie in the next span, so the
 * wait lasts until the low word comes round again (up to 4.29 s).
 * \param target the low word of a monotonic time.
 * \return the low word of the monotonic time after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilClocks_C(uint32_t target);

/**
 * \brief Waits until a 64-bit monotonic time.
 * \param target a monotonic time; a time already passed (or one whose high
 *        word is 0xFFFFFFFF, which sorts before all others) does not wait.
 *        Null: no wait.
 * \return the low word of the monotonic time after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilClocks64_C(const ClockTime* target);

/**
 * \brief Waits for a number of clocks.
 *
 * A relative sleep; a signal resumes it with the time still to sleep.
 * \param duration nanoseconds, up to 4.29 s; 0: no wait.
 * \return the low word of the monotonic time after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitClocks_C(uint32_t duration);

/**
 * \brief Waits until the next multiple of a period, counted from the
 *        monotonic clock's zero.
 *
 * Ends at the first multiple strictly later than the call: a call made
 * exactly on a multiple waits one whole period. The basis of a periodic
 * loop that does not drift.
 * \param period nanoseconds; 0: no wait.
 * \return the low word of the monotonic time after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilNextMultipleClocks_C(uint32_t period);

/** @} */

/**
 * \name Microsecond waits and queries
 * Plain waits in microseconds of `CLOCK_MONOTONIC` on the calling thread.
 * Each returns the low word of the monotonic time in microseconds read after
 * the wait (it wraps every 2^32 µs, about 71.6 minutes).
 * @{
 */

/**
 * \brief Waits for a number of microseconds.
 * \param duration microseconds, up to 4,294,967,295 (about 71.6 minutes;
 *        the nanosecond product does not wrap); 0: no wait.
 * \return the low word of the monotonic time in µs after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitMicroSeconds_C(uint32_t duration);

/**
 * \brief Waits until a 32-bit monotonic time in microseconds.
 *
 * As quelta_iTSC_WaitUntilClocks_C() in microseconds: a target that passed
 * less than 1000 µs ago returns at once; one further back waits into the
 * next 2^32-µs span (about 71.6 minutes).
 * \param target the low word of a monotonic time in µs; 0: no wait.
 * \return the low word of the monotonic time in µs after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilMicroSeconds_C(uint32_t target);

/**
 * \brief Waits until the next multiple of a period in microseconds.
 *
 * As quelta_iTSC_WaitUntilNextMultipleClocks_C() in microseconds.
 * \param period microseconds; 0: no wait.
 * \return the low word of the monotonic time in µs after the wait.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(uint32_t period);

/**
 * \brief Clock ticks per microsecond.
 * \return 1000 (a clock is a nanosecond); 1 before the library has started.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_GetCPUSpeed_C(void);

/**
 * \brief Clock ticks per millisecond.
 * \return 1,000,000, before start-up too.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_GetCPUTicksPerMS_C(void);

/** @} */

/**
 * \name Global-clock and event waits
 * Waits served by the tick service. They block the calling thread (except
 * quelta_iTSCEvent_Wait_Callback_C() with a semaphore or a callback) and must
 * not be called from a callback.
 * @{
 */

/**
 * \brief Waits until a time on the global clock.
 *
 * The wait ends when the global clock reaches the target (a step of the wall
 * clock forward ends it sooner in monotonic terms, a step back later), when
 * the global clock's generation changes (abort flag 1; the library itself
 * never changes it), or when the library is unloaded (abort flag 1).
 * \param target a global time, nanoseconds since 1904-01-01. 0, or null, or
 *        all 128 wait nodes in use: no wait, the current time is returned
 *        with abort flag 0.
 * \param abortFlag may be null (then the generation is not looked at).
 *        Receives 0 when the wait ran normally; 1 when generation differed
 *        from the current one at the call (the call returns at once and
 *        timeAfter is not written) or at the end; 0xFFFFFFFF when the
 *        library has not started (nothing waited for, timeAfter not
 *        written).
 * \param timeAfter receives the global time read after the wait; may be
 *        null. Without real-time privilege there is no wait and it
 *        receives the current time.
 * \param generation the value read with ReadGlobalWithGeneration (engine
 *        slot 53) together with the time the target is based on.
 */
QUELTA_EXPORT void quelta_iTSC_WaitUntilGlobalClocks64_C(const ClockTime* target,
                                                         uint32_t* abortFlag,
                                                         ClockTime* timeAfter,
                                                         uint32_t generation);

/**
 * \brief Waits until a semaphore is posted or a timeout expires.
 *
 * The wait never removes a post it did not take as its result and never
 * leaves one behind: after a timeout the semaphore's count is as it was.
 * \param semaphore the caller's semaphore (a PalSemaphore the runtime
 *        created and owns; it must stay valid until the call returns).
 * \param timeout microseconds, at most 4,294,967 (larger values wrap modulo
 *        2^32 nanoseconds); 0xFFFFFFFF waits without a timeout.
 * \return 0 when the semaphore was posted (a post that arrives at the moment
 *         of the timeout may be taken and reported as 0); 1 when the timeout
 *         expired, or at once when the library has no timer thread; 2 when
 *         the wait failed; 3 when it cannot be served: null semaphore, the
 *         library not started or being unloaded, no free wait node (128
 *         pending). A wait cut short by the library's unloading returns 3.
 */
QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_C(PalSemaphore* semaphore, uint32_t timeout);

/**
 * \brief Queues a deadline that posts a semaphore and/or calls a function.
 *
 * When the deadline comes, the timer thread posts semaphore (if given) and
 * then calls callback (if given) with callbackArg. With neither, the call
 * blocks until the deadline on a semaphore of the node's own and returns 0
 * (a plain wait until a time on either clock; a node handed out through
 * nodeOut is then already back in the pool). Otherwise it returns at once.
 *
 * Ownership: without nodeOut, the node belongs to the library until it fires
 * and then goes back to the pool by itself; semaphore and callback must stay
 * valid until then. With nodeOut, the caller holds the node and gives it back
 * once with ReleaseWait (engine slot 35), after it fired or to cancel it,
 * unless its callback returned nonzero (the node is then already back).
 * After ReleaseWait returns the library no longer touches the node's
 * semaphore or callback.
 * \param semaphore posted when the node fires; may be null.
 * \param deadline when the node fires, monotonic or global (isGlobal);
 *        copied at the call. Null: result 3. NeverTime: never fires (waits
 *        until released). A time already passed fires at once.
 * \param callback see #QueltaWaitCallbackFn; may be null. Its result decides
 *        whether the node goes back to the pool.
 * \param callbackArg passed to callback.
 * \param isGlobal nonzero: deadline is on the global clock and follows its
 *        steps.
 * \param nodeOut receives the node (also when the result is 1); may be null.
 * \return 0 queued (it may already have fired); 1 not queued because the
 *         library has no timer thread (a node handed out through nodeOut
 *         must still be released); 3 cannot be served: null deadline, the
 *         library not started or being unloaded, no free node (128 pending).
 */
QUELTA_EXPORT uint32_t quelta_iTSCEvent_Wait_Callback_C(PalSemaphore* semaphore,
                                                        const ClockTime* deadline,
                                                        QueltaWaitCallbackFn callback,
                                                        void* callbackArg,
                                                        uint32_t isGlobal,
                                                        WaitNode** nodeOut);

/** @} */

/**
 * \name Callback
 * One callback function with a monotonic and a global callback time, each
 * firing it once on the timer thread.
 * @{
 */

/**
 * \brief Sets the callback function.
 *
 * A callback time already pending stays pending and will call the new
 * function. The function runs on the timer thread under the rules of
 * #QueltaCallbackFn. A call already running may still be finishing when
 * quelta_iTSC_SetCallback(0, 0) returns; unloading the library ends that.
 * \param fn the function; null removes it (due callback times then pass
 *        without a call).
 * \param arg passed to fn.
 */
QUELTA_EXPORT void quelta_iTSC_SetCallback(QueltaCallbackFn fn, void* arg);

/**
 * \brief Sets the monotonic or the global callback time.
 *
 * Each of the two times fires the callback function once when it is due,
 * independently of the other; setting one replaces only the pending time of
 * its clock. A global time is compared with the global clock at every tick,
 * so a step of the wall clock moves its firing. The callback runs one
 * wake-up after its time, not at the next tick. It may set its next time
 * itself.
 * \param when the time; NeverTime cancels the pending time of that clock.
 *        Null: nothing stored, result 0.
 * \param selector 0 or positive: when is a monotonic time; negative: a
 *        global time.
 * \return 1 stored; 0 not stored, because the time would have to arm the
 *         timer and the library has no timer thread.
 */
QUELTA_EXPORT uint32_t quelta_iTSC_SetCallbackTime(const ClockTime* when, int32_t selector);

/** @} */

/**
 * \name Accessors
 * The library owns both objects from its start to its unloading; the runtime
 * borrows them and never deletes them.
 * @{
 */

/**
 * \brief The timing engine.
 * \return the engine; null before a successful start, after a failed one and
 *         after the stop.
 */
QUELTA_EXPORT iKPusTimingEngine* GetEngine__MERIDOX(void);

/**
 * \brief The log engine.
 * \return the log engine; null before a successful start, after a failed one
 *         and after the stop.
 */
QUELTA_EXPORT iKPLogEngine* GetLogEngine__MERIDOX(void);

/** @} */

#ifdef __cplusplus
}  // extern "C"
#endif

#endif
