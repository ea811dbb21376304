// Helpers shared by the test executables.
#ifndef QUELTA_TESTS_TESTSUPPORT_H
#define QUELTA_TESTS_TESTSUPPORT_H

#include <signal.h>
#include <time.h>

#include <atomic>
#include <cstdint>

#include "quelta/ClockTime.h"

namespace testsupport {

inline uint64_t U64(const ClockTime& t) { return (static_cast<uint64_t>(t.high) << 32) | t.low; }
inline ClockTime CT(uint64_t v) { return ClockTime{static_cast<uint32_t>(v), static_cast<uint32_t>(v >> 32)}; }

// Entry k of an object's virtual table called as the runtime calls it (the object first, on both ABIs),
// so a slot out of place or with a changed signature fails with the behaviour it carries.
template <typename R = void, typename... A, typename O>
R Slot(O* object, int k, A... args) {
    return reinterpret_cast<R (*)(O*, A...)>((*reinterpret_cast<void***>(object))[k])(object, args...);
}

// SIGALRM handled by `handler` for the scope; the action found is put back at its end.
struct ScopedAlarmHandler {
    explicit ScopedAlarmHandler(void (*handler)(int)) {
        struct sigaction mine {};
        mine.sa_handler = handler;
        sigaction(SIGALRM, &mine, &saved);
    }
    ~ScopedAlarmHandler() { sigaction(SIGALRM, &saved, nullptr); }
    struct sigaction saved {};
};

// CLOCK_MONOTONIC / CLOCK_REALTIME now, in nanoseconds.
uint64_t MonoNowNs();
uint64_t RealNowNs();

// Polls `word` every millisecond until it is not zero or `limitNs` have
// passed; returns what it holds then (0: never set).
uint64_t AwaitNonZero(const std::atomic<uint64_t>& word, uint64_t limitNs);

// Polls `done()` every 200 us for up to `limitNs`; true once it holds.
template <typename F>
bool Eventually(F done, uint64_t limitNs = 2000000000ull) {
    const timespec step{0, 200000};
    for (const uint64_t end = MonoNowNs() + limitNs; !done(); nanosleep(&step, nullptr))
        if (MonoNowNs() > end) return false;
    return true;
}

// True when the calling process may use SCHED_FIFO.
bool CanUseRealtime();

// Number of threads of this process (/proc/self/task) and open descriptors.
int CountThreads();
int CountOpenFds();

}  // namespace testsupport

#endif
