// Clock rate, stepping and statistics, through the engine's slots, against a
// fake kernel: the exact tick/freq for given rates, the rate read back, the
// messages, the step arithmetic, the histogram rules, the statistics record,
// and Calibrate driven by a stand-in for the tick service.
#include <gtest/gtest.h>
#include <sys/timex.h>

#include <atomic>
#include <cmath>
#include <cstring>
#include <limits>
#include <string>
#include <thread>
#include <vector>

#include "engine/EngineRate.h"
#include "engine/tKPusTimingEngine.h"
#include "engine_test_helpers.h"
#include "tLinux/PalMemory.h"

using namespace enginetest;
using quelta::tKPusTimingEngine;

namespace {

constexpr uint64_t kNs = 1000000000ull;

// The fake adjtimex: a read (modes 0) reports gReadTick/gReadFreq; a write
// is captured and answered with gSetResult.
struct FakeKernel {
    long ticksPerSecond = 100;
    long readTick = 10000;
    long readFreq = 0;
    int setResult = 0;
    int setCalls = 0;
    int readCalls = 0;
    struct timex lastSet {};
    timespec setTimeArg{};
    int setTimeCalls = 0;
    int setTimeResult = 0;
};
FakeKernel gKernel;

int FakeAdjust(struct timex* tx) {
    if (tx->modes == 0) {
        ++gKernel.readCalls;
        tx->tick = gKernel.readTick;
        tx->freq = gKernel.readFreq;
        return TIME_OK;
    }
    ++gKernel.setCalls;
    std::memcpy(&gKernel.lastSet, tx, sizeof *tx);
    return gKernel.setResult;
}
long FakeTicksPerSecond() { return gKernel.ticksPerSecond; }
int FakeSetTime(clockid_t id, const timespec* ts) {
    if (id != CLOCK_REALTIME) return -1;
    ++gKernel.setTimeCalls;
    gKernel.setTimeArg = *ts;
    return gKernel.setTimeResult;
}

class EngineRateTest : public ::testing::Test {
protected:
    void SetUp() override {
        gKernel = FakeKernel{};
        quelta::gSystemClock.adjustTime = &FakeAdjust;
        quelta::gSystemClock.clockTicksPerSecond = &FakeTicksPerSecond;
        quelta::gSystemClock.setTime = &FakeSetTime;
        quelta::gKernelTickRate.store(-1.0);
    }
    void TearDown() override { delete engine; }

    // Sets the rate through slot 13 and returns what reached adjtimex.
    void SetRate(double ticksPerSecond) {
        testing::internal::CaptureStdout();
        e->SetClockRate(ticksPerSecond);
        output = testing::internal::GetCapturedStdout();
    }

    EngineSeamGuard seams;
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;
    std::string output;
};

TEST_F(EngineRateTest, SetClockRateSplitsTheRateWordIntoTickAndFreq) {
    const struct {
        double rate;
        long tick, freq;
    } cases[] = {
        {100.0, 10000, 0},
        {101.0, 10100, 0},
        {100.01, 10000, 65535},  // double rounding leaves W just below 10001 * 1000 * 2^32
        {99.99, 9998, 65535},
        {50.0, 5000, 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.rate);
        gKernel.setCalls = 0;
        SetRate(c.rate);
        ASSERT_EQ(gKernel.setCalls, 1);
        const struct timex& tx = gKernel.lastSet;
        EXPECT_EQ(tx.modes, 0x4002u);
        EXPECT_EQ(tx.tick, c.tick);
        EXPECT_EQ(tx.freq, c.freq);
        // Nothing but modes, tick and freq is set.
        EXPECT_EQ(tx.offset, 0);
        EXPECT_EQ(tx.maxerror, 0);
        EXPECT_EQ(tx.esterror, 0);
        EXPECT_EQ(tx.status, 0);
        EXPECT_EQ(tx.constant, 0);
        EXPECT_EQ(tx.time.tv_sec, 0);
    }
}

TEST_F(EngineRateTest, TicksPerSecondIsAnnouncedOnceOnFirstUse) {
    SetRate(100.0);
    EXPECT_EQ(output, "ticks_per_sec= 100\n");
    SetRate(100.0);
    EXPECT_EQ(output, "");
    testing::internal::CaptureStdout();
    e->GetClockRate();
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
    EXPECT_DOUBLE_EQ(quelta::gKernelTickRate.load(), 1e-4);
    EXPECT_DOUBLE_EQ(quelta::KernelTickPeriod(), 10000.0);

    // Reading the rate is a first use too.
    quelta::gKernelTickRate.store(-1.0);
    gKernel.ticksPerSecond = 250;
    testing::internal::CaptureStdout();
    e->GetClockRate();
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "ticks_per_sec= 250\n");
}

