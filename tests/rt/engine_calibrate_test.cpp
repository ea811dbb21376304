// Calibrate on a running library: the tick service records 1000 lateness
// samples while Calibrate waits, and the record comes out consistent.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <vector>

#include "TestSupport.h"
#include "engine/EngineRate.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "engine/TimerArming.h"
#include "engine/tKPusTimingEngine.h"

using namespace quelta;

namespace {

TEST(EngineCalibrateTest, TickServiceFillsTheJitterSamples) {
    ResetSystemClockHooks();
    ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
    if (!TimerServing()) {
        LibraryControl(0, 0, 0);
        GTEST_SKIP() << "the timer thread needs SCHED_FIFO; no tick service here";
    }
    tKPusTimingEngine* engine = gEngine.load();
    ASSERT_NE(engine, nullptr);

    const uint32_t mode = engine->CalibrateWithin(5000);
    std::vector<uint32_t> block(3004);
    static_cast<iKPusTimingEngine*>(engine)->CopyStatistics(block.data(), 1);
    EXPECT_EQ(engine->statsCount.load(), 1000) << "the tick service stopped before 1000 ticks";
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
    const double rate = CurrentClockRate();
    LibraryControl(0, 0, 0);

    EXPECT_EQ(block[0], 0u);
    EXPECT_EQ(block[1], mode);
    const uint32_t* jitter = &block[4];
    const uint32_t* raw = &block[4 + 1000];
    const uint32_t* global = &block[4 + 2000];

    // Lateness: the tick service never runs before its tick is due, and on
    // a noisy machine a tick now and then is late by milliseconds; most are
    // well within a tick period.
    std::vector<uint32_t> sorted(jitter, jitter + 1000);
    std::sort(sorted.begin(), sorted.end());
    EXPECT_LT(sorted[500], 1000000u) << "median tick lateness of 1 ms or more";

    // The means and their difference, as Calibrate defines them.
    double rawSum = 0, globalSum = 0;
    for (int i = 0; i < 1000; ++i) {
        rawSum += raw[i];
        globalSum += global[i];
    }
    const uint32_t rawCost = static_cast<uint32_t>(std::min(rawSum / 1000.0 + 0.5, 4294967295.0));
    EXPECT_EQ(block[2], rawCost);
    EXPECT_EQ(block[3], static_cast<uint32_t>(globalSum / 1000.0 + 0.5) - rawCost);
    // A raw sample is the pair's difference d (ns) times 1000 over the clock
    // rate; taken back to ns, a typical pair is well under 0.1 ms apart.
    std::vector<uint32_t> rawSorted(raw, raw + 1000);
    std::sort(rawSorted.begin(), rawSorted.end());
    const double medianRawNs = rawSorted[500] * rate / 1000.0;
    std::vector<uint32_t> globalSorted(global, global + 1000);
    std::sort(globalSorted.begin(), globalSorted.end());
    EXPECT_LT(medianRawNs, 100000.0);
    EXPECT_LT(globalSorted[500], 100000u);

    std::printf("jitterMode %u ns, median lateness %u ns, max %u ns\n", mode, sorted[500], sorted[999]);
    std::printf("rawReadCost %u (clock rate %.9g ticks/us; median raw pair %.1f ns), globalReadExtra %u "
                "(median global pair %u ns)\n",
                block[2], rate, medianRawNs, block[3], globalSorted[500]);
}

}  // namespace
