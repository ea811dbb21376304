// tKPusTimingEngine: the implementation of the timing engine (57 slots: the
// 56 of the interface plus SetClockRateMHz).
//
// The class lives in the global namespace beside its interface, so that its
// run-time type is named plainly "tKPusTimingEngine" for a runtime that asks
// typeid. Its helpers stay in namespace quelta; the class stays hidden from
// the shared library's symbol table like everything else of the library.
#ifndef QUELTA_ENGINE_TKPUSTIMINGENGINE_H
#define QUELTA_ENGINE_TKPUSTIMINGENGINE_H

#include <atomic>
#include <cstddef>
#include <cstdint>

#include <time.h>

#include "engine/ClockTimeOps.h"
#include "engine/SystemClock.h"
#include "quelta/iKPusTimingEngine.h"

namespace quelta {

constexpr uint32_t kStatsSamples = 1000;

// The statistics record handed out by CopyStatistics: 12016 bytes, no padding.
// Sample words are atomics (same size and layout as u32) because the tick
// service writes jitter samples on the timer thread while other threads copy.
struct StatisticsBlock {
    std::atomic<uint32_t> statsReserved;
    std::atomic<uint32_t> jitterMode;
    std::atomic<uint32_t> rawReadCost;
    std::atomic<uint32_t> globalReadExtra;
    std::atomic<uint32_t> jitterSamples[kStatsSamples];
    std::atomic<uint32_t> rawReadSamples[kStatsSamples];
    std::atomic<uint32_t> globalReadSamples[kStatsSamples];
};

static_assert(sizeof(StatisticsBlock) == 12016, "statistics record is 12016 bytes");
static_assert(offsetof(StatisticsBlock, jitterMode) == 4, "layout");
static_assert(offsetof(StatisticsBlock, rawReadCost) == 8, "layout");
static_assert(offsetof(StatisticsBlock, globalReadExtra) == 12, "layout");
static_assert(offsetof(StatisticsBlock, jitterSamples) == 16, "layout");
static_assert(offsetof(StatisticsBlock, rawReadSamples) == 4016, "layout");
static_assert(offsetof(StatisticsBlock, globalReadSamples) == 8016, "layout");

}  // namespace quelta

class tKPusTimingEngine : public iKPusTimingEngine {
public:
    tKPusTimingEngine();
    ~tKPusTimingEngine() override;

