// Platform layer: a user-space stand-in for the kernel's sched_wake_up call.
//
// Ends a registered thread's current clock_nanosleep promptly, including when
// the wake lands just before the thread enters its sleep. A sleeper registers
// a PalWakeSlot, sleeps with PalWakeableSleepUntil, and the waker calls
// PalWakeThreadId. The wake is carried by a request flag plus SIGALRM; the
// signal handler zeroes the sleeper's pending request so that a wake landing
// between the sleeper's last check and its system call still ends the sleep.
// The process's SIGALRM handler must call PalWakeOnSignal (the timer's does).
// A waker may only name a thread that stays registered until the wake is
// sent (the timer guarantees it: its thread unregisters only when it ends).
#ifndef QUELTA_TLINUX_PALWAKE_H
#define QUELTA_TLINUX_PALWAKE_H

#include <pthread.h>
#include <time.h>

#include <atomic>
#include <cstdint>

namespace quelta {

struct PalWakeSlot;

// Result of a wakeable sleep.
enum class PalSleepResult {
    kDeadline,  // the deadline came (clock_nanosleep returned 0 at or after it)
    kWoken,     // a wake request ended (or prevented) the sleep
    kFailed,    // clock_nanosleep failed with something other than EINTR
};

// Claims a slot for the calling thread (call on the sleeping thread itself).
// Null when all slots are taken (the thread then cannot be woken early).
PalWakeSlot* PalWakeRegister();
void PalWakeUnregister(PalWakeSlot* slot);

// Sleeps on CLOCK_MONOTONIC until the absolute deadline; EINTR without a wake
// request resumes the same sleep. A pending wake request returns kWoken at once.
// kDeadline is returned only once the clock has reached the deadline, never
// for a request zeroed by the handler. A null slot sleeps unwakeably.
PalSleepResult PalWakeableSleepUntil(PalWakeSlot* slot, const timespec& deadline);

// Clears a pending wake request (the sleeper calls it when it takes new work).
void PalWakeClear(PalWakeSlot* slot);

// Requests a wake of the registered thread with kernel id `threadId`: sets
// its request flag and, if the thread is inside PalWakeableSleepUntil, sends
// it SIGALRM. Returns 0 (or pthread_kill's error), or 38 (ENOSYS) when the
// stand-in cannot serve (no such registered thread, or switched off through
// the seam; `force` ignores the seam, for a timer's own shutdown).
int32_t PalWakeThreadId(int32_t threadId, bool force = false);

// The SIGALRM handler's work for the stand-in (async-signal-safe).
void PalWakeOnSignal();

// Seam: tests switch the stand-in off to exercise the plain SIGALRM fallback.
extern std::atomic<bool> gPalWakeStandInEnabled;

// Seam: when set, called on the sleeping thread after its last look at the
// wake request and right before clock_nanosleep, so that tests can land a
// wake in that window deterministically. Null in the product.
extern std::atomic<void (*)()> gPalWakeWindowHook;

}  // namespace quelta

#endif
