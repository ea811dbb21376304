// The running library with the wall clock in 2040 and in 2100: global-clock
// waits, global-deadline event waits and global callback times end at their
// time (never early, never lost), conversions agree with the clocks, and
// start-up's epoch offset is applied exactly. The wall clock is moved through
// the clock seam (CLOCK_REALTIME as the library sees it), never for real; it
// keeps running at the real clock's pace.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <ostream>
#include <string>
#include <thread>

#include "GlobalCallbackRecord.h"
#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "engine/EpochOffset.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "quelta/quelta.h"
#include "tLinux/PalThreads.h"

using namespace quelta;

namespace {

constexpr uint64_t kNs = 1000000000ull;
constexpr uint64_t kMs = 1000000ull;
// Never lost: every wait and callback here is due within 30 ms.
constexpr uint64_t kLostAfterNs = 2000 * kMs;

std::atomic<int64_t> gWallShiftNs{0};

int ShiftedClock(clockid_t id, timespec* ts) {
    const int r = clock_gettime(id, ts);
    if (id == CLOCK_REALTIME) *ts = SplitNanoseconds(JoinNanoseconds(*ts) + static_cast<uint64_t>(gWallShiftNs.load()));
    return r;
}

struct Year {
    int year;
    int64_t unixSeconds;  // its first second, UTC
};
void PrintTo(const Year& y, std::ostream* os) { *os << y.year; }

// The year of a global time (seconds since 1904 in 365.2425-day years; exact
// enough near the start of a year).
int YearOf(uint64_t global) { return 1904 + static_cast<int>(global / kNs / 31556952u); }

// Runs a blocking call on a thread of its own. A call still blocked after
// kLostAfterNs is lost: false, and the library's stop releases the caller.
template <typename Call>
bool EndsInTime(Call call) {
    std::atomic<bool> done{false};
    std::thread caller([&] {
        call();
        done = true;
    });
    const uint64_t start = testsupport::MonoNowNs();
    while (!done.load() && testsupport::MonoNowNs() - start < kLostAfterNs) PalSleepMilliseconds(1);
    const bool ended = done.load();
    if (!ended) LibraryControl(0, 0, 0);
    caller.join();
    return ended;
}

class WallClockFutureLive : public ::testing::TestWithParam<Year> {
protected:
    void SetUp() override {
        if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "the timer thread needs SCHED_FIFO";
        // The wall clock starts an hour into the year and runs on from there.
        gWallShiftNs = (GetParam().unixSeconds + 3600) * int64_t(kNs) - static_cast<int64_t>(testsupport::RealNowNs());
        gSystemClock.getTime = ShiftedClock;
        setenv("TZ", "UTC", 1);
        ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
        engine = GetEngine__MERIDOX();
        ASSERT_NE(engine, nullptr);
    }
    void TearDown() override {
        LibraryControl(0, 0, 0);
        ResetSystemClockHooks();
        unsetenv("TZ");
    }
    uint64_t GlobalNow() {
        ClockTime g;
        engine->ReadGlobal2(g);
        return ToU64(g);
    }
    uint64_t MonotonicNow() {
        ClockTime m;
        engine->ReadMonotonic0(m);
        return ToU64(m);
    }
    iKPusTimingEngine* engine = nullptr;
};

TEST_P(WallClockFutureLive, ReadsCarryTheEpochOffsetAndConversionsAgreeWithTheClocks) {
    // Start-up's offset, in UTC: 1904 to 1970.
    EXPECT_EQ(ComputeEpochOffset(), 2082844800);
    timespec before{}, after{};
    ShiftedClock(CLOCK_REALTIME, &before);
    const uint64_t g = GlobalNow();
    ShiftedClock(CLOCK_REALTIME, &after);
    const uint64_t offset = 2082844800ull * kNs;
    EXPECT_GE(g, JoinNanoseconds(before) + offset);
    EXPECT_LE(g, JoinNanoseconds(after) + offset);
    EXPECT_EQ(YearOf(g), GetParam().year);

    // The present converts to the present, either way (the conversion
    // measures the clocks' offset; 1 ms leaves room for a preempted read).
    const uint64_t m = MonotonicNow();
    const uint64_t toGlobal = ToU64(engine->MonotonicToGlobal(FromU64(m)));
    const uint64_t gNow = GlobalNow();
    EXPECT_LT(gNow - toGlobal, kMs) << "global " << gNow << " converted " << toGlobal;
    const uint64_t toMonotonic = ToU64(engine->GlobalToMonotonic(FromU64(GlobalNow())));
    EXPECT_LT(MonotonicNow() - toMonotonic, kMs);
}

TEST_P(WallClockFutureLive, GlobalWaitEndsAtItsTarget) {
    for (uint64_t ahead : {0 * kMs, 3 * kMs, 25 * kMs}) {
        SCOPED_TRACE(ahead);
        uint32_t generation = 0;
        ClockTime g;
        engine->ReadGlobalWithGeneration(g, generation);
        const ClockTime target = FromU64(ToU64(g) + ahead);
        uint32_t abortFlag = 9;
        ClockTime timeAfter{0, 0};
        ASSERT_TRUE(EndsInTime(
            [&] { quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &timeAfter, generation); }))
            << "never ended";
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(ToU64(timeAfter), ToU64(target)) << "early";
        EXPECT_GE(GlobalNow(), ToU64(target));
    }
}

TEST_P(WallClockFutureLive, GlobalDeadlineEventWaitEndsAtItsDeadline) {
    const ClockTime deadline = FromU64(GlobalNow() + 10 * kMs);
    // Neither semaphore nor callback: blocks on the node's own semaphore.
    uint32_t result = 9;
    ASSERT_TRUE(EndsInTime(
        [&] { result = quelta_iTSCEvent_Wait_Callback_C(nullptr, &deadline, nullptr, nullptr, 1, nullptr); }))
        << "never ended";
    EXPECT_EQ(result, 0u);
    EXPECT_GE(GlobalNow(), ToU64(deadline)) << "early";
}

std::atomic<uint64_t> gFiredAt{0};

TEST_P(WallClockFutureLive, GlobalCallbackTimeFiresAtItsTime) {
    gFiredAt = 0;
    quelta_iTSC_SetCallback(testsupport::StoreGlobalNow, &gFiredAt);
    const ClockTime when = FromU64(GlobalNow() + 20 * kMs);
    ASSERT_EQ(quelta_iTSC_SetCallbackTime(&when, -1), 1u);
    testsupport::AwaitNonZero(gFiredAt, kLostAfterNs);
    quelta_iTSC_SetCallback(nullptr, nullptr);
    ASSERT_NE(gFiredAt.load(), 0u) << "never fired";
    EXPECT_GE(gFiredAt.load(), ToU64(when)) << "early";
    EXPECT_EQ(YearOf(gFiredAt.load()), GetParam().year);
}

INSTANTIATE_TEST_SUITE_P(Years, WallClockFutureLive,
                         ::testing::Values(Year{2040, 2208988800ll}, Year{2100, 4102444800ll}),
                         [](const testing::TestParamInfo<Year>& info) { return std::to_string(info.param.year); });

}  // namespace