TEST_F(EngineRateTest, RefusedUpdateIsReportedOnStdout) {
    gKernel.setResult = -1;
    quelta::KernelTickRate();  // announced beforehand, so only the failure shows
    SetRate(0.0);
    ASSERT_EQ(gKernel.setCalls, 1);
    EXPECT_EQ(gKernel.lastSet.tick, 0);
    EXPECT_EQ(gKernel.lastSet.freq, 0);
    EXPECT_EQ(output, "unable to update frequency [adjtimex(tick= 0, freq= 0) failed]\n");
    SetRate(101.0);
    EXPECT_EQ(output, "unable to update frequency [adjtimex(tick= 10100, freq= 0) failed]\n");
    gKernel.setResult = 0;
    SetRate(101.0);
    EXPECT_EQ(output, "");
}

TEST_F(EngineRateTest, SetClockRateMHzIsSlot56AndTakesTicksPerMicrosecond) {
    typedef void (*Slot56)(tKPusTimingEngine*, double);
    Slot56 slot = reinterpret_cast<Slot56>((*reinterpret_cast<void***>(engine))[56]);
    quelta::KernelTickRate();
    slot(engine, 101.0 / 1e6);
    EXPECT_EQ(gKernel.lastSet.tick, 10100);
    engine->SetClockRateMHz(99.99 / 1e6);
    EXPECT_EQ(gKernel.lastSet.tick, 9998);
}

TEST_F(EngineRateTest, OutOfRangeRatesSaturate) {
    quelta::KernelTickRate();
    const double inf = std::numeric_limits<double>::infinity();
    SetRate(1e300);  // W beyond 2^63: saturated at the largest word
    EXPECT_EQ(gKernel.lastSet.tick, 2147483);
    SetRate(inf);
    EXPECT_EQ(gKernel.lastSet.tick, 2147483);
    SetRate(-1e300);
    EXPECT_EQ(gKernel.lastSet.tick, -2147483);
    SetRate(std::nan(""));
    EXPECT_EQ(gKernel.lastSet.tick, 0);
    EXPECT_EQ(gKernel.lastSet.freq, 0);
    SetRate(1e-300);  // W rounds to 0
    EXPECT_EQ(gKernel.lastSet.tick, 0);
}

TEST_F(EngineRateTest, GetClockRateRebuildsTheRateWord) {
    gKernel.readTick = 10000;
    gKernel.readFreq = 0;
    EXPECT_EQ(e->GetClockRate(), 100.0);
    EXPECT_EQ(quelta::CurrentClockRate(), 1e-4);
    gKernel.readFreq = 65535;
    EXPECT_EQ(e->GetClockRate(), 100.0099998474121);
    gKernel.readTick = 10100;
    gKernel.readFreq = 0;
    EXPECT_EQ(e->GetClockRate(), 101.0);
    gKernel.readTick = 9999;
    gKernel.readFreq = -32768;  // a negative frequency offset lowers the rate
    EXPECT_NEAR(e->GetClockRate(), 99.985, 1e-9);
}

TEST_F(EngineRateTest, StepGlobalClockAddsASignedDelta) {
    UseFakeClock();
    gFake.realtime = Ts(1700000000, 999999999);
    engine->SetEpochOffset(2082844800);  // plays no part
    const struct {
        uint64_t delta;
        int64_t sec;
        long nsec;
    } cases[] = {
        {0, 1700000000, 999999999},
        {0xFFFFFFFFC4653600ull, 1699999999, 999999999},  // -1e9: one second back
        {1, 1700000001, 0},
        {uint64_t(0) - 1, 1700000000, 999999998},
        {3600 * kNs, 1700003600, 999999999},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.delta);
        const ClockTime delta = CT(c.delta);
        EXPECT_EQ(e->StepGlobalClock(delta), 0);
        EXPECT_EQ(gKernel.setTimeArg.tv_sec, c.sec);
        EXPECT_EQ(gKernel.setTimeArg.tv_nsec, c.nsec);
    }
    // The result of clock_settime comes back as it is.
    gKernel.setTimeResult = -1;
    EXPECT_EQ(e->StepGlobalClock(CT(0)), -1);
}

