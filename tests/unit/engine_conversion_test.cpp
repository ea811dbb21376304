// Conversion between the monotonic and the global time base: the epoch offset
// alone when there is no conversion, the user-space stand-in that follows the
// wall clock, the kernel call's pass-through and its own time point, and bad
// clock ids.
#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <vector>

#include "TestSupport.h"
#include "engine/SystemClock.h"
#include "engine_test_helpers.h"

using namespace enginetest;
using quelta::ConvertClockTime;
using quelta::gConvertStandInEnabled;
using quelta::gConvertSyscallNr;

namespace {

constexpr int32_t kEpoch1904 = 2082844800;

int64_t AbsDiff(uint64_t a, uint64_t b) { return std::abs(static_cast<int64_t>(a - b)); }
timespec ToTs(uint64_t ns) { return quelta::SplitNanoseconds(ns); }
uint64_t FromTs(const timespec& ts) { return quelta::JoinNanoseconds(ts); }

// A wall clock stepped by gStepNs against the real one.
int64_t gStepNs = 0;
int SteppedGetTime(clockid_t id, timespec* ts) {
    const int r = clock_gettime(id, ts);
    if (id == CLOCK_REALTIME) *ts = ToTs(FromTs(*ts) + static_cast<uint64_t>(gStepNs));
    return r;
}

// A deterministic clock: every read moves the true time on by readNs, one
// chosen read is delayed further (as if the thread were preempted just
// before it), and CLOCK_REALTIME runs kRealOffsetNs ahead of CLOCK_MONOTONIC.
constexpr uint64_t kRealOffsetNs = 1700000000ull * kNs + 123;
struct TickingClock {
    uint64_t now = 5 * kNs, readNs = 50;
    int reads = 0, delayedRead = 0;
    uint64_t delayNs = 100000;
};
TickingClock gTicking;
int TickingGetTime(clockid_t id, timespec* ts) {
    if (++gTicking.reads == gTicking.delayedRead) gTicking.now += gTicking.delayNs;
    gTicking.now += gTicking.readNs;
    *ts = ToTs(id == CLOCK_REALTIME ? gTicking.now + kRealOffsetNs : gTicking.now);
    return 0;
}

class EngineConversionTest : public ::testing::Test {
protected:
    void SetUp() override {
        engine->SetEpochOffset(kEpoch1904);
        gConvertSyscallNr.store(-1);
    }
    void TearDown() override { delete engine; }

