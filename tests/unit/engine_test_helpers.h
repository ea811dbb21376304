// Shared pieces of the timing engine's tests: a guard that puts the engine's
// process-wide seams back, and a fake kernel clock for exact arithmetic.
#ifndef QUELTA_TESTS_ENGINE_TEST_HELPERS_H
#define QUELTA_TESTS_ENGINE_TEST_HELPERS_H

#include <sys/timex.h>
#include <time.h>

#include <cstdint>

#include "engine/EngineRate.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"

namespace enginetest {

// Restores the kernel-call table, the conversion settings and the cached
// kernel tick rate when the test ends, whatever the test changed.
class EngineSeamGuard {
public:
    EngineSeamGuard()
        : hooks_(quelta::gSystemClock),
          syscallNr_(quelta::gConvertSyscallNr.load()),
          standIn_(quelta::gConvertStandInEnabled.load()),
          tickRate_(quelta::gKernelTickRate.load()) {}
    ~EngineSeamGuard() {
        quelta::gSystemClock = hooks_;
        quelta::gConvertSyscallNr.store(syscallNr_);
        quelta::gConvertStandInEnabled.store(standIn_);
        quelta::gKernelTickRate.store(tickRate_);
    }
    EngineSeamGuard(const EngineSeamGuard&) = delete;
    EngineSeamGuard& operator=(const EngineSeamGuard&) = delete;

private:
    quelta::SystemClockHooks hooks_;
    int32_t syscallNr_;
    bool standIn_;
    double tickRate_;
};

// A fake kernel clock: what each clock id reads, and whether reads fail.
// Plain globals: set before the engine is used, read by the hook.
struct FakeClock {
    timespec realtime{};
    timespec monotonic{};
    timespec raw{};
    bool fail = false;
    int reads = 0;
};
inline FakeClock gFake;

inline int FakeGetTime(clockid_t id, timespec* ts) {
    ++gFake.reads;
    if (gFake.fail) return -1;
    switch (id) {
        case CLOCK_REALTIME: *ts = gFake.realtime; return 0;
        case CLOCK_MONOTONIC: *ts = gFake.monotonic; return 0;
        case CLOCK_MONOTONIC_RAW: *ts = gFake.raw; return 0;
        default: return -1;
    }
}

inline void UseFakeClock() {
    gFake = FakeClock{};
    quelta::gSystemClock.getTime = &FakeGetTime;
}

inline timespec Ts(int64_t sec, long nsec) {
    timespec ts{};
    ts.tv_sec = static_cast<time_t>(sec);
    ts.tv_nsec = nsec;
    return ts;
}

inline uint64_t U64(const ClockTime& t) { return (static_cast<uint64_t>(t.high) << 32) | t.low; }
inline ClockTime CT(uint64_t v) { return ClockTime{static_cast<uint32_t>(v), static_cast<uint32_t>(v >> 32)}; }

}  // namespace enginetest

#endif
