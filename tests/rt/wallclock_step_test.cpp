// Global-clock waits and global callback times follow steps of the wall
// clock. The wall clock is stepped through the clock seam (CLOCK_REALTIME as
// the library sees it), never for real.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "GlobalCallbackRecord.h"
#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalThreads.h"

using namespace quelta;

namespace {

constexpr int64_t kMs = 1000000;
std::atomic<int64_t> gWallStep{0};

int SteppedClock(clockid_t id, timespec* ts) {
    int r = clock_gettime(id, ts);
    if (id == CLOCK_REALTIME) {
        int64_t ns = static_cast<int64_t>(ts->tv_sec) * 1000000000 + ts->tv_nsec + gWallStep.load();
        ts->tv_sec = static_cast<time_t>(ns / 1000000000);
        ts->tv_nsec = static_cast<long>(ns % 1000000000);
    }
    return r;
}

class WallClockStep : public ::testing::Test {
protected:
    void SetUp() override {
        gWallStep = 0;
        gSystemClock.getTime = SteppedClock;
        ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
        engine = GetEngine__MERIDOX();
    }
    void TearDown() override {
        LibraryControl(0, 0, 0);
        ResetSystemClockHooks();
    }
    uint64_t GlobalNow() {
        ClockTime g;
        engine->ReadGlobal2(g);
        return ToU64(g);
    }
    // Runs a 60 ms global wait, stepping the wall clock by `step` after 10 ms.
    // Returns the wait's monotonic duration and checks it never ended before
    // the wall clock (as stepped) reached the target.
    uint64_t WaitWithStep(int64_t step) {
        uint32_t generation = 0;
        ClockTime g;
        const uint64_t start = testsupport::MonoNowNs();
        engine->ReadGlobalWithGeneration(g, generation);
        const ClockTime target = FromU64(ToU64(g) + 60 * kMs);
        std::thread stepper([step] {
            timespec ts{0, 10 * kMs};
            nanosleep(&ts, nullptr);
            gWallStep = step;
        });
        uint32_t abortFlag = 9;
        ClockTime after{};
        quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, generation);
        const uint64_t took = testsupport::MonoNowNs() - start;
        stepper.join();
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(ToU64(after), ToU64(target));
        return took;
    }
    iKPusTimingEngine* engine = nullptr;
};

TEST_F(WallClockStep, GlobalWaitEndsSoonerWhenTheClockStepsForward) {
    const uint64_t took = WaitWithStep(30 * kMs);
    EXPECT_GE(took, 30u * kMs);  // 60 ms of wall time minus the 30 ms step
    EXPECT_LT(took, 55u * kMs);
}

TEST_F(WallClockStep, GlobalWaitEndsLaterWhenTheClockStepsBack) {
    const uint64_t took = WaitWithStep(-30 * kMs);
    EXPECT_GE(took, 90u * kMs);
}

std::atomic<uint64_t> gFiredGlobal{0};

TEST_F(WallClockStep, GlobalCallbackTimeMovesWithTheStep) {
    gFiredGlobal = 0;
    quelta_iTSC_SetCallback(testsupport::StoreGlobalNow, &gFiredGlobal);
    const ClockTime when = FromU64(GlobalNow() + 80 * kMs);
    ASSERT_EQ(quelta_iTSC_SetCallbackTime(&when, -1), 1u);
    const uint64_t start = testsupport::MonoNowNs();
    PalSleepMilliseconds(10);
    gWallStep = 50 * kMs;  // the callback is now due 20 ms from here
    testsupport::AwaitNonZero(gFiredGlobal, 2000u * kMs);
    const uint64_t took = testsupport::MonoNowNs() - start;
    ASSERT_NE(gFiredGlobal.load(), 0u);
    EXPECT_GE(gFiredGlobal.load(), ToU64(when));  // never before the wall clock shows it
    EXPECT_LT(took, 75u * kMs);                   // not at the unstepped time
    quelta_iTSC_SetCallback(nullptr, nullptr);
}

}  // namespace