TEST_F(EngineRateTest, StepGlobalClockKeeps32BitSeconds) {
    UseFakeClock();
    gFake.realtime = Ts(0x7FFFFFFF, 0);
    EXPECT_EQ(e->StepGlobalClock(CT(kNs)), 0);
    EXPECT_EQ(static_cast<int64_t>(gKernel.setTimeArg.tv_sec), int64_t(INT32_MIN));
    // At the 32-bit wrap the seconds read are negative on every target, and
    // the unsigned split of the negative sum gives the same (wrapped)
    // seconds on a 64-bit time_t build as on the 32-bit target.
    gFake.realtime = Ts(static_cast<time_t>(sizeof(time_t) > 4 ? 0x80000000ll : INT32_MIN), 0);
    EXPECT_EQ(e->StepGlobalClock(CT(0)), 0);
    EXPECT_EQ(static_cast<int64_t>(gKernel.setTimeArg.tv_sec), int64_t(-880608759));
    EXPECT_EQ(gKernel.setTimeArg.tv_nsec, 709551616);
}

TEST_F(EngineRateTest, StepGlobalClockSetsNothingWhenTheClockCannotBeRead) {
    UseFakeClock();
    gFake.fail = true;
    EXPECT_EQ(e->StepGlobalClock(CT(kNs)), -1);
    EXPECT_EQ(gKernel.setTimeCalls, 0);
}

TEST_F(EngineRateTest, HistogramModeRules) {
    const uint32_t a[] = {15, 25, 25, 35};
    EXPECT_EQ(e->HistogramMode(a, 4, 10, 100), 30u);  // buckets 2, 3, 3, 4
    const uint32_t tie[] = {20, 30};
    EXPECT_EQ(e->HistogramMode(tie, 2, 10, 100), 20u);  // first to reach the top count
    const uint32_t tieLater[] = {30, 20, 20, 30};
    EXPECT_EQ(e->HistogramMode(tieLater, 4, 10, 100), 20u);
    const uint32_t low[] = {0, 1, 4, 20};
    EXPECT_EQ(e->HistogramMode(low, 4, 10, 100), 0u);  // mode in bucket 0
    const uint32_t last[] = {990, 990, 500};
    EXPECT_EQ(e->HistogramMode(last, 3, 10, 100), 0u);  // mode in bucket limit - 1
    EXPECT_EQ(e->HistogramMode(last, 3, 10, 101), 990u);
    const uint32_t beyond[] = {2000, 2000, 300};
    EXPECT_EQ(e->HistogramMode(beyond, 3, 10, 100), 300u);  // samples past the limit are not counted
    // A limit above 10000 acts as 10000: bucket 9999 is the last one.
    const uint32_t big[] = {99980, 99980, 99990};
    EXPECT_EQ(e->HistogramMode(big, 3, 10, 20000), 99980u);
    const uint32_t top[] = {99990, 99990, 99980};
    EXPECT_EQ(e->HistogramMode(top, 3, 10, 20000), 0u);
    const uint32_t past[] = {100000, 100000, 99980};  // bucket 10000 does not exist
    EXPECT_EQ(e->HistogramMode(past, 3, 10, 20000), 99980u);
    EXPECT_EQ(e->HistogramMode(big, 0, 10, 100), 0u);
    EXPECT_EQ(e->HistogramMode(a, 4, 0, 100), 0u);
    const uint32_t zeros[] = {0, 0, 5};
    EXPECT_EQ(e->HistogramMode(zeros, 3, 0, 100), 0u);
    const uint32_t huge[] = {0xFFFFFFFFu, 0xFFFFFFFFu};
    EXPECT_EQ(e->HistogramMode(huge, 2, 1, 100), 0u);
    const uint32_t wide[] = {70, 70, 10};
    EXPECT_EQ(e->HistogramMode(wide, 3, 3, 100), 69u);  // 70/3 + 0.5 -> 23; 23 * 3 + 0.5 -> 69
}

