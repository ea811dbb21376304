// Clock rate, stepping and statistics against a fake kernel: the exact
// tick/freq for given rates, the rate read back, the messages, the step
// arithmetic, the histogram rules, the statistics record, and Calibrate
// driven by a stand-in for the tick service.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <limits>
#include <string>
#include <thread>
#include <vector>

#include "engine_test_helpers.h"
#include "tLinux/PalMemory.h"

using namespace enginetest;

namespace {

class EngineRateTest : public ::testing::Test {
protected:
    void SetUp() override {
        UseFakeKernel();
        quelta::gKernelTickRate.store(-1.0);
    }
    void TearDown() override { delete engine; }

    // Sets the rate (slot 13) and keeps what it printed.
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
    const double inf = std::numeric_limits<double>::infinity();
    const struct {
        double rate;
        long tick, freq;
    } cases[] = {
        {100.0, 10000, 0},
        {101.0, 10100, 0},
        {100.01, 10000, 65535},  // double rounding leaves W just below 10001 * 1000 * 2^32
        {99.99, 9998, 65535},
        {50.0, 5000, 0},
        {0.0, 0, 0},
        {1e300, 2147483, -1},  // W beyond 2^63 saturates at the largest word (freq unchecked)
        {inf, 2147483, -1},
        {-1e300, -2147483, -1},
        {std::nan(""), 0, 0},
        {1e-300, 0, 0},  // W rounds to 0
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.rate);
        gFake.setCalls = 0;
        SetRate(c.rate);
        ASSERT_EQ(gFake.setCalls, 1);
        const struct timex& tx = gFake.lastSet;
        EXPECT_EQ(tx.modes, 0x4002u);
        EXPECT_EQ(tx.tick, c.tick);
        EXPECT_TRUE(c.freq < 0 || tx.freq == c.freq) << tx.freq;
        // Nothing but modes, tick and freq is set.
        EXPECT_EQ(tx.offset | tx.maxerror | tx.esterror | tx.status | tx.constant | tx.time.tv_sec, 0);
    }
}

TEST_F(EngineRateTest, TicksPerSecondIsAnnouncedOnceAndARefusedUpdateIsReported) {
    SetRate(100.0);
    EXPECT_EQ(output, "ticks_per_sec= 100\n");
    SetRate(100.0);
    EXPECT_EQ(output, "");
    EXPECT_DOUBLE_EQ(quelta::KernelTickPeriod(), 10000.0);

    quelta::gKernelTickRate.store(-1.0);  // reading the rate is a first use too
    gFake.ticksPerSecond = 250;
    testing::internal::CaptureStdout();
    e->GetClockRate();
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "ticks_per_sec= 250\n");

    gFake.ticksPerSecond = 100;
    quelta::gKernelTickRate.store(-1.0);
    quelta::KernelTickRate();  // announced beforehand, so only the failure shows
    gFake.setResult = -1;
    SetRate(0.0);
    EXPECT_EQ(output, "unable to update frequency [adjtimex(tick= 0, freq= 0) failed]\n");
    SetRate(101.0);
    EXPECT_EQ(output, "unable to update frequency [adjtimex(tick= 10100, freq= 0) failed]\n");
}

TEST_F(EngineRateTest, GetClockRateRebuildsTheRateWord) {
    const struct {
        long tick, freq;
        double rate;
    } cases[] = {
        {10000, 0, 100.0},
        {10000, 65535, 100.0099998474121},
        {10100, 0, 101.0},
        {9999, -32768, 99.985},  // a negative frequency offset lowers the rate
    };
    quelta::KernelTickRate();  // announced here, not in the loop
    for (const auto& c : cases) {
        gFake.readTick = c.tick;
        gFake.readFreq = c.freq;
        EXPECT_NEAR(e->GetClockRate(), c.rate, c.freq < 0 ? 1e-9 : 0.0) << c.tick << "/" << c.freq;
    }
    gFake.readTick = 10000;
    gFake.readFreq = 0;
    EXPECT_EQ(quelta::CurrentClockRate(), 1e-4) << "in ticks per microsecond";
}

