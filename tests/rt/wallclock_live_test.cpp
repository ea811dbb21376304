// The running library with the wall clock moved through the clock seam (never the machine's): now, in
// 2040 and in 2100 global reads, waits and callback times are exact, never early, never lost.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <string>
#include <thread>

#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "engine/EpochOffset.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "quelta/quelta.h"
#include "tLinux/PalThreads.h"

using namespace quelta;

namespace {

constexpr uint64_t kNs = 1000000000ull, kMs = 1000000ull, kLostAfter = 2000 * kMs;
constexpr int64_t kSMs = 1000000;

std::atomic<int64_t> gWallShiftNs{0};
int ShiftedClock(clockid_t id, timespec* ts) {
    const int r = clock_gettime(id, ts);
    if (id == CLOCK_REALTIME) *ts = SplitNanoseconds(JoinNanoseconds(*ts) + static_cast<uint64_t>(gWallShiftNs.load()));
    return r;
}
std::atomic<uint64_t> gFiredAt{0};
void StoreGlobalNow(void*) {
    ClockTime g;
    GetEngine__MERIDOX()->ReadGlobal2(g);
    gFiredAt.store(ToU64(g));
}

class WallClockLive : public ::testing::TestWithParam<int64_t> {  // the wall clock's first second, Unix time
protected:
    void SetUp() override {
        if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "the timer thread needs SCHED_FIFO";
        gWallShiftNs = GetParam() == 0 ? 0 : (GetParam() + 3600) * int64_t(kNs) - static_cast<int64_t>(testsupport::RealNowNs());
        gSystemClock.getTime = ShiftedClock;
        setenv("TZ", "UTC", 1);
        ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
        engine = GetEngine__MERIDOX();
        gFiredAt = 0;
    }
    void TearDown() override {
        LibraryControl(0, 0, 0);
        ResetSystemClockHooks();
        unsetenv("TZ");
    }
    uint64_t GlobalNow() { ClockTime g; engine->ReadGlobal2(g); return ToU64(g); }
    // Runs a blocking call on a thread of its own; still blocked after
    // kLostAfter, it is lost: false, and the stop releases the caller.
    template <typename Call>
    bool EndsInTime(Call call) {
        std::atomic<bool> done{false};
        std::thread caller([&] { call(), done = true; });
        const bool ended = testsupport::Eventually([&] { return done.load(); }, kLostAfter);
        if (!ended) LibraryControl(0, 0, 0);
        caller.join();
        return ended;
    }
    // A global wait `ahead` ns long, the wall clock stepped by `step` after 10 ms; its monotonic length.
    uint64_t GlobalWait(uint64_t ahead, int64_t step = 0) {
        uint32_t generation = 0, abortFlag = 9;
        ClockTime g, after{};
        const uint64_t start = testsupport::MonoNowNs();
        engine->ReadGlobalWithGeneration(g, generation);
        const ClockTime target = FromU64(ToU64(g) + ahead);
        std::thread stepper([step] { if (step) PalSleepMilliseconds(10), gWallShiftNs += step; });
        EXPECT_TRUE(EndsInTime([&] { quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, generation); }));
        stepper.join();
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(ToU64(after), ToU64(target)) << "early";
        EXPECT_GE(GlobalNow(), ToU64(target));
        return testsupport::MonoNowNs() - start;
    }
    // A global callback time `ahead` ns ahead, the wall clock stepped by `step`
    // after 10 ms: fires, never before the (stepped) wall clock shows it; its monotonic wait.
    uint64_t CallbackTakes(uint64_t ahead, int64_t step = 0) {
        quelta_iTSC_SetCallback(StoreGlobalNow, nullptr);
        const ClockTime when = FromU64(GlobalNow() + ahead);
        EXPECT_EQ(quelta_iTSC_SetCallbackTime(&when, -1), 1u);
        const uint64_t start = testsupport::MonoNowNs();
        if (step) PalSleepMilliseconds(10), gWallShiftNs += step;
        testsupport::AwaitNonZero(gFiredAt, kLostAfter);
        quelta_iTSC_SetCallback(nullptr, nullptr);
        EXPECT_NE(gFiredAt.load(), 0u) << "never fired";
        EXPECT_GE(gFiredAt.load(), ToU64(when)) << "early";
        return testsupport::MonoNowNs() - start;
    }
    iKPusTimingEngine* engine = nullptr;
};

TEST_P(WallClockLive, ReadsAndEveryGlobalWaitEndAtTheirTime) {
    EXPECT_EQ(ComputeEpochOffset(), 2082844800);  // 1904 to 1970, in UTC
    timespec before{}, after{};
    ShiftedClock(CLOCK_REALTIME, &before);
    const uint64_t g = GlobalNow();
    ShiftedClock(CLOCK_REALTIME, &after);
    EXPECT_GE(g, JoinNanoseconds(before) + 2082844800ull * kNs);
    EXPECT_LE(g, JoinNanoseconds(after) + 2082844800ull * kNs);
    for (uint64_t ahead : {0 * kMs, 3 * kMs, 25 * kMs}) GlobalWait(ahead);
    const ClockTime deadline = FromU64(GlobalNow() + 10 * kMs);
    uint32_t result = 9;  // neither semaphore nor callback: blocks on the node's own semaphore
    ASSERT_TRUE(EndsInTime([&] { result = quelta_iTSCEvent_Wait_Callback_C(nullptr, &deadline, nullptr, nullptr, 1, nullptr); }));
    EXPECT_EQ(result, 0u);
    EXPECT_GE(GlobalNow(), ToU64(deadline)) << "early";
}

TEST_P(WallClockLive, GlobalWaitsAndCallbackTimesFollowSteps) {
    // Steps far apart from lateness: a late stepper or waiter must not pass for a step ignored.
    const uint64_t forward = GlobalWait(240 * kMs, 120 * kSMs);  // 240 ms of wall time minus the step
    EXPECT_GE(forward, 120 * kMs);
    EXPECT_LT(forward, 220 * kMs);
    EXPECT_GE(GlobalWait(240 * kMs, -120 * kSMs), 360 * kMs);
    EXPECT_LT(CallbackTakes(320 * kMs, 200 * kSMs), 300 * kMs) << "at the unstepped time";  // due 120 ms after the start
}

INSTANTIATE_TEST_SUITE_P(Years, WallClockLive, ::testing::Values(0, 2208988800ll, 4102444800ll),
                         [](const auto& info) { return info.param == 0 ? std::string("Now") : "Unix" + std::to_string(info.param); });

}  // namespace
