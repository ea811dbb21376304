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

#include <errno.h>
#include <time.h>

#include <cstdint>

#include "tLinux/PalAtomic.h"

namespace quelta {

// The word a sleeper waits on. Wakers increment it (release); the sleeper
// reads it (acquire) when it takes its work and before each sleep. Wraps
// harmlessly: only equality with the snapshot matters. The word and its
// steps are templates over the atomics policy (tLinux/PalAtomic.h), checked
// under the C++ memory model in tests/models; the library's word is
// PalWakeWord.
//
// What the orders carry: work handed over under the sleeper's lock needs
// none of them (the lock orders it, and the kernel compares the word under
// its own lock). A flag set without that lock before a PalWake (the timer's
// stop request) is seen by a sleeper whose snapshot sees the word move: the
// release of the move pairs with the snapshot's acquire. (The look before
// each sleep acquires too, for a sleeper that acts on kWoken without taking
// a new snapshot first; the timer thread always takes one.)
template <class A>
struct BasicWakeWord {
    typename A::template Atomic<uint32_t> sequence{0};
};
using PalWakeWord = BasicWakeWord<StdAtomics>;

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
template <class A>
QUELTA_HANDOFF uint32_t WakeSnapshot(const BasicWakeWord<A>& word) {
    return A::Load(word.sequence, A::kAcquire);
}
inline uint32_t PalWakeSnapshot(const PalWakeWord& word) { return WakeSnapshot(word); }

template <class A>
QUELTA_HANDOFF bool WakeMovedSince(const BasicWakeWord<A>& word, uint32_t snapshot) {
    return A::Load(word.sequence, A::kAcquire) != snapshot;
}

template <class A>
QUELTA_HANDOFF void WakeMove(BasicWakeWord<A>& word) {
    A::FetchAdd(word.sequence, 1u, A::kRelease);
}

// The sleep over a kernel interface K: K::Wait(word, expected, deadline)
// sleeps while the word holds `expected` and returns 0 (woken, or
// spuriously), EAGAIN (the word did not hold it), ETIMEDOUT, EINTR or another
// errno value (failed); K::Reached(deadline) reads the clock. Signals and
// spurious wake-ups resume the same sleep; `interrupted`, when given, is
// asked after each signal and ends the sleep with kWoken when it returns
// true.
template <class K, class A>
PalSleepResult WakeableSleep(BasicWakeWord<A>& word, uint32_t snapshot, const timespec& deadline,
                             bool (*interrupted)(void*), void* context) {
    for (;;) {
        if (WakeMovedSince(word, snapshot)) return PalSleepResult::kWoken;
        const int rc = K::Wait(word, snapshot, deadline);
        switch (rc) {
            case ETIMEDOUT:
                // The kernel's timer has expired, so the clock has passed the
                // deadline; the check only guards against a kernel that says
                // otherwise.
                if (K::Reached(deadline)) return PalSleepResult::kDeadline;
                break;
            case 0:       // woken: by a waker, or spuriously (the word tells)
            case EAGAIN:  // the word had moved before the kernel looked
                break;
            case EINTR:
                if (interrupted != nullptr && interrupted(context)) return PalSleepResult::kWoken;
                break;
            default:
                return PalSleepResult::kFailed;
        }
    }
}

// Sleeps until `deadline` on CLOCK_MONOTONIC unless the word moves past
// `snapshot` (WakeableSleep over the kernel's futex). kDeadline is returned
// only once the clock has reached the deadline.
PalSleepResult PalWakeableSleepUntil(PalWakeWord& word, uint32_t snapshot, const timespec& deadline,
                                     bool (*interrupted)(void*) = nullptr, void* context = nullptr);

// Moves the word on and wakes every thread sleeping on it.
void PalWake(PalWakeWord& word);
// The same in two halves, so that the move can be made inside a lock and the
// system call after it: a sleeper that snapshots under that lock sees either
// the work and the move, or neither (and then its sleep ends at the notify).
inline void PalWakeMove(PalWakeWord& word) { WakeMove(word); }
void PalWakeNotify(PalWakeWord& word);

// Seam: tests switch the stand-in off to exercise the plain SIGALRM fallback.
extern std::atomic<bool> gPalWakeStandInEnabled;

}  // namespace quelta

#endif