    uint64_t ToGlobal(uint64_t m) { return U64(e->MonotonicToGlobal(CT(m))); }
    uint64_t ToMonotonic(uint64_t g) { return U64(e->GlobalToMonotonic(CT(g))); }
    uint64_t Now(void (iKPusTimingEngine::*read)(ClockTime&)) {
        ClockTime t;
        (e->*read)(t);
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
        EXPECT_EQ(ToMonotonic(2082844801500000000ull), 1500000000ull);
        EXPECT_EQ(ToGlobal(1500000000ull), 2082844801500000000ull);
    }
    engine->SetEpochOffset(-100);  // a negative offset moves the other way
    EXPECT_EQ(ToGlobal(1500000000ull), uint64_t(0) - 98500000000ull);
    EXPECT_EQ(ToMonotonic(uint64_t(0) - 98500000000ull), 1500000000ull);
    engine->SetEpochOffset(0);  // seconds beyond 31 and 32 bits pass whole through the timespec
    EXPECT_EQ(ToGlobal((4294967296ull + 3) * kNs + 9), (4294967296ull + 3) * kNs + 9);
    EXPECT_EQ(ToGlobal(2147483648ull * kNs), 2147483648ull * kNs);
    EXPECT_EQ(ToMonotonic(2147483648ull * kNs + 1), 2147483648ull * kNs + 1);
}

TEST_F(EngineConversionTest, KernelCallIsPassedThroughAndBadClockIdsAreRefused) {
    // The system call gets its number and then from, to and the time point,
    // in that order. kill stands in for it for one call, with arguments that
    // make it harmless either way: kill(from, to) for a process that does not
    // exist and signal 0 fails with ESRCH; with the two swapped it would fail
    // with EINVAL (no signal of that number). Its result comes back as it is
    // and the time point stays as the call left it. (Never with real clock
    // ids: kill(0, 1) would hang up the whole process group.)
    gConvertSyscallNr.store(static_cast<int32_t>(SYS_kill));
    timespec ts = Ts(77, 88);
    errno = 0;
    const int32_t r = ConvertClockTime(0x7FFFFFF0, 0, &ts);
    const int error = errno;
    gConvertSyscallNr.store(static_cast<int32_t>(SYS_getpid));
    EXPECT_EQ(r, -1);
    EXPECT_EQ(error, ESRCH) << "from and to were not passed in order";
    EXPECT_EQ(FromTs(ts), 77 * kNs + 88);
    // getpid ignores its arguments: a call that converts nothing leaves the
    // engine's result as the offset alone.
    EXPECT_EQ(ToMonotonic(2082844801500000000ull), 1500000000ull);

    gConvertSyscallNr.store(-1);
    const int32_t ids[][3] = {{2, 1, 22}, {1, 7, 22}, {-1, 0, 22}, {0, 3, 22}, {1, 1, 0}};
    for (const auto& c : ids) {
        ts = Ts(5, 6);
        EXPECT_EQ(ConvertClockTime(c[0], c[1], &ts), c[2]) << c[0] << "->" << c[1];
        EXPECT_EQ(FromTs(ts), 5 * kNs + 6);
    }
}

// A kernel conversion call that moves every time point forward by a fixed
// number of seconds, or fails as a kernel does for a result it cannot hold.
struct FakeConvertCall {
    int calls = 0;
    long lastSec = 0;
    int32_t lastFrom = -1, lastTo = -1;
    bool overflow = false;
};
FakeConvertCall gConvertCall;
constexpr long kCallShiftS = 1000;
long FakeConvert(long, int32_t from, int32_t to, quelta::KernelTimespec* t) {
    ++gConvertCall.calls;
    gConvertCall.lastSec = t->tv_sec;
    gConvertCall.lastFrom = from;
    gConvertCall.lastTo = to;
    if (gConvertCall.overflow) {
        errno = EOVERFLOW;
        return -1;
    }
    t->tv_sec += kCallShiftS;
    return 0;
}

// The kernel call gets its own time point, with seconds as wide as the
// kernel's long. What that cannot hold (a wall-clock time past 2038 on a
// 32-bit target), and a result the call cannot hold, is converted in user
// space instead.
TEST_F(EngineConversionTest, KernelCallHoldsWhatItCanAndUserSpaceTheRest) {
    UseFakeClock();
    gFake.realtime = Ts(1900000000, 0);  // the stand-in's offset: realtime - monotonic
    gFake.monotonic = Ts(1000, 0);
    const int64_t standInShift = -int64_t(1899999000);
    quelta::gSystemClock.convertTime = &FakeConvert;
    gConvertSyscallNr.store(451);
    const bool wideCall = sizeof(long) >= 8;
    const struct {
        int64_t sec;
        bool overflow, standIn;
        int calls;
        int64_t wantSec;
        int32_t result;
    } cases[] = {
        {2000000000, false, true, 1, 2000000000 + kCallShiftS, 0},  // 2033: the call converts
        {2208988800, false, true, wideCall ? 1 : 0,                 // 2040
         2208988800 + (wideCall ? kCallShiftS : standInShift), 0},
        {4102444800, false, true, wideCall ? 1 : 0,                 // 2100
         4102444800 + (wideCall ? kCallShiftS : standInShift), 0},
        {2000000000, true, true, 1, 2000000000 + standInShift, 0},  // the call overflows
        {2000000000, true, false, 1, 2000000000, 75},               // ...with nothing behind it
        {4102444800, false, false, wideCall ? 1 : 0, 4102444800 + (wideCall ? kCallShiftS : 0),
         wideCall ? 0 : 75},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << c.sec << " overflow " << c.overflow << " standIn " << c.standIn);
        gConvertCall = FakeConvertCall{};
        gConvertCall.overflow = c.overflow;
        gConvertStandInEnabled.store(c.standIn);
        timespec ts = Ts(c.sec, 250);
        EXPECT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), c.result);
        EXPECT_EQ(gConvertCall.calls, c.calls);
        if (c.calls != 0) {
            EXPECT_EQ(gConvertCall.lastSec, static_cast<long>(c.sec));
            EXPECT_EQ(gConvertCall.lastFrom, CLOCK_REALTIME);
            EXPECT_EQ(gConvertCall.lastTo, CLOCK_MONOTONIC);
        }
        EXPECT_EQ(static_cast<int64_t>(ts.tv_sec), c.wantSec);
        EXPECT_EQ(ts.tv_nsec, 250);
    }
}

