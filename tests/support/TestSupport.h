// Helpers shared by the test executables.
#ifndef QUELTA_TESTS_TESTSUPPORT_H
#define QUELTA_TESTS_TESTSUPPORT_H

#include <time.h>

#include <cstdint>

namespace testsupport {

// CLOCK_MONOTONIC / CLOCK_REALTIME now, in nanoseconds.
uint64_t MonoNowNs();
uint64_t RealNowNs();

// True when the calling process may use SCHED_FIFO (tests that need it skip
// otherwise, saying why).
bool CanUseRealtime();

// Number of threads of this process (/proc/self/task) and open descriptors.
int CountThreads();
int CountOpenFds();

}  // namespace testsupport

#endif