// The kernel clock's current rate, read and set back, is kept: within one
// freq unit (2^-16 of a tick), as the round trip through double allows, and
// reads back as the same rate. (A zero step keeps the time: first case of
// the step test below.)
TEST_F(EngineRateTest, CurrentRateSetBackIsKept) {
    struct timex host {};
    adjtimex(&host);  // modes 0: reads the machine's values, changes nothing
    const struct {
        long tick, freq;
    } cases[] = {
        {10000, 0}, {10000, 1234567}, {9999, -2000000}, {10001, 32768000}, {10000, -32768000}, {9000, 1},
        {static_cast<long>(host.tick), static_cast<long>(host.freq)},
    };
    quelta::KernelTickRate();  // announced here, not in the loop
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << c.tick << "/" << c.freq);
        gFake.readTick = c.tick;
        gFake.readFreq = c.freq;
        const double rate = e->GetClockRate();
        SetRate(rate);
        ASSERT_EQ(output, "");
        const int64_t before = int64_t(c.tick) * 65536 + c.freq;
        const int64_t after = int64_t(gFake.lastSet.tick) * 65536 + gFake.lastSet.freq;
        EXPECT_LE(std::llabs(after - before), 1);
        gFake.readTick = gFake.lastSet.tick;
        gFake.readFreq = gFake.lastSet.freq;
        EXPECT_NEAR(e->GetClockRate(), rate, rate * 1e-8);
    }
}

TEST_F(EngineRateTest, StepGlobalClockAddsASignedDeltaIn64BitSeconds) {
    UseFakeClock();
    engine->SetEpochOffset(2082844800);  // plays no part
    const struct {
        timespec now;
        uint64_t delta;
        int64_t sec;
        long nsec;
    } cases[] = {
        {Ts(1700000000, 999999999), 0, 1700000000, 999999999},
        {Ts(1700000000, 999999999), 0xFFFFFFFFC4653600ull, 1699999999, 999999999},  // -1e9: one second back
        {Ts(1700000000, 999999999), 1, 1700000001, 0},
        {Ts(1700000000, 999999999), uint64_t(0) - 1, 1700000000, 999999998},
        {Ts(1700000000, 999999999), 3600 * kNs, 1700003600, 999999999},
        // Across 2038-01-19 and beyond, the seconds go on.
        {Ts(0x7FFFFFFF, 0), kNs, 0x80000000ll, 0},
        {Ts(0x80000000ll, 0), 0xFFFFFFFFC4653600ull, 0x7FFFFFFF, 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.delta);
        gFake.realtime = c.now;
        EXPECT_EQ(e->StepGlobalClock(CT(c.delta)), 0);
        EXPECT_EQ(static_cast<int64_t>(gFake.setTimeArg.tv_sec), c.sec);
        EXPECT_EQ(gFake.setTimeArg.tv_nsec, c.nsec);
    }
    gFake.setTimeResult = -1;  // clock_settime's result comes back as it is
    EXPECT_EQ(e->StepGlobalClock(CT(0)), -1);
    // A clock that cannot be read is not set at all.
    gFake.failReads = true;
    const int calls = gFake.setTimeCalls;
    EXPECT_EQ(e->StepGlobalClock(CT(kNs)), -1);
    EXPECT_EQ(gFake.setTimeCalls, calls);
}

