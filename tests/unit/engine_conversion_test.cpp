// Conversion between the monotonic and the global time base: the epoch-offset
// behaviour without any conversion, the user-space conversion that follows
// the wall clock, the kernel call's pass-through, and bad clock ids.
#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <vector>

#include "TestSupport.h"
#include "engine/EngineDetail.h"
#include "engine/tKPusTimingEngine.h"
#include "engine_test_helpers.h"

using namespace enginetest;
using quelta::ConvertClockTime;
using quelta::gConvertStandInEnabled;
using quelta::gConvertSyscallNr;
using quelta::tKPusTimingEngine;

namespace {

constexpr uint64_t kNs = 1000000000ull;
constexpr int32_t kEpoch1904 = 2082844800;

typedef ClockTime (iKPusTimingEngine::*ConvertSlot)(const ClockTime&);
struct NamedConvert {
    const char* name;
    ConvertSlot slot;
};
const NamedConvert kToGlobal[] = {
    {"MonotonicToGlobal", &iKPusTimingEngine::MonotonicToGlobal},
    {"MonotonicToGlobalImpl", &iKPusTimingEngine::MonotonicToGlobalImpl},
    {"MonotonicToGlobalFwd", &iKPusTimingEngine::MonotonicToGlobalFwd},
    {"MonotonicToGlobalImplFwd", &iKPusTimingEngine::MonotonicToGlobalImplFwd},
};
const NamedConvert kToMonotonic[] = {
    {"GlobalToMonotonic", &iKPusTimingEngine::GlobalToMonotonic},
    {"GlobalToMonotonicImpl", &iKPusTimingEngine::GlobalToMonotonicImpl},
    {"GlobalToMonotonicFwd", &iKPusTimingEngine::GlobalToMonotonicFwd},
    {"GlobalToMonotonicImplFwd", &iKPusTimingEngine::GlobalToMonotonicImplFwd},
};

int64_t Diff(uint64_t a, uint64_t b) { return static_cast<int64_t>(a - b); }

// A wall clock stepped by gStepNs against the real one.
int64_t gStepNs = 0;
int SteppedGetTime(clockid_t id, timespec* ts) {
    const int r = clock_gettime(id, ts);
    if (id == CLOCK_REALTIME) {
        const uint64_t v = static_cast<uint64_t>(ts->tv_sec) * kNs + ts->tv_nsec + static_cast<uint64_t>(gStepNs);
        ts->tv_sec = static_cast<time_t>(v / kNs);
        ts->tv_nsec = static_cast<long>(v % kNs);
    }
    return r;
}

// A deterministic clock for the user-space conversion: every read moves the
// true time on by readNs, one chosen read is delayed further (as if the
// thread were preempted just before it), and CLOCK_REALTIME runs exactly
// kRealOffsetNs ahead of CLOCK_MONOTONIC.
constexpr uint64_t kRealOffsetNs = 1700000000ull * kNs + 123;
struct TickingClock {
    uint64_t now = 5 * kNs;
    uint64_t readNs = 50;
    int reads = 0;
    int delayedRead = 0;
    uint64_t delayNs = 0;
};
TickingClock gTicking;
int TickingGetTime(clockid_t id, timespec* ts) {
    if (++gTicking.reads == gTicking.delayedRead) gTicking.now += gTicking.delayNs;
    gTicking.now += gTicking.readNs;
    const uint64_t v = id == CLOCK_REALTIME ? gTicking.now + kRealOffsetNs : gTicking.now;
    ts->tv_sec = static_cast<time_t>(v / kNs);
    ts->tv_nsec = static_cast<long>(v % kNs);
    return 0;
}

class EngineConversionTest : public ::testing::Test {
protected:
    void SetUp() override { engine->SetEpochOffset(kEpoch1904); }
    void TearDown() override { delete engine; }

    uint64_t ToGlobal(uint64_t m) { return U64(e->MonotonicToGlobal(CT(m))); }
    uint64_t ToMonotonic(uint64_t g) { return U64(e->GlobalToMonotonic(CT(g))); }
    uint64_t GlobalNow() {
        ClockTime t;
        e->ReadGlobal2(t);
        return U64(t);
    }
    uint64_t MonotonicNow() {
        ClockTime t;
        e->ReadMonotonic0(t);
        return U64(t);
    }

