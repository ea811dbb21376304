// Calibrate on a running library: the real tick service records 1000
// lateness samples while Calibrate waits (the record's arithmetic is checked
// on known inputs in the unit tests; here only that the live pieces meet and
// the samples are those of a working machine).
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <vector>

#include "engine/EngineRate.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "engine/TimerArming.h"
#include "engine/tKPusTimingEngine.h"

using namespace quelta;

namespace {

uint32_t Median(const uint32_t* v) {
    std::vector<uint32_t> sorted(v, v + 1000);
    std::sort(sorted.begin(), sorted.end());
    return sorted[500];
}

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
    const uint32_t *jitter = &block[4], *raw = &block[1004], *global = &block[2004];
    // Now and then a tick is late by milliseconds on a noisy machine; most
    // are well within a tick period.
    EXPECT_LT(Median(jitter), 1000000u) << "median tick lateness of 1 ms or more";
    // A raw sample is the pair's difference d (ns) times 1000 over the clock
    // rate; back in ns, a typical pair is well under 0.1 ms apart.
    const double medianRawNs = Median(raw) * rate / 1000.0;
    EXPECT_LT(medianRawNs, 100000.0);
    EXPECT_LT(Median(global), 100000u);
    std::printf("jitterMode %u ns, median lateness %u ns; rawReadCost %u (median raw pair %.1f ns), "
                "globalReadExtra %u (median global pair %u ns)\n",
                mode, Median(jitter), block[2], medianRawNs, block[3], Median(global));
}

}  // namespace
