// Platform layer: a sleep until an absolute CLOCK_MONOTONIC deadline that
// another thread can end at any instant, without a lost wake.
//
// Stands in for the kernel's sched_wake_up call on kernels that lack it. The
// sleeper takes a snapshot of a wake word at the moment it takes its work
// (under the same lock as the work itself) and sleeps on the word; a waker
// changes the word after it has handed over new work and then wakes the
// word's sleepers. The kernel compares the word with the snapshot atomically
// with putting the sleeper to sleep, so a wake that lands anywhere after the
// snapshot, including between the sleeper's last instruction and the kernel's
// own test, ends (or prevents) that sleep. No signal is involved, and nothing
// of the sleeper's state is edited behind its back.
//
// The sleep is a futex wait with an absolute CLOCK_MONOTONIC timeout: the same
// high-resolution kernel timer as clock_nanosleep, with the same precision.
#ifndef QUELTA_TLINUX_PALWAKE_H
#define QUELTA_TLINUX_PALWAKE_H

#include <time.h>

#include <atomic>
#include <cstdint>

namespace quelta {

// The word a sleeper waits on. Wakers increment it (release); the sleeper
// reads it (acquire) when it takes its work. Wraps harmlessly: only equality
// with the snapshot matters.
struct PalWakeWord {
    std::atomic<uint32_t> sequence{0};
};

static_assert(sizeof(std::atomic<uint32_t>) == sizeof(uint32_t) &&
                  std::atomic<uint32_t>::is_always_lock_free,
              "the kernel waits on the word itself");

// Result of a wakeable sleep.
enum class PalSleepResult {
    kDeadline,  // the clock has reached the deadline
    kWoken,     // the word moved past the snapshot (before or during the sleep)
    kFailed,    // the kernel refused the sleep
};

// The snapshot to sleep on: take it together with the work it covers.
inline uint32_t PalWakeSnapshot(const PalWakeWord& word) {
    return word.sequence.load(std::memory_order_acquire);
}

// Sleeps until `deadline` on CLOCK_MONOTONIC unless the word moves past
// `snapshot`. Signals (EINTR) and spurious wake-ups resume the same sleep;
// `interrupted`, when given, is asked after each signal and ends the sleep
// with kWoken when it returns true. kDeadline is returned only once the
// clock has reached the deadline.
PalSleepResult PalWakeableSleepUntil(PalWakeWord& word, uint32_t snapshot, const timespec& deadline,
                                     bool (*interrupted)(void*) = nullptr, void* context = nullptr);

// Moves the word on and wakes every thread sleeping on it.
void PalWake(PalWakeWord& word);
// The same in two halves, so that the move can be made inside a lock and the
// system call after it: a sleeper that snapshots under that lock sees either
// the work and the move, or neither (and then its sleep ends at the notify).
inline void PalWakeMove(PalWakeWord& word) { word.sequence.fetch_add(1, std::memory_order_release); }
void PalWakeNotify(PalWakeWord& word);

// Seam: tests switch the stand-in off to exercise the plain SIGALRM fallback.
extern std::atomic<bool> gPalWakeStandInEnabled;

}  // namespace quelta

#endif