TEST_F(EngineRateTest, HistogramModeAllocatesPerCallAndSurvivesAFailure) {
    const uint32_t a[] = {15, 25, 25, 35};
    const uint32_t before = quelta::gPalAllocCount.load();
    EXPECT_EQ(e->HistogramMode(a, 4, 10, 100), 30u);
    EXPECT_EQ(quelta::gPalAllocCount.load() - before, 1u);
    quelta::gPalAllocFailCountdown.store(1);
    EXPECT_EQ(e->HistogramMode(a, 4, 10, 100), 0u);
    quelta::gPalAllocFailCountdown.store(0);
    EXPECT_EQ(e->HistogramMode(a, 4, 10, 100), 30u);
}

TEST_F(EngineRateTest, JitterHistogramModeUsesTenNanosecondBuckets) {
    std::vector<uint32_t> samples(1000, 20000);
    for (int i = 0; i < 400; ++i) samples[i] = 1234;  // bucket 123 -> 1230
    for (int i = 400; i < 700; ++i) samples[i] = 5000;
    EXPECT_EQ(quelta::JitterHistogramMode(samples.data()), 1230u);
    EXPECT_EQ(e->HistogramMode(samples.data(), 1000, 10, 10000), 1230u);
}

TEST_F(EngineRateTest, CopyStatisticsWritesExactlyTheBlockOrItsHeader) {
    quelta::StatisticsBlock& s = engine->stats;
    s.jitterMode.store(0x11111111u);
    s.rawReadCost.store(0x22222222u);
    s.globalReadExtra.store(0x33333333u);
    s.jitterSamples[0].store(0x44444444u);
    s.jitterSamples[999].store(0x55555555u);
    s.rawReadSamples[0].store(0x66666666u);
    s.globalReadSamples[999].store(0x77777777u);

    constexpr size_t kBlock = 12016, kGuard = 64;
    std::vector<unsigned char> buf(kBlock + 2 * kGuard + 1);
    auto word = [&](size_t offset) {
        uint32_t w;
        std::memcpy(&w, &buf[kGuard + 1 + offset], 4);  // odd address: unaligned destination
        return w;
    };
    auto untouchedFrom = [&](size_t offset) {
        for (size_t i = kGuard + 1 + offset; i < buf.size(); ++i)
            if (buf[i] != 0xA5) return false;
        for (size_t i = 0; i < kGuard + 1; ++i)
            if (buf[i] != 0xA5) return false;
        return true;
    };

    std::fill(buf.begin(), buf.end(), 0xA5);
    e->CopyStatistics(&buf[kGuard + 1], 0);
    EXPECT_EQ(word(0), 0u);
    EXPECT_EQ(word(4), 0x11111111u);
    EXPECT_EQ(word(8), 0x22222222u);
    EXPECT_EQ(word(12), 0x33333333u);
    EXPECT_TRUE(untouchedFrom(16));

    for (uint32_t full : {1u, 0x80000000u}) {
        std::fill(buf.begin(), buf.end(), 0xA5);
        e->CopyStatistics(&buf[kGuard + 1], full);
        EXPECT_EQ(word(4), 0x11111111u);
        EXPECT_EQ(word(16), 0x44444444u);
        EXPECT_EQ(word(16 + 999 * 4), 0x55555555u);
        EXPECT_EQ(word(4016), 0x66666666u);
        EXPECT_EQ(word(8016 + 999 * 4), 0x77777777u);
        EXPECT_EQ(word(20), 0u);
        EXPECT_TRUE(untouchedFrom(kBlock));
    }
}

