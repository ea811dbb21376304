// Start-up and stop in this process: the first tick's time, and an allocation failure at every allocation
// start-up makes (reported, released once; the sanitizer build checks for leaks and double frees).
#include <gtest/gtest.h>

#include <atomic>
#include <string>

#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

using namespace quelta;

namespace {

struct StartResult {
    uint32_t started;
    std::string out;
};
StartResult Start() {
    testing::internal::CaptureStdout();
    const uint32_t r = LibraryControl(0, 1, 0);
    return {r, testing::internal::GetCapturedStdout()};
}

std::atomic<uint64_t> gFirstTickAt{0};
void MarkFirstTick(uint64_t) {
    uint64_t none = 0;
    gFirstTickAt.compare_exchange_strong(none, testsupport::MonoNowNs());
}

// Start-up reads the clock (the engine's last monotonic reading) and arms the
// first tick one period later: seen before the first pass reads the clock
// again, the next tick is that reading plus 1 ms exactly (a start whose first
// pass came first is repeated), and it is served then, never before.
TEST(Startup, TheFirstTickComesOnePeriodAfterStartUpReadsTheClock) {
    gTickCallback.store(&MarkFirstTick);
    bool seen = false;
    uint64_t difference = 0;
    for (int attempt = 0; attempt < 50 && !seen; ++attempt, LibraryControl(0, 0, 0)) {
        gFirstTickAt.store(0);
        testing::internal::CaptureStdout();
        const uint32_t started = LibraryControl(0, 1, 0);
        const uint64_t next = gNextTick.Load();  // read at once: the first pass is 1 ms away
        ClockTime read{};
        if (started == 1u) gEngine.load()->LoadLastMonotonic(read);
        const std::string out = testing::internal::GetCapturedStdout();
        ASSERT_EQ(started, 1u) << out;
        EXPECT_EQ(out, "");
        if (!TimerServing()) break;
        if ((difference = next - ToU64(read)) != kTickPeriodClocks) continue;
        seen = true;
        for (int ms = 0; ms < 2000 && gFirstTickAt.load() == 0; ++ms) PalSleepMilliseconds(1);
        ASSERT_NE(gFirstTickAt.load(), 0u) << "no tick in 2 s";
        EXPECT_GE(gFirstTickAt.load(), next) << "the first tick came early";
    }
    gTickCallback.store(nullptr);
    if (!seen && !testsupport::CanUseRealtime()) GTEST_SKIP() << "the timer thread needs SCHED_FIFO";
    EXPECT_TRUE(seen) << "next tick minus start-up's reading: " << difference << " ns";
    EXPECT_EQ(LibraryControl(0, 0, 0), 1u);  // a second stop finds nothing to do
}

TEST(Startup, EveryAllocationFailureIsReportedAndReleasedOnce) {
    gPalAllocFailCountdown.store(0);
    const uint32_t before = gPalAllocCount.load();
    ASSERT_EQ(Start().started, 1u);
    const uint32_t allocations = gPalAllocCount.load() - before;
    LibraryControl(0, 0, 0);
    ASSERT_GT(allocations, 130u);  // objects, log rings, pool, 128 semaphores
    int logFailures = 0, initFailures = 0;
    for (uint32_t k = 1; k <= allocations; ++k) {
        gPalAllocFailCountdown.store(static_cast<int32_t>(k));
        const StartResult r = Start();
        gPalAllocFailCountdown.store(0);
        if (r.out.find("Log engine initialization FAILED!") != std::string::npos) {
            ++logFailures;
            EXPECT_EQ(r.started, 0u);
            EXPECT_EQ(GetEngine__MERIDOX(), nullptr) << k;
        } else if (r.out.find("iTSCEvent_Initialize_C FAILED!") != std::string::npos) {
            ++initFailures;
            EXPECT_EQ(r.started, 0u);
            // Released at once: the log and the timer; the engine and the pool wait for the stop.
            EXPECT_EQ(GetLogEngine__MERIDOX(), nullptr) << k;
            EXPECT_TRUE(gEngine.load() == nullptr || gTimer.load() == nullptr) << k;
        } else {
            EXPECT_EQ(r.started, 1u) << k << ": " << r.out;  // a log ring falls back to the inline one
        }
        EXPECT_EQ(LibraryControl(0, 0, 0), 1u);
        EXPECT_EQ(GetEngine__MERIDOX(), nullptr);
        EXPECT_EQ(GetLogEngine__MERIDOX(), nullptr);
        EXPECT_EQ(gTimer.load(), nullptr);
    }
    EXPECT_GE(logFailures, 1);
    EXPECT_GE(initFailures, 129);  // timer, engine, pool, every semaphore
    ASSERT_EQ(Start().started, 1u) << "the library no longer starts";
    LibraryControl(0, 0, 0);
}

}  // namespace