    EngineSeamGuard seams;
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;
};

TEST_F(EngineConversionTest, WithoutAnyConversionOnlyTheEpochOffsetApplies) {
    gConvertStandInEnabled.store(false);
    for (int32_t nr : {-1, 0}) {
        gConvertSyscallNr.store(nr);
        SCOPED_TRACE(nr);
        timespec ts = Ts(123, 456);
        EXPECT_EQ(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 38);
        EXPECT_EQ(ts.tv_sec, 123);
        EXPECT_EQ(ts.tv_nsec, 456);
        for (const NamedConvert& c : kToMonotonic) {
            SCOPED_TRACE(c.name);
            EXPECT_EQ(U64((e->*c.slot)(CT(2082844801500000000ull))), 1500000000ull);
        }
        for (const NamedConvert& c : kToGlobal) {
            SCOPED_TRACE(c.name);
            EXPECT_EQ(U64((e->*c.slot)(CT(1500000000ull))), 2082844801500000000ull);
        }
    }
    // A negative offset moves the other way.
    engine->SetEpochOffset(-100);
    EXPECT_EQ(ToGlobal(1500000000ull), uint64_t(0) - 98500000000ull);
    EXPECT_EQ(ToMonotonic(uint64_t(0) - 98500000000ull), 1500000000ull);
}

TEST_F(EngineConversionTest, SplitKeepsOnlyLow32BitsOfSeconds) {
    gConvertStandInEnabled.store(false);
    gConvertSyscallNr.store(-1);
    engine->SetEpochOffset(0);
    // 2^32 + 3 seconds: the seconds wrap to 3 on the way through the timespec.
    EXPECT_EQ(ToGlobal((4294967296ull + 3) * kNs + 9), 3 * kNs + 9);
    // 2^31 seconds come back as -2^31 seconds.
    EXPECT_EQ(ToGlobal(2147483648ull * kNs), uint64_t(0) - 2147483648ull * kNs);
}

TEST_F(EngineConversionTest, KernelCallIsPassedThroughUntouched) {
    // getpid ignores its arguments, so it stands in for a kernel conversion
    // call that fails to convert: its result comes back as it is, whatever
    // the clock ids, and the time point stays as it was.
    gConvertSyscallNr.store(static_cast<int32_t>(SYS_getpid));
    timespec ts = Ts(77, 88);
    EXPECT_EQ(ConvertClockTime(99, 98, &ts), static_cast<int32_t>(getpid()));
    EXPECT_EQ(ts.tv_sec, 77);
    EXPECT_EQ(ts.tv_nsec, 88);
    EXPECT_EQ(ToMonotonic(2082844801500000000ull), 1500000000ull);
}

TEST_F(EngineConversionTest, BadClockIdsAreRefused) {
    gConvertSyscallNr.store(-1);
    for (auto ids : {std::make_pair(2, 1), std::make_pair(1, 7), std::make_pair(-1, 0), std::make_pair(0, 3)}) {
        timespec ts = Ts(5, 6);
        EXPECT_EQ(ConvertClockTime(ids.first, ids.second, &ts), 22) << ids.first << "->" << ids.second;
        EXPECT_EQ(ts.tv_sec, 5);
        EXPECT_EQ(ts.tv_nsec, 6);
    }
    timespec ts = Ts(5, 6);
    EXPECT_EQ(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_MONOTONIC, &ts), 0);
    EXPECT_EQ(ts.tv_sec, 5);
    EXPECT_EQ(ts.tv_nsec, 6);
}

TEST_F(EngineConversionTest, StandInRoundTripsWithinAMicrosecond) {
    gConvertSyscallNr.store(-1);
    std::vector<int64_t> errors;
    for (int i = 0; i < 41; ++i) {
        const uint64_t m = MonotonicNow() + static_cast<uint64_t>(i) * 250000000ull;
        const uint64_t back = ToMonotonic(ToGlobal(m));
        errors.push_back(std::abs(Diff(back, m)));
    }
    std::sort(errors.begin(), errors.end());
    // The median: a preempted conversion on a busy machine may be worse.
    EXPECT_LE(errors[errors.size() / 2], 1000) << "worst " << errors.back() << " ns";
}

TEST_F(EngineConversionTest, GlobalTimeMapsToTheMonotonicInstantWhereRealtimeShowsIt) {
    gConvertSyscallNr.store(-1);
    const uint64_t m1 = testsupport::MonoNowNs();
    const uint64_t r = testsupport::RealNowNs();
    const uint64_t m2 = testsupport::MonoNowNs();
    const uint64_t g = r + uint64_t(kEpoch1904) * kNs + 5 * kNs;  // 5 s ahead on the global clock
    const uint64_t m = ToMonotonic(g);
    const int64_t slack = 200000;  // 0.2 ms for a busy machine
    EXPECT_GE(Diff(m, m1 + 5 * kNs), -slack);
    EXPECT_LE(Diff(m, m2 + 5 * kNs), slack);
    // And back: the monotonic instant 5 s ahead shows on the global clock.
    const uint64_t g2 = ToGlobal(m1 + 5 * kNs);
    EXPECT_LE(std::abs(Diff(g2, g)), static_cast<int64_t>(m2 - m1) + slack);
}

