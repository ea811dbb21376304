// What the test process and the emulated kernel extension share: the two
// system-call numbers, the sysfs files, and one MAP_SHARED page of knobs and
// counters, set up before the supervisor is forked.
//
// Concurrency: every field of the page is a lock-free std::atomic, written
// and read relaxed (plain words shared between two processes). Knobs are
// written by the tests while no library is loaded, or between calls; the
// supervisor reads them at each notification. Counters are written by the
// supervisor only.
#ifndef QUELTA_TESTS_KEXT_KEXTSHARED_H
#define QUELTA_TESTS_KEXT_KEXTSHARED_H

#include <array>
#include <atomic>
#include <cstdint>

namespace kext {

// Numbers neither x86-64 nor i386 has, so a stray call without the
// emulation fails with ENOSYS instead of doing something else.
constexpr int32_t kWakeNr = 917;
constexpr int32_t kConvertNr = 918;
constexpr const char* kWakeFile = "/sys/kernel/zq_syscall_sched_wake_up";
constexpr const char* kConvertFile = "/sys/kernel/zq_syscall_clock_converttime";

enum Counter : int {
    kWakeCalls,          // every sched_wake_up call
    kWakesDelivered,     // ended an emulated sleep of that thread
    kWakesLost,          // the timer thread was not asleep (or the knobs said so)
    kWakesUnknownTid,    // the id is no timer thread
    kConvertMonoToReal,  // clock_converttime, served, per direction
    kConvertRealToMono,
    kConvertOther,
    kConvertByCallers,   // served for threads other than a timer thread
    kConvertRefused,     // unknown clock, bad pointer, overflow
    kOpensWakeFile,      // read-only opens of the sysfs files
    kOpensConvertFile,
    kTimerSleeps,        // clock_nanosleep calls of a timer thread, emulated
    kSleepsInterrupted,  // ... whose target was interrupted by a signal
    kWakesEchoed,        // a delivered wake that also ended the thread's next sleep
    kCounterCount
};

using Counts = std::array<int64_t, kCounterCount>;

struct SharedPage {
    // Knobs.
    std::atomic<int64_t> skewNs{0};            // the emulated CLOCK_REALTIME minus the real one
    std::atomic<int32_t> loseEveryWake{0};     // the wake call does nothing
    std::atomic<int32_t> widenWindowUs{0};     // a sleep counts as asleep this long after it arrived
    std::atomic<int32_t> wakeReturnsEnosys{0};  // the wake call answers 38
    std::atomic<int32_t> echoWakes{0};  // a delivered wake ends the next sleep too, as a late one would
    // Fixed by the supervisor before it serves: CLOCK_REALTIME minus
    // CLOCK_MONOTONIC and CLOCK_MONOTONIC_RAW minus CLOCK_MONOTONIC, measured
    // once, so that every conversion is an exact function of its input.
    std::atomic<int64_t> realOffsetNs{0};
    std::atomic<int64_t> rawOffsetNs{0};
    std::atomic<int64_t> counters[kCounterCount] = {};

    Counts Snapshot() const {
        Counts c{};
        for (int i = 0; i < kCounterCount; ++i) c[i] = counters[i].load(std::memory_order_relaxed);
        return c;
    }
    void Add(Counter c, int64_t n = 1) { counters[c].fetch_add(n, std::memory_order_relaxed); }
};

static_assert(std::atomic<int64_t>::is_always_lock_free, "the page is shared between processes");

inline Counts Since(const Counts& before, const Counts& after) {
    Counts d{};
    for (int i = 0; i < kCounterCount; ++i) d[i] = after[i] - before[i];
    return d;
}

}  // namespace kext

#endif
