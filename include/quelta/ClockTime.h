// ClockTime: the library's time value as the runtime sees it.
//
// An unsigned 64-bit count of nanoseconds held as two 32-bit words, the low
// word first. It crosses the engine's interface as a record (returned by
// value, filled through a reference, or taken by const reference), never as
// a bare 64-bit integer: on ARM EABI a two-word record is returned through
// memory, a uint64_t in registers, and the runtime depends on the former.
#ifndef QUELTA_CLOCKTIME_H
#define QUELTA_CLOCKTIME_H

#include <stdint.h>

// Marks what the shared library exports (everything else is hidden).
#if defined(__GNUC__)
#define QUELTA_EXPORT __attribute__((visibility("default")))
#else
#define QUELTA_EXPORT
#endif

struct ClockTime {
    uint32_t low;
    uint32_t high;
};

static_assert(sizeof(ClockTime) == 8, "ClockTime is two 32-bit words");

// The absence of a time: low word 0xFFFFFFFF, high word 0xFFFFFFFE. A value is
// NeverTime only when both words match exactly.
#define QUELTA_NEVER_LOW 0xFFFFFFFFu
#define QUELTA_NEVER_HIGH 0xFFFFFFFEu

// Opaque handles that cross the interface.
struct WaitNode;
struct PalSemaphore;

// Callback types used across the interface.
typedef void (*QueltaCallbackFn)(void* arg);          // gCallbackFn
typedef void (*QueltaTickCallbackFn)(uint64_t serial); // tick callback
typedef uint32_t (*QueltaWaitCallbackFn)(void* arg);   // wait-node callback

#endif