TEST_F(EngineConversionTest, StandInFollowsEveryStepOfTheWallClock) {
    gConvertSyscallNr.store(-1);
    quelta::gSystemClock.getTime = &SteppedGetTime;
    const uint64_t m = MonotonicNow() + 2 * kNs;
    gStepNs = 0;
    const uint64_t g0 = ToGlobal(m);
    for (int64_t step : {int64_t(3600) * int64_t(kNs), -int64_t(7200) * int64_t(kNs), int64_t(1), int64_t(0)}) {
        gStepNs = step;
        SCOPED_TRACE(step);
        // Both directions see the step at once: nothing is cached.
        EXPECT_LE(std::abs(Diff(ToGlobal(m), g0 + static_cast<uint64_t>(step))), 500000);
        EXPECT_LE(std::abs(Diff(ToMonotonic(g0 + static_cast<uint64_t>(step)), m)), 500000);
        // The engine's own global reads agree with the converted present.
        const uint64_t nowM = MonotonicNow();
        EXPECT_LE(std::abs(Diff(ToGlobal(nowM), GlobalNow())), 500000);
    }
    gStepNs = 0;
}

TEST_F(EngineConversionTest, StandInTakesTheMidpointOfTheTightestBracket) {
    gConvertSyscallNr.store(-1);
    quelta::gSystemClock.getTime = &TickingGetTime;
    const uint64_t point = 1234 * kNs + 5678;
    for (int delayed : {0, 1, 2, 3}) {  // none, or the first try's 1st, 2nd or 3rd read
        SCOPED_TRACE(delayed);
        gTicking = TickingClock{};
        gTicking.delayedRead = delayed;
        gTicking.delayNs = 100000;
        timespec ts = quelta::WidenTimespec(quelta::SplitNanoseconds(point));
        ASSERT_EQ(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 0);
        EXPECT_EQ(quelta::JoinNanoseconds(quelta::NarrowTimespec(ts)), point + kRealOffsetNs);
        // A tight first bracket is taken at once (a delay before its first
        // read does not widen it); a widened one is retried.
        EXPECT_EQ(gTicking.reads, delayed <= 1 ? 3 : 6);

        gTicking.reads = 0;
        ts = quelta::WidenTimespec(quelta::SplitNanoseconds(point + kRealOffsetNs));
        ASSERT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), 0);
        EXPECT_EQ(quelta::JoinNanoseconds(quelta::NarrowTimespec(ts)), point);
    }
    // Brackets never tight enough to stop early: all three tries are made and
    // the undisturbed one wins, wherever it lies.
    for (int delayed : {2, 5, 8}) {
        SCOPED_TRACE(delayed);
        gTicking = TickingClock{};
        gTicking.readNs = 400;
        gTicking.delayedRead = delayed;
        gTicking.delayNs = 100000;
        timespec ts = quelta::WidenTimespec(quelta::SplitNanoseconds(point));
        ASSERT_EQ(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 0);
        EXPECT_EQ(quelta::JoinNanoseconds(quelta::NarrowTimespec(ts)), point + kRealOffsetNs);
        EXPECT_EQ(gTicking.reads, 9);
    }
}

TEST_F(EngineConversionTest, StandInConvertsBetweenRawAndMonotonic) {
    gConvertSyscallNr.store(-1);
    ClockTime raw;
    e->ReadRaw8(raw);
    const uint64_t mono = testsupport::MonoNowNs();
    timespec ts = quelta::WidenTimespec(quelta::SplitNanoseconds(U64(raw)));
    ASSERT_EQ(ConvertClockTime(CLOCK_MONOTONIC_RAW, CLOCK_MONOTONIC, &ts), 0);
    const uint64_t converted = quelta::JoinNanoseconds(quelta::NarrowTimespec(ts));
    EXPECT_LE(std::abs(Diff(converted, mono)), 500000);
}

TEST_F(EngineConversionTest, StandInWritesTimesBeforeTheClocksZeroAsTheKernelWould) {
    gConvertSyscallNr.store(-1);
    // One second after 1970 on the wall clock lies long before the
    // monotonic clock's zero: negative seconds, nanoseconds in [0, 1e9).
    timespec ts = Ts(1, 0);
    ASSERT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), 0);
    EXPECT_LT(ts.tv_sec, 0);
    EXPECT_GE(ts.tv_nsec, 0);
    EXPECT_LT(ts.tv_nsec, 1000000000);
    const uint64_t expected = kNs - (testsupport::RealNowNs() - testsupport::MonoNowNs());
    EXPECT_LE(std::abs(Diff(quelta::JoinNanoseconds(quelta::NarrowTimespec(ts)), expected)), 500000);
}

TEST_F(EngineConversionTest, StandInFailsCleanlyWhenNoClockCanBeRead) {
    gConvertSyscallNr.store(-1);
    UseFakeClock();
    gFake.fail = true;
    timespec ts = Ts(8, 9);
    EXPECT_NE(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 0);
    EXPECT_EQ(ts.tv_sec, 8);
    EXPECT_EQ(ts.tv_nsec, 9);
    // The conversion slot then degrades to the epoch offset alone.
    EXPECT_EQ(ToGlobal(1500000000ull), 2082844801500000000ull);
}

}  // namespace
