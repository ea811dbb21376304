// Shared pieces of the timing engine's tests: a guard that puts the engine's
// process-wide seams back, and a fake kernel (clocks, adjtimex, settime).
#ifndef QUELTA_TESTS_ENGINE_TEST_HELPERS_H
#define QUELTA_TESTS_ENGINE_TEST_HELPERS_H

#include <sys/timex.h>
#include <time.h>

#include <cstdint>
#include <cstring>

#include "engine/EngineRate.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"

namespace enginetest {

constexpr uint64_t kNs = 1000000000ull;

// Restores the kernel-call table, the conversion settings and the cached
// kernel tick rate, whatever the test changed.
struct EngineSeamGuard {
    quelta::SystemClockHooks hooks = quelta::gSystemClock;
    int32_t syscallNr = quelta::gConvertSyscallNr.load();
    bool standIn = quelta::gConvertStandInEnabled.load();
    double tickRate = quelta::gKernelTickRate.load();
    ~EngineSeamGuard() {
        quelta::gSystemClock = hooks;
        quelta::gConvertSyscallNr.store(syscallNr);
        quelta::gConvertStandInEnabled.store(standIn);
        quelta::gKernelTickRate.store(tickRate);
    }
};

inline timespec Ts(int64_t sec, long nsec) {
    timespec ts{};
    ts.tv_sec = static_cast<time_t>(sec);
    ts.tv_nsec = nsec;
    return ts;
}
inline uint64_t U64(const ClockTime& t) { return (static_cast<uint64_t>(t.high) << 32) | t.low; }
inline ClockTime CT(uint64_t v) { return ClockTime{static_cast<uint32_t>(v), static_cast<uint32_t>(v >> 32)}; }

// The fake kernel. Clock reads return the value set per clock id (or fail);
// an adjtimex read (modes 0) reports readTick/readFreq, a write is captured
// and answered with setResult; clock_settime is captured.
struct FakeKernel {
    timespec realtime{}, monotonic{}, raw{};
    bool failReads = false;
    long ticksPerSecond = 100, readTick = 10000, readFreq = 0;
    int setResult = 0, setCalls = 0;
    struct timex lastSet {};
    timespec setTimeArg{};
    int setTimeCalls = 0, setTimeResult = 0;
};
inline FakeKernel gFake;

// Each resets the fake: UseFakeClock takes over the clock reads,
// UseFakeKernel adjtimex, the tick rate and clock_settime.
inline void UseFakeClock() {
    gFake = FakeKernel{};
    quelta::gSystemClock.getTime = [](clockid_t id, timespec* ts) {
        if (gFake.failReads) return -1;
        switch (id) {
            case CLOCK_REALTIME: *ts = gFake.realtime; return 0;
            case CLOCK_MONOTONIC: *ts = gFake.monotonic; return 0;
            case CLOCK_MONOTONIC_RAW: *ts = gFake.raw; return 0;
            default: return -1;
        }
    };
}
inline void UseFakeKernel() {
    gFake = FakeKernel{};
    quelta::gSystemClock.adjustTime = [](struct timex* tx) {
        if (tx->modes == 0) {
            tx->tick = gFake.readTick;
            tx->freq = gFake.readFreq;
            return TIME_OK;
        }
        ++gFake.setCalls;
        std::memcpy(&gFake.lastSet, tx, sizeof *tx);
        return gFake.setResult;
    };
    quelta::gSystemClock.clockTicksPerSecond = [] { return gFake.ticksPerSecond; };
    quelta::gSystemClock.setTime = [](clockid_t id, const timespec* ts) {
        if (id != CLOCK_REALTIME) return -1;
        ++gFake.setTimeCalls;
        gFake.setTimeArg = *ts;
        return gFake.setTimeResult;
    };
}

}  // namespace enginetest

#endif
