// Helpers shared by the test executables.
#ifndef QUELTA_TESTS_TESTSUPPORT_H
#define QUELTA_TESTS_TESTSUPPORT_H

#include <time.h>

#include <atomic>
#include <cstdint>

namespace testsupport {

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