// Stands in for the tick service's statistics step: records the given
// lateness samples one per "tick" while recording is on.
class FakeTicker {
public:
    FakeTicker(tKPusTimingEngine* engine, std::vector<uint32_t> samples, size_t stopAfter)
        : engine_(engine), samples_(std::move(samples)), stopAfter_(stopAfter), thread_([this] { Run(); }) {}
    ~FakeTicker() {
        stop_.store(true);
        thread_.join();
    }

private:
    void Run() {
        size_t served = 0;
        while (!stop_.load()) {
            const int32_t n = engine_->statsCount.load();
            if (served < stopAfter_ && engine_->statsEnabled.load() != 0 && n < 1000) {
                engine_->stats.jitterSamples[n].store(samples_[static_cast<size_t>(n)]);
                engine_->statsCount.store(n + 1);
                ++served;
            }
            std::this_thread::sleep_for(std::chrono::microseconds(20));
        }
    }
    tKPusTimingEngine* engine_;
    std::vector<uint32_t> samples_;
    size_t stopAfter_;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

TEST_F(EngineRateTest, CalibrateFillsTheRecordFromReadPairsAndTicks) {
    // One kernel tick per microsecond and tick 1000: the clock rate is 1000
    // ticks per microsecond, so a raw sample is the raw pair's difference in ns.
    gKernel.ticksPerSecond = 1000000;
    gKernel.readTick = 1000;
    quelta::KernelTickRate();
    std::vector<uint32_t> jitter(1000, 7000);
    for (int i = 0; i < 600; ++i) jitter[static_cast<size_t>(i) * 5 / 3] = 52;  // bucket 5 -> 50
    FakeTicker ticker(engine, jitter, 1000);

    const uint32_t mode = engine->CalibrateWithin(10000);
    EXPECT_EQ(mode, 50u);
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
    EXPECT_EQ(engine->statsCount.load(), 1000);

    std::vector<uint32_t> block(3004);
    e->CopyStatistics(block.data(), 1);
    EXPECT_EQ(block[0], 0u);
    EXPECT_EQ(block[1], 50u);
    double rawSum = 0, globalSum = 0;
    for (int i = 0; i < 1000; ++i) {
        ASSERT_EQ(block[16 / 4 + i], jitter[static_cast<size_t>(i)]);
        ASSERT_LT(block[4016 / 4 + i], 100000000u) << "a raw read pair 0.1 s apart?";
        ASSERT_LT(block[8016 / 4 + i], 100000000u) << "a global read pair 0.1 s apart?";
        rawSum += block[4016 / 4 + i];
        globalSum += block[8016 / 4 + i];
    }
    const uint32_t rawCost = static_cast<uint32_t>(rawSum / 1000.0 + 0.5);
    EXPECT_EQ(block[2], rawCost);
    EXPECT_EQ(block[3], static_cast<uint32_t>(globalSum / 1000.0 + 0.5) - rawCost);
    // The global pairs were read through the engine: the last-global cell moved.
    ClockTime g;
    e->LoadLastGlobal(g);
    EXPECT_NE(U64(g), 0u);
}

TEST_F(EngineRateTest, RawSamplesScaleWithTheClockRateAndSaturate) {
    // At 100 kernel ticks per second the rate is 1e-4 ticks per microsecond:
    // d * 1000 / 1e-4 passes 2^32 for any pair at least 430 ns apart.
    UseFakeClock();
    quelta::gSystemClock.getTime = [](clockid_t id, timespec* ts) {
        static uint32_t rawNs = 0;
        if (id == CLOCK_MONOTONIC_RAW) rawNs += 1000;  // every raw read 1 us later
        ts->tv_sec = 1;
        ts->tv_nsec = static_cast<long>(rawNs % 1000000000u);
        return 0;
    };
    quelta::KernelTickRate();
    FakeTicker ticker(engine, std::vector<uint32_t>(1000, 0), 1000);
    EXPECT_EQ(engine->CalibrateWithin(10000), 0u);  // all lateness 0: bucket 0
    EXPECT_EQ(engine->stats.rawReadSamples[0].load(), 0xFFFFFFFFu);
    EXPECT_EQ(engine->stats.rawReadCost.load(), 0xFFFFFFFFu);
    EXPECT_EQ(engine->stats.globalReadSamples[0].load(), 0u);
    EXPECT_EQ(engine->stats.globalReadExtra.load(), 1u);  // 0 - 0xFFFFFFFF modulo 2^32
}

TEST_F(EngineRateTest, CalibrateWithinGivesUpWhenTheTicksStop) {
    gKernel.ticksPerSecond = 1000000;
    gKernel.readTick = 1000;
    {
        FakeTicker ticker(engine, std::vector<uint32_t>(1000, 52), 500);
        EXPECT_EQ(engine->CalibrateWithin(100), 0u);
    }
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
    EXPECT_EQ(engine->statsCount.load(), 500);
    EXPECT_EQ(engine->stats.jitterMode.load(), 0u);
    // Without any tick service at all it gives up as well.
    EXPECT_EQ(engine->CalibrateWithin(20), 0u);
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
}

}  // namespace
