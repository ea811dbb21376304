// The global clock with the wall clock past 2038-01-19, on a fake kernel
// clock: exact global reads and epoch offset, both conversion directions (by
// the offset alone and through the user-space conversion), and steps of one
// second either way, in 2040 and in 2100. The same results on every target:
// wall-clock seconds are 64-bit everywhere.
#include <gtest/gtest.h>

#include <ostream>

#include "engine_test_helpers.h"

using namespace enginetest;

namespace {

constexpr int32_t kEpoch1904 = 2082844800;
constexpr int64_t kMonotonicSec = 5000;

struct Year {
    int year;
    int64_t unixSeconds;  // its first second, UTC
};
void PrintTo(const Year& y, std::ostream* os) { *os << y.year; }

class WallClockFuture : public ::testing::TestWithParam<Year> {
protected:
    void SetUp() override {
        UseFakeClock();
        UseFakeKernel();
        gFake.realtime = Ts(GetParam().unixSeconds, 123456789);
        gFake.monotonic = Ts(kMonotonicSec, 987654321);
        engine->SetEpochOffset(kEpoch1904);
        quelta::gConvertSyscallNr.store(-1);
    }
    void TearDown() override { delete engine; }

    // The global time of the fake wall clock's present, in full.
    uint64_t GlobalNow() const {
        return static_cast<uint64_t>(GetParam().unixSeconds + kEpoch1904) * kNs + 123456789u;
    }
    uint64_t MonotonicNow() const { return static_cast<uint64_t>(kMonotonicSec) * kNs + 987654321u; }

    EngineSeamGuard seams;
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;
};

TEST_P(WallClockFuture, GlobalReadsAreTheWallClockPlusTheEpochOffset) {
    using Read = void (iKPusTimingEngine::*)(ClockTime&);
    for (Read read : {&iKPusTimingEngine::ReadGlobal2, &iKPusTimingEngine::ReadGlobal3,
                      &iKPusTimingEngine::ReadGlobal6, &iKPusTimingEngine::ReadGlobal7}) {
        ClockTime g{0, 0};
        (e->*read)(g);
        EXPECT_EQ(U64(g), GlobalNow());
        // Exactly the offset's seconds ahead of the wall clock.
        EXPECT_EQ(U64(g) - quelta::JoinNanoseconds(gFake.realtime), uint64_t(kEpoch1904) * kNs);
    }
    ClockTime g{0, 0}, last{0, 0};
    uint32_t generation = 7;
    e->ReadGlobalWithGeneration(g, generation);
    e->LoadLastGlobal(last);
    EXPECT_EQ(U64(g), GlobalNow());
    EXPECT_EQ(U64(last), GlobalNow());
    // Sanity of the parameter: the global clock's seconds since 1904 place
    // the reading in the intended year (365.2425-day years).
    EXPECT_EQ(1904 + static_cast<int>(U64(g) / kNs / 31556952u), GetParam().year);
}

TEST_P(WallClockFuture, ConversionsInBothDirections) {
    // By the epoch offset alone (no conversion available).
    quelta::gConvertStandInEnabled.store(false);
    const uint64_t wall = quelta::JoinNanoseconds(gFake.realtime);
    EXPECT_EQ(U64(e->GlobalToMonotonic(CT(GlobalNow()))), wall);
    EXPECT_EQ(U64(e->MonotonicToGlobal(CT(wall))), GlobalNow());

    // In user space: the fake clocks stand still, so the offset between them
    // is measured exactly, and the present converts to the present.
    quelta::gConvertStandInEnabled.store(true);
    EXPECT_EQ(U64(e->MonotonicToGlobal(CT(MonotonicNow()))), GlobalNow());
    EXPECT_EQ(U64(e->GlobalToMonotonic(CT(GlobalNow()))), MonotonicNow());
    const uint64_t later = 3600 * kNs + 1;  // an hour and a nanosecond on
    EXPECT_EQ(U64(e->MonotonicToGlobalFwd(CT(MonotonicNow() + later))), GlobalNow() + later);
    EXPECT_EQ(U64(e->GlobalToMonotonicFwd(CT(GlobalNow() + later))), MonotonicNow() + later);
    EXPECT_EQ(U64(e->MonotonicToGlobalImplFwd(CT(MonotonicNow() - later))), GlobalNow() - later);
    EXPECT_EQ(U64(e->GlobalToMonotonicImplFwd(CT(GlobalNow() - later))), MonotonicNow() - later);
}

TEST_P(WallClockFuture, StepsOfOneSecondEitherWay) {
    const int64_t sec = GetParam().unixSeconds;
    EXPECT_EQ(e->StepGlobalClock(CT(kNs)), 0);
    EXPECT_EQ(static_cast<int64_t>(gFake.setTimeArg.tv_sec), sec + 1);
    EXPECT_EQ(gFake.setTimeArg.tv_nsec, 123456789);
    EXPECT_EQ(e->StepGlobalClock(ClockTime{0xC4653600u, 0xFFFFFFFFu}), 0);  // -1e9
    EXPECT_EQ(static_cast<int64_t>(gFake.setTimeArg.tv_sec), sec - 1);
    EXPECT_EQ(gFake.setTimeArg.tv_nsec, 123456789);
    EXPECT_EQ(gFake.setTimeCalls, 2);
}

INSTANTIATE_TEST_SUITE_P(Years, WallClockFuture,
                         ::testing::Values(Year{2040, 2208988800ll}, Year{2100, 4102444800ll}),
                         [](const testing::TestParamInfo<Year>& info) { return std::to_string(info.param.year); });

}  // namespace