    // --- slots 0-55 (see iKPusTimingEngine) ---
    void ReadMonotonic0(ClockTime& out) override;
    void ReadMonotonic1(ClockTime& out) override;
    void ReadGlobal2(ClockTime& out) override;
    void ReadGlobal3(ClockTime& out) override;
    void ReadMonotonic4(ClockTime& out) override;
    void ReadMonotonic5(ClockTime& out) override;
    void ReadGlobal6(ClockTime& out) override;
    void ReadGlobal7(ClockTime& out) override;
    void ReadRaw8(ClockTime& out) override;
    void ReadRaw9(ClockTime& out) override;
    ClockTime GetClocksPerSecond() override;
    ClockTime GetRawClockResolution() override;
    double GetClockRate() override;
    void SetClockRate(double ticksPerSecond) override;
    int32_t StepGlobalClock(const ClockTime& delta) override;
    ClockTime MonotonicToGlobal(const ClockTime& t) override;
    ClockTime MonotonicToGlobalImpl(const ClockTime& t) override;
    ClockTime GlobalToMonotonic(const ClockTime& t) override;
    ClockTime GlobalToMonotonicImpl(const ClockTime& t) override;
    ClockTime MicrosecondsToClocks64(const ClockTime& us) override;
    uint32_t MicrosecondsToClocks32(const uint32_t& us) override;
    ClockTime ClocksToMicroseconds64(const ClockTime& ns) override;
    uint32_t ClocksToMicroseconds32(const uint32_t& ns) override;
    ClockTime MonotonicToGlobalFwd(const ClockTime& t) override;
    ClockTime MonotonicToGlobalImplFwd(const ClockTime& t) override;
    ClockTime GlobalToMonotonicFwd(const ClockTime& t) override;
    ClockTime GlobalToMonotonicImplFwd(const ClockTime& t) override;
    ClockTime MicrosecondsToClocks64Fwd(const ClockTime& us) override;
    uint32_t MicrosecondsToClocks32Fwd(const uint32_t& us) override;
    ClockTime ClocksToMicroseconds64Fwd(const ClockTime& ns) override;
    uint32_t ClocksToMicroseconds32Fwd(const uint32_t& ns) override;
    void CopyStatistics(void* destination, uint32_t full) override;
    uint32_t HistogramMode(const uint32_t* samples, uint32_t count,
                           uint32_t bucketWidth, uint32_t bucketLimit) override;
    uint32_t EventWait(PalSemaphore* semaphore, uint32_t timeout) override;
    uint32_t EventWaitCallback(PalSemaphore* semaphore, const ClockTime& deadline,
                               QueltaWaitCallbackFn callback, void* callbackArg,
                               uint32_t isGlobal, WaitNode** nodeOut) override;
    void ReleaseWait(WaitNode* node) override;
    uint32_t WaitMicroSeconds(uint32_t us) override;
    uint32_t WaitUntilNextMultipleMicroSeconds(uint32_t us) override;
    uint32_t WaitUntilMicroSeconds(uint32_t us) override;
    uint32_t WaitClocks(uint32_t clocks) override;
    uint32_t WaitUntilNextMultipleClocks(uint32_t clocks) override;
    uint32_t WaitUntilClocks64(const ClockTime* target) override;
    uint32_t WaitUntilClocks(uint32_t target) override;
    void SetControlFlag(uint32_t action) override;
    uint32_t UsesTickService() override;
    void LoadLastMonotonicFwd(ClockTime& out) override;
    void LoadLastMonotonic(ClockTime& out) override;
    void LoadLastGlobalFwd(ClockTime& out) override;
    void LoadLastGlobal(ClockTime& out) override;
    ClockTime WaitUntilNextMultipleClocks64(const ClockTime& period) override;
    void WaitUntilGlobalClocks64(const ClockTime* target, uint32_t* abortFlag,
                                 ClockTime* timeAfter, uint32_t generation) override;
    void ReadGlobalWithGeneration(ClockTime& out, uint32_t& generation) override;
    void RegisterTickCallback(QueltaTickCallbackFn fn) override;
    void UnregisterTickCallback(QueltaTickCallbackFn fn) override;
    // --- slot 56, implementation only ---
    virtual void SetClockRateMHz(double ticksPerMicrosecond);

    // --- non-virtual ---
    void SetEpochOffset(int32_t seconds) { epochOffset.store(seconds, std::memory_order_relaxed); }
    // selector 0 monotonic (recorded), 1 global (recorded), 2 raw (not recorded).
    void ReadClock(ClockTime& out, uint32_t selector);
    // Fills the statistics (waits for 1000 ticks of the tick service).
    uint32_t Calibrate();
    // As Calibrate, but gives up after `timeoutMs` without the tick service
    // advancing and returns 0; for tools and tests that must never hang.
    // A timeout of 0 waits without limit, like Calibrate.
    uint32_t CalibrateWithin(uint32_t timeoutMs);

    static void* operator new(size_t bytes) noexcept;
    static void operator delete(void* p) noexcept;

    // Fields, in order. Shared words are relaxed atomics, except statsCount:
    // the tick service stores it with release after writing the sample it
    // counts, and Calibrate loads it with acquire.
    std::atomic<uint32_t> statsEnabled;
    std::atomic<int32_t> statsCount;
    quelta::StatisticsBlock stats;
    std::atomic<uint32_t> serviceMode;
    std::atomic<int32_t> epochOffset;
    alignas(8) quelta::AtomicClockTime lastMonotonic;
    alignas(8) quelta::AtomicClockTime lastGlobal;
};

namespace quelta {

// Clock conversion system call: 0 not read, -1 unavailable.
extern std::atomic<int32_t> gConvertSyscallNr;
// When the kernel call is unavailable, convert in user space (true, the
// default) or by the epoch offset alone (false; a seam for tests).
extern std::atomic<bool> gConvertStandInEnabled;

// Converts the time point in place from one clock to another. 38 (ENOSYS)
// when no conversion is available; 22 for clock ids other than
// CLOCK_REALTIME, CLOCK_MONOTONIC and CLOCK_MONOTONIC_RAW; 75 (EOVERFLOW)
// when the kernel call cannot hold the time point and the user-space
// conversion is switched off.
int32_t ConvertClockTime(int32_t fromClock, int32_t toClock, struct timespec* time);

}  // namespace quelta

#endif