TEST_F(EngineConversionTest, StandInRoundTripsWithinAMicrosecond) {
    std::vector<int64_t> errors;
    for (uint64_t i = 0; i < 41; ++i) {
        const uint64_t m = Now(&iKPusTimingEngine::ReadMonotonic0) + i * 250000000ull;
        errors.push_back(AbsDiff(ToMonotonic(ToGlobal(m)), m));
    }
    std::sort(errors.begin(), errors.end());
    // The median: a preempted conversion on a busy machine may be worse.
    EXPECT_LE(errors[errors.size() / 2], 1000) << "worst " << errors.back() << " ns";
}

TEST_F(EngineConversionTest, StandInFollowsEveryStepOfTheWallClock) {
    quelta::gSystemClock.getTime = &SteppedGetTime;
    const uint64_t m = Now(&iKPusTimingEngine::ReadMonotonic0) + 2 * kNs;
    gStepNs = 0;
    const uint64_t g0 = ToGlobal(m);
    for (int64_t step : {int64_t(3600) * int64_t(kNs), -int64_t(7200) * int64_t(kNs), int64_t(1), int64_t(0)}) {
        gStepNs = step;
        SCOPED_TRACE(step);
        // Both directions see the step at once: nothing is cached.
        EXPECT_LE(AbsDiff(ToGlobal(m), g0 + static_cast<uint64_t>(step)), 500000);
        EXPECT_LE(AbsDiff(ToMonotonic(g0 + static_cast<uint64_t>(step)), m), 500000);
        // The engine's own global reads agree with the converted present.
        const uint64_t nowM = Now(&iKPusTimingEngine::ReadMonotonic0);
        EXPECT_LE(AbsDiff(ToGlobal(nowM), Now(&iKPusTimingEngine::ReadGlobal2)), 500000);
    }
    gStepNs = 0;
}

TEST_F(EngineConversionTest, StandInTakesTheMidpointOfTheTightestBracket) {
    quelta::gSystemClock.getTime = &TickingGetTime;
    const uint64_t point = 1234 * kNs + 5678;
    // readNs 50: a tight first bracket is taken at once (a delay before its
    // first read does not widen it); a widened one is retried. readNs 400:
    // never tight enough to stop early, all three tries are made and the
    // undisturbed one wins, wherever it lies.
    const struct {
        uint64_t readNs;
        int delayed, reads;
    } cases[] = {{50, 0, 3}, {50, 1, 3}, {50, 2, 6}, {50, 3, 6}, {400, 2, 9}, {400, 5, 9}, {400, 8, 9}};
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << c.readNs << "/" << c.delayed);
        gTicking = TickingClock{};
        gTicking.readNs = c.readNs;
        gTicking.delayedRead = c.delayed;
        timespec ts = ToTs(point);
        ASSERT_EQ(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 0);
        EXPECT_EQ(FromTs(ts), point + kRealOffsetNs);
        EXPECT_EQ(gTicking.reads, c.reads);
        if (c.readNs != 50) continue;
        gTicking.reads = 0;
        ts = ToTs(point + kRealOffsetNs);
        ASSERT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), 0);
        EXPECT_EQ(FromTs(ts), point);
    }
}

TEST_F(EngineConversionTest, StandInConvertsRawAndTimesBeforeTheClocksZero) {
    const uint64_t raw = Now(&iKPusTimingEngine::ReadRaw8);
    const uint64_t mono = testsupport::MonoNowNs();
    timespec ts = ToTs(raw);
    ASSERT_EQ(ConvertClockTime(CLOCK_MONOTONIC_RAW, CLOCK_MONOTONIC, &ts), 0);
    EXPECT_LE(AbsDiff(FromTs(ts), mono), 500000);

    // One second after 1970 lies long before the monotonic clock's zero:
    // negative seconds, nanoseconds in [0, 1e9), as the kernel writes them.
    ts = Ts(1, 0);
    ASSERT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), 0);
    EXPECT_LT(ts.tv_sec, 0);
    EXPECT_GE(ts.tv_nsec, 0);
    EXPECT_LT(ts.tv_nsec, 1000000000);
    const uint64_t expected = kNs - (testsupport::RealNowNs() - testsupport::MonoNowNs());
    EXPECT_LE(AbsDiff(FromTs(ts), expected), 500000);
}

TEST_F(EngineConversionTest, StandInFailsCleanlyWhenNoClockCanBeRead) {
    UseFakeClock();
    gFake.failReads = true;
    timespec ts = Ts(8, 9);
    EXPECT_NE(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 0);
    EXPECT_EQ(FromTs(ts), 8 * kNs + 9);
    EXPECT_EQ(ToGlobal(1500000000ull), 2082844801500000000ull) << "degrades to the offset alone";
}

}  // namespace
