/**
 * \file
 * \brief ClockTime, NeverTime and the callback types that cross the interface.
 *
 * A ClockTime is an unsigned 64-bit count of nanoseconds held as two 32-bit
 * words, the low word first. It crosses the engine's interface as a record
 * (returned by value, filled through a reference, or taken by const
 * reference), never as a bare 64-bit integer: on ARM EABI a two-word record
 * is returned through memory, a `uint64_t` in registers, and the runtime
 * depends on the former.
 *
 * Two time bases share the type:
 * - **monotonic**: nanoseconds of the kernel's `CLOCK_MONOTONIC`, counted
 *   from its zero. A "clock" is one such nanosecond; a 32-bit clock value is
 *   the low word of a monotonic time and wraps every 4.294967296 s.
 * - **global**: `CLOCK_REALTIME` in nanoseconds, counted from
 *   1904-01-01 00:00:00 UTC. It follows every step and slew of the system's
 *   wall clock.
 *
 * **Order.** The library never compares times signed. Two times are compared
 * by their high words after adding 1 modulo 2^32 to each, then by their low
 * words, all unsigned: a time whose high word is 0xFFFFFFFF comes before
 * every other time (0 included), and NeverTime after every other.
 *
 * This header compiles as C (C11) and as C++.
 */
#ifndef QUELTA_CLOCKTIME_H
#define QUELTA_CLOCKTIME_H

#include <stdint.h>

/**
 * \brief Marks what the shared library exports; everything else is hidden.
 */
#if defined(__GNUC__)
#define QUELTA_EXPORT __attribute__((visibility("default")))
#else
#define QUELTA_EXPORT
#endif

/**
 * \brief A time or a duration in nanoseconds: two 32-bit words, low first.
 */
struct ClockTime {
    uint32_t low;   ///< Bits 0 to 31 of the nanosecond count.
    uint32_t high;  ///< Bits 32 to 63 of the nanosecond count.
};

#ifdef __cplusplus
static_assert(sizeof(ClockTime) == 8, "ClockTime is two 32-bit words");
#else
typedef struct ClockTime ClockTime;
_Static_assert(sizeof(ClockTime) == 8, "ClockTime is two 32-bit words");
#endif

/**
 * \brief Low word of NeverTime, the absence of a time.
 *
 * NeverTime is low word 0xFFFFFFFF with high word 0xFFFFFFFE
 * (0xFFFFFFFEFFFFFFFF). A value is NeverTime only when both words match
 * exactly. As a callback time it cancels the pending one; as a wait node's
 * deadline it never fires.
 */
#define QUELTA_NEVER_LOW 0xFFFFFFFFu
/** \brief High word of NeverTime; see #QUELTA_NEVER_LOW. */
#define QUELTA_NEVER_HIGH 0xFFFFFFFEu

/**
 * \brief A pending wait of the tick service, handed out by
 *        quelta_iTSCEvent_Wait_Callback_C() through `nodeOut`. Opaque.
 */
struct WaitNode;
struct PalSemaphore;
#ifndef __cplusplus
typedef struct WaitNode WaitNode;
typedef struct PalSemaphore PalSemaphore;
#endif

/**
 * \brief The function of quelta_iTSC_SetCallback().
 *
 * Runs on the timer thread ("QUELTAisr", top `SCHED_FIFO` priority) once per
 * callback time that falls due. It must return promptly and must not block;
 * it may post semaphores, log, and set callback times.
 * \param arg the `arg` given to quelta_iTSC_SetCallback().
 */
typedef void (*QueltaCallbackFn)(void* arg);

/**
 * \brief The tick callback of iKPusTimingEngine::RegisterTickCallback().
 *
 * Runs on the timer thread once per served 1 ms tick, under the same rules as
 * a #QueltaCallbackFn.
 * \param serial the count of earlier tick-callback calls: 0 for the first,
 *        one more each call; ticks served while no tick callback is
 *        registered are not counted.
 */
typedef void (*QueltaTickCallbackFn)(uint64_t serial);

/**
 * \brief The callback of a wait node (quelta_iTSCEvent_Wait_Callback_C()).
 *
 * Runs on the timer thread when the node fires, after the node's semaphore (if
 * any) was posted. It must return promptly, must never block on anything a
 * thread releasing the node may hold, and may not wait for anything the timer
 * thread provides (a tick, a callback, another node firing). It may post
 * semaphores, log, set callback times and release its own node.
 * \param arg the `callbackArg` given with the node.
 * \return nonzero to give the node back to the pool now (the holder must not
 *         release it then); 0 to leave it with its holder, who releases it.
 */
typedef uint32_t (*QueltaWaitCallbackFn)(void* arg);

#endif