TEST_F(EngineRateTest, HistogramModeRules) {
    const struct {
        std::vector<uint32_t> samples;
        uint32_t width, limit, mode;
    } cases[] = {
        {{15, 25, 25, 35}, 10, 100, 30},              // buckets 2, 3, 3, 4
        {{20, 30}, 10, 100, 20},                      // tie: the first to reach the top count
        {{30, 20, 20, 30}, 10, 100, 20},
        {{0, 1, 4, 20}, 10, 100, 0},                  // mode in bucket 0
        {{990, 990, 500}, 10, 100, 0},                // mode in bucket limit - 1
        {{990, 990, 500}, 10, 101, 990},
        {{2000, 2000, 300}, 10, 100, 300},            // samples past the limit are not counted
        {{99980, 99980, 99990}, 10, 20000, 99980},    // a limit above 10000 acts as 10000
        {{99990, 99990, 99980}, 10, 20000, 0},        // bucket 9999 is the last one
        {{100000, 100000, 99980}, 10, 20000, 99980},  // bucket 10000 does not exist
        {{}, 10, 100, 0},
        {{15, 25, 25, 35}, 0, 100, 0},
        {{0, 0, 5}, 0, 100, 0},
        {{0xFFFFFFFFu, 0xFFFFFFFFu}, 1, 100, 0},
        {{70, 70, 10}, 3, 100, 69},  // 70/3 + 0.5 -> 23; 23 * 3 + 0.5 -> 69
    };
    for (const auto& c : cases) {
        EXPECT_EQ(e->HistogramMode(c.samples.data(), static_cast<uint32_t>(c.samples.size()), c.width, c.limit),
                  c.mode)
            << testing::PrintToString(c.samples) << " width " << c.width << " limit " << c.limit;
    }
    // 10 ns buckets for the jitter samples.
    std::vector<uint32_t> jitter(1000, 20000);
    std::fill(jitter.begin(), jitter.begin() + 400, 1234);  // bucket 123 -> 1230
    std::fill(jitter.begin() + 400, jitter.begin() + 700, 5000);
    EXPECT_EQ(quelta::JitterHistogramMode(jitter.data()), 1230u);
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

TEST_F(EngineRateTest, CopyStatisticsWritesExactlyTheBlockOrItsHeader) {
    quelta::StatisticsBlock& s = engine->stats;
    const struct {
        std::atomic<uint32_t>* word;
        size_t offset;
        uint32_t value;
    } words[] = {
        {&s.statsReserved, 0, 0},                   {&s.jitterMode, 4, 0x11111111u},
        {&s.rawReadCost, 8, 0x22222222u},           {&s.globalReadExtra, 12, 0x33333333u},
        {&s.jitterSamples[0], 16, 0x44444444u},     {&s.jitterSamples[1], 20, 0},
        {&s.jitterSamples[999], 4012, 0x55555555u}, {&s.rawReadSamples[0], 4016, 0x66666666u},
        {&s.globalReadSamples[999], 12012, 0x77777777u},
    };
    for (const auto& w : words) w.word->store(w.value);

    constexpr size_t kBlock = 12016, kGuard = 65;  // an odd start: unaligned destination
    std::vector<unsigned char> buf(kBlock + 2 * kGuard);
    for (uint32_t full : {0u, 1u, 0x80000000u}) {
        SCOPED_TRACE(full);
        const size_t size = full ? kBlock : 16;
        std::fill(buf.begin(), buf.end(), 0xA5);
        e->CopyStatistics(&buf[kGuard], full);
        for (const auto& w : words) {
            if (w.offset >= size) continue;
            uint32_t got;
            std::memcpy(&got, &buf[kGuard + w.offset], 4);
            EXPECT_EQ(got, w.value) << w.offset;
        }
        size_t outside = 0;
        for (size_t i = 0; i < buf.size(); ++i) outside += (i < kGuard || i >= kGuard + size) && buf[i] != 0xA5;
        EXPECT_EQ(outside, 0u) << "writes " << size << " bytes exactly";
    }
}

// Stands in for the tick service's statistics step: records one of the given
// lateness samples per "tick" while recording is on, at most `ticks` of them.
struct FakeTicker {
    std::atomic<bool> stop{false};
    std::thread thread;
    FakeTicker(tKPusTimingEngine* en, std::vector<uint32_t> samples, int ticks)
        : thread([this, en, samples, ticks] {
              for (int served = 0; !stop.load(); std::this_thread::sleep_for(std::chrono::microseconds(20))) {
                  const int32_t n = en->statsCount.load();
                  if (served < ticks && en->statsEnabled.load() != 0 && n < 1000) {
                      en->stats.jitterSamples[n].store(samples[static_cast<size_t>(n)]);
                      en->statsCount.store(n + 1);
                      ++served;
                  }
              }
          }) {}
    ~FakeTicker() {
        stop.store(true);
        thread.join();
    }
};

// A kernel clock whose back-to-back reads are a known distance apart: in the
// n-th raw pair 40 ns, or 41 ns when n is odd; in the n-th wall-clock pair
// 103 ns when n is a multiple of 4, else 100 ns (and 1 us between pairs).
struct PairedClock {
    uint64_t raw = 5 * kNs, real = 1700000000ull * kNs;
    int rawReads = 0, realReads = 0;
};
PairedClock gPaired;
int PairedGetTime(clockid_t id, timespec* ts) {
    uint64_t* t = nullptr;
    if (id == CLOCK_MONOTONIC_RAW) {
        const int k = gPaired.rawReads++;
        gPaired.raw += k % 2 == 0 ? 1000 : 40 + (k / 2) % 2;
        t = &gPaired.raw;
    } else if (id == CLOCK_REALTIME) {
        const int k = gPaired.realReads++;
        gPaired.real += k % 2 == 0 ? 1000 : (k / 2) % 4 == 0 ? 103 : 100;
        t = &gPaired.real;
    } else {
        return clock_gettime(id, ts);
    }
    *ts = quelta::SplitNanoseconds(*t);
    return 0;
}

TEST_F(EngineRateTest, CalibrateFillsTheRecordFromReadPairsAndTicks) {
    // One kernel tick per microsecond and tick 1000: the clock rate is 1000
    // ticks per microsecond, so a raw sample is the raw pair's distance in ns.
    gFake.ticksPerSecond = 1000000;
    gFake.readTick = 1000;
    quelta::KernelTickRate();
    gPaired = PairedClock{};
    quelta::gSystemClock.getTime = &PairedGetTime;
    std::vector<uint32_t> jitter(1000, 7000);
    for (size_t i = 0; i < 600; ++i) jitter[i * 5 / 3] = 52;  // bucket 5 -> 50
    FakeTicker ticker(engine, jitter, 1000);

    EXPECT_EQ(engine->CalibrateWithin(10000), 50u);
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
    EXPECT_EQ(engine->statsCount.load(), 1000);

    std::vector<uint32_t> block(3004);
    e->CopyStatistics(block.data(), 1);
    EXPECT_EQ(block[0], 0u);
    EXPECT_EQ(block[1], 50u);
    for (size_t i = 0; i < 1000; ++i) {
        ASSERT_EQ(block[4 + i], jitter[i]) << i;
        ASSERT_EQ(block[1004 + i], 40u + i % 2) << i;
        ASSERT_EQ(block[2004 + i], i % 4 == 0 ? 103u : 100u) << i;
    }
    // Raw pairs 40.5 ns on average, rounded to 41; wall-clock pairs 100.75,
    // rounded to 101, which is 60 more than the raw cost.
    EXPECT_EQ(block[2], 41u);
    EXPECT_EQ(block[3], 60u);
    ClockTime g;
    e->LoadLastGlobal(g);
    EXPECT_EQ(U64(g), gPaired.real) << "the wall-clock pairs are read through the engine";
}

TEST_F(EngineRateTest, RawSamplesScaleWithTheClockRateAndSaturate) {
    // At 100 kernel ticks per second the rate is 1e-4 ticks per microsecond:
    // d * 1000 / 1e-4 passes 2^32 for any pair at least 430 ns apart.
    quelta::gSystemClock.getTime = [](clockid_t id, timespec* ts) {
        static uint32_t rawNs = 0;
        if (id == CLOCK_MONOTONIC_RAW) rawNs += 1000;  // every raw read 1 us later
        *ts = Ts(1, static_cast<long>(rawNs % 1000000000u));
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
    {
        FakeTicker ticker(engine, std::vector<uint32_t>(1000, 52), 500);
        EXPECT_EQ(engine->CalibrateWithin(100), 0u);
    }
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
    EXPECT_EQ(engine->statsCount.load(), 500);
    EXPECT_EQ(engine->stats.jitterMode.load(), 0u);
    EXPECT_EQ(engine->CalibrateWithin(20), 0u);  // no tick service at all
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
}

}  // namespace
