// The timing engine called by slot, as the runtime calls it (entry k of the raw virtual table cast to
// the slot's type), so a slot out of place or with a changed signature fails with the behaviour it carries.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/timex.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "SchedulerHarness.h"
#include "TestSupport.h"
#include "engine/EngineRate.h"
#include "engine/SystemClock.h"
#include "tLinux/PalMemory.h"

using quelta::ConvertClockTime;
using quelta::JoinNanoseconds;
using quelta::SplitNanoseconds;

namespace {

constexpr uint64_t kNs = 1000000000ull, kMs = 1000000ull;
constexpr int32_t kEpoch1904 = 2082844800;
constexpr int64_t k2040 = 2208988800, k2100 = 4102444800;  // their first seconds, UTC

timespec Ts(int64_t sec, long nsec) {
    timespec ts{};
    return ts.tv_sec = static_cast<time_t>(sec), ts.tv_nsec = nsec, ts;
}
using testsupport::CT, testsupport::Slot, testsupport::U64;
uint64_t Read(iKPusTimingEngine* e, int k) {
    ClockTime t{0xDEAD, 0xBEEF};
    Slot<void, ClockTime&>(e, k, t);
    return U64(t);
}
uint64_t Convert(iKPusTimingEngine* e, int k, uint64_t v) { return U64(Slot<ClockTime, const ClockTime&>(e, k, CT(v))); }
uint32_t Convert32(iKPusTimingEngine* e, int k, uint32_t v) { return Slot<uint32_t, const uint32_t&>(e, k, v); }

// The kernel as the engine sees it: clocks read what is set here, adjtimex and clock_settime are kept.
struct FakeKernel {
    timespec realtime{}, monotonic{}, raw{}, setTimeArg{};
    bool failReads = false;
    long ticksPerSecond = 100, readTick = 10000, readFreq = 0;
    int setResult = 0, setCalls = 0, setTimeCalls = 0, setTimeResult = 0;
    struct timex lastSet {};
} gFake;

// A fresh engine of the test's own on the fake kernel; every seam is put back.
class Engine : public ::testing::Test {
protected:
    Engine() {
        gFake = FakeKernel{};
        quelta::gKernelTickRate.store(-1.0);
        quelta::gConvertSyscallNr.store(-1);
        quelta::gSystemClock.getTime = [](clockid_t id, timespec* ts) {
            *ts = id == CLOCK_REALTIME ? gFake.realtime : id == CLOCK_MONOTONIC ? gFake.monotonic : gFake.raw;
            return gFake.failReads ? -1 : 0;
        };
        quelta::gSystemClock.adjustTime = [](struct timex* tx) {
            if (tx->modes == 0) return tx->tick = gFake.readTick, tx->freq = gFake.readFreq, TIME_OK;
            return ++gFake.setCalls, gFake.lastSet = *tx, gFake.setResult;
        };
        quelta::gSystemClock.clockTicksPerSecond = [] { return gFake.ticksPerSecond; };
        quelta::gSystemClock.setTime = [](clockid_t id, const timespec* ts) {
            return id != CLOCK_REALTIME ? -1 : (++gFake.setTimeCalls, gFake.setTimeArg = *ts, gFake.setTimeResult);
        };
    }
    ~Engine() override {
        delete engine;
        quelta::gSystemClock = hooks;
        quelta::gConvertSyscallNr.store(syscallNr);
        quelta::gConvertStandInEnabled.store(standIn);
        quelta::gKernelTickRate.store(tickRate);
    }
    void SetRate(double ticksPerSecond) {  // slot 13, keeping what it printed
        testing::internal::CaptureStdout();
        Slot<void, double>(e, 13, ticksPerSecond);
        output = testing::internal::GetCapturedStdout();
    }
    uint64_t ToGlobal(uint64_t m) { return Convert(e, 15, m); }
    uint64_t ToMonotonic(uint64_t g) { return Convert(e, 17, g); }

    const quelta::SystemClockHooks hooks = quelta::gSystemClock;
    const int32_t syscallNr = quelta::gConvertSyscallNr.load();
    const bool standIn = quelta::gConvertStandInEnabled.load();
    const double tickRate = quelta::gKernelTickRate.load();
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;
    std::string output;
};


// 0, 1, 4, 5 monotonic and 2, 3, 6, 7, 53 global, recorded for 45/46 and 47/48; 8, 9 raw, not recorded.
TEST_F(Engine, ReadSlotsAndTheLastReadCells) {
    engine->SetEpochOffset(1000);
    uint64_t cells[2] = {Read(e, 46), Read(e, 48)};
    EXPECT_EQ(cells[0] | cells[1], 0u) << "a new engine's cells";
    for (int k = 0; k <= 9; ++k) {
        SCOPED_TRACE(k);
        gFake = {Ts(200 + k, 2), Ts(100 + k, 1), Ts(300 + k, 3)};
        const int kind = k >= 8 ? 2 : (k / 2) % 2;  // 0 monotonic, 1 global, 2 raw
        const uint64_t want[3] = {(100 + k) * kNs + 1, (200 + k + 1000) * kNs + 2, (300 + k) * kNs + 3};
        EXPECT_EQ(Read(e, k), want[kind]);
        if (kind < 2) cells[kind] = want[kind];
        for (int c : {45, 46}) EXPECT_EQ(Read(e, c), cells[0]) << c;
        for (int c : {47, 48}) EXPECT_EQ(Read(e, c), cells[1]) << c;
    }
    gFake.failReads = true;  // a failed read yields the last recorded value, raw 0
    EXPECT_EQ(Read(e, 5), 105 * kNs + 1);
    EXPECT_EQ(Read(e, 3), 1207 * kNs + 2);
    EXPECT_EQ(Read(e, 9), 0u);
    tKPusTimingEngine fresh;
    EXPECT_EQ(Read(&fresh, 4), 0u) << "before any good read: the cell's 0";
    gFake.failReads = false;  // 53 reads as 2 does, then the generation
    const uint32_t saved = quelta::gGeneration.exchange(0x600Du);
    ClockTime t{};
    uint32_t generation = 0;
    Slot<void, ClockTime&, uint32_t&>(e, 53, t, generation);
    quelta::gGeneration.store(saved);
    EXPECT_EQ(U64(t), 1209 * kNs + 2);
    EXPECT_EQ(Read(e, 48), U64(t));
    EXPECT_EQ(generation, 0x600Du);
}

TEST_F(Engine, UnitExamplesAndConstants) {
    const struct { uint64_t ns, us; } toUs64[] = {
        {0, 0}, {499, 0}, {500, 0}, {501, 1}, {1000, 1}, {1500, 1}, {1501, 2}, {4294967295ull, 4294967},
        {4294967795ull, 4294968}, {14510501ull, 14510}, {0xFFFFFFFFFFFFFFFFull, 18446744073709551ull},
    };
    for (int k : {21, 29})
        for (const auto& c : toUs64) EXPECT_EQ(Convert(e, k, c.ns), c.us) << k << ": " << c.ns;
    for (int k : {22, 30})
        for (auto [ns, us] : {std::pair<uint32_t, uint32_t>{999, 0}, {1000, 1}, {~0u, 4294967}}) EXPECT_EQ(Convert32(e, k, ns), us);
    for (int k : {20, 28}) EXPECT_EQ(Convert32(e, k, 4294968u), 704u) << k;  // wraps modulo 2^32
    for (int k : {19, 27}) EXPECT_EQ(Convert(e, k, 0x0123456789ABCDEFull), 0x71C71C71C71C6D98ull) << k;
    EXPECT_EQ(U64(Slot<ClockTime>(e, 10)), kNs);
    quelta::gSystemClock.getRes = [](clockid_t id, timespec* ts) { return *ts = Ts(id == CLOCK_MONOTONIC_RAW ? 2 : 9, 3), 0; };
    EXPECT_EQ(U64(Slot<ClockTime>(e, 11)), 2 * kNs + 3);
    quelta::gSystemClock.getRes = [](clockid_t, timespec*) { return -1; };
    EXPECT_EQ(U64(Slot<ClockTime>(e, 11)), 0u) << "a resolution that cannot be read is 0";
}

// 21 is within (-1.5, +0.5] us, exact below 14,510,501; 22 divides; 19, 20 wrap.
TEST_F(Engine, UnitSlotsMatchTheirDefinitionsEverywhere) {
    uint32_t bad = 0;
    auto check = [&](uint64_t x) {
        const uint64_t got = Convert(e, 21, x);
        const int64_t d = static_cast<int64_t>(got * 1000 - x);
        const uint32_t y = static_cast<uint32_t>(x);
        const bool ok = d > -1500 && d <= 500 && (x >= 14510501u || got == (x + 499) / 1000) &&
                        Convert32(e, 22, y) == y / 1000u && Convert32(e, 20, y) == y * 1000u &&
                        Convert(e, 19, x) == x * 1000u;
        if (!ok && ++bad < 5) ADD_FAILURE() << "x=" << x << " got " << got;
    };
    for (uint64_t x = 0; x < 14510501u; x += 7) check(x);
    for (uint64_t x = 14509000; x < 14510501u; ++x) check(x);
    for (uint64_t k = 4294000; k <= 4294967; ++k) check(k * 1000 - 1), check(k * 1000);  // slot 22's top end
    for (int bit = 0; bit < 64; ++bit)  // around every power of two, where carries happen
        for (uint64_t delta = 0; delta < 3003; ++delta) check((uint64_t(1) << bit) + delta - 2002);
    for (uint64_t delta = 0; delta < 200000; ++delta) check(~uint64_t(0) - delta), check(0xFFFFFFFFu - delta);
    std::mt19937_64 rng(0x5EED1234u);  // the full range, and each magnitude equally often
    for (int i = 0; i < 1500000; ++i) check(rng()), check(rng() >> (i % 64));
    EXPECT_EQ(bad, 0u);
}


// With no conversion at all only the epoch offset applies, exactly: global = (offset + sec) * 1e9 + nsec
// in 64-bit seconds (past 2038-01-19 they go on, before the zero they wrap), read or converted either way.
TEST_F(Engine, WithoutAnyConversionReadsAndConversionsApplyOnlyTheEpochOffset) {
    quelta::gConvertStandInEnabled.store(false);
    const struct { int32_t nr; timespec kernel; int32_t offset; uint64_t global; } cases[] = {
        {-1, Ts(1700000000, 123456789), kEpoch1904, (1700000000ull + kEpoch1904) * kNs + 123456789},
        {0, Ts(1, 500000000), kEpoch1904, 2082844801500000000ull},
        {-1, Ts(1700000000, 123456789), -1000, 1699999000ull * kNs + 123456789},
        {-1, Ts(1, 500000000), -100, uint64_t(0) - 98500000000ull},
        {-1, Ts(5, 250), -10, uint64_t(0) - 5 * kNs + 250},
        {-1, Ts(0x80000000ll, 0), kEpoch1904, (0x80000000ull + kEpoch1904) * kNs},
        {-1, Ts(0x100000005ll, 7), kEpoch1904, (0x100000005ull + kEpoch1904) * kNs + 7},
        {-1, Ts(k2100, 5), kEpoch1904, (k2100 + kEpoch1904) * kNs + 5},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << c.nr << " " << c.offset << " " << c.kernel.tv_sec);
        quelta::gConvertSyscallNr.store(c.nr);
        gFake.realtime = gFake.monotonic = gFake.raw = c.kernel;
        engine->SetEpochOffset(c.offset);
        const uint64_t m = JoinNanoseconds(c.kernel);
        EXPECT_EQ(std::tuple(Read(e, 2), Read(e, 0), Read(e, 8)), std::tuple(c.global, m, m));
        timespec ts = Ts(123, 456);
        EXPECT_EQ(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 38);
        EXPECT_EQ(JoinNanoseconds(ts), 123 * kNs + 456);
        for (int k : {15, 16, 23, 24}) EXPECT_EQ(Convert(e, k, m), c.global) << k;
        for (int k : {17, 18, 25, 26}) EXPECT_EQ(Convert(e, k, c.global), m) << k;
    }
}

// The call gets number, from, to, time point in order: getpriority(from, to) stands in, and only the
// arguments in that order name this process (20 - nice); any other order fails (EINVAL).
TEST_F(Engine, KernelCallIsPassedThroughAndBadClockIdsAreRefused) {
    quelta::gConvertSyscallNr.store(static_cast<int32_t>(SYS_getpriority));
    timespec ts = Ts(77, 88);
    const int32_t r = ConvertClockTime(PRIO_PROCESS, static_cast<int32_t>(getpid()), &ts);
    quelta::gConvertSyscallNr.store(-1);
    EXPECT_EQ(r, 20 - getpriority(PRIO_PROCESS, 0)) << "the call's arguments were not passed in order";
    EXPECT_EQ(JoinNanoseconds(ts), 77 * kNs + 88);
    const int32_t ids[][3] = {{2, 1, 22}, {1, 7, 22}, {-1, 0, 22}, {0, 3, 22}, {1, 1, 0}};  // from, to, result
    for (const auto& c : ids) {
        ts = Ts(5, 6);
        EXPECT_EQ(ConvertClockTime(c[0], c[1], &ts), c[2]) << c[0] << "->" << c[1];
        EXPECT_EQ(JoinNanoseconds(ts), 5 * kNs + 6);
    }
}

// A conversion call that moves every time point on by 1000 s, or overflows as a kernel does.
struct FakeConvertCall { int calls; long lastSec; int32_t lastFrom, lastTo; bool overflow; } gCall;
long FakeConvert(long, int32_t from, int32_t to, quelta::KernelTimespec* t) {
    gCall = {gCall.calls + 1, t->tv_sec, from, to, gCall.overflow};
    if (gCall.overflow) return errno = EOVERFLOW, -1;
    return t->tv_sec += 1000, 0;
}

// What the call's long seconds cannot hold (past 2038 on 32 bits, an overflow) goes to user space, or 75.
TEST_F(Engine, KernelCallHoldsWhatItCanAndUserSpaceTheRest) {
    gFake.realtime = Ts(1900000000, 0);
    gFake.monotonic = Ts(1000, 0);
    const int64_t user = -int64_t(1899999000), call = 1000;  // the two conversions' shifts
    quelta::gSystemClock.convertTime = &FakeConvert;
    quelta::gConvertSyscallNr.store(451);
    const bool wide = sizeof(long) >= 8;
    const struct { int64_t sec; bool overflow, standIn; int calls; int64_t want; int32_t result; } cases[] = {
        {2000000000, false, true, 1, 2000000000 + call, 0},  // 2033: the call converts
        {k2040, false, true, wide, k2040 + (wide ? call : user), 0},
        {k2100, false, false, wide, k2100 + (wide ? call : 0), wide ? 0 : 75},
        {2000000000, true, true, 1, 2000000000 + user, 0},  // the call overflows
        {2000000000, true, false, 1, 2000000000, 75},       // ...with nothing behind it
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << c.sec << " overflow " << c.overflow << " standIn " << c.standIn);
        gCall = FakeConvertCall{0, 0, -1, -1, c.overflow};
        quelta::gConvertStandInEnabled.store(c.standIn);
        timespec ts = Ts(c.sec, 250);
        EXPECT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), c.result);
        EXPECT_EQ(gCall.calls, c.calls);
        if (c.calls != 0) { EXPECT_EQ(std::make_tuple(gCall.lastSec, gCall.lastFrom, gCall.lastTo),
                                      std::make_tuple(static_cast<long>(c.sec), CLOCK_REALTIME, CLOCK_MONOTONIC)); }
        EXPECT_EQ(static_cast<int64_t>(ts.tv_sec), c.want);
        EXPECT_EQ(ts.tv_nsec, 250);
    }
}

// The user-space conversion on still clocks is exact, in every year, before zero and across a step.
TEST_F(Engine, StandInConvertsExactlyOnStillClocks) {
    engine->SetEpochOffset(kEpoch1904);
    const uint64_t m = 5000 * kNs + 987654321, raw = 7000 * kNs + 5, later = 3600 * kNs + 1;
    gFake.monotonic = SplitNanoseconds(m);
    gFake.raw = SplitNanoseconds(raw);
    for (int64_t sec : {int64_t(1700000000), k2040, k2100}) {
        SCOPED_TRACE(sec);
        const uint64_t wall = uint64_t(sec) * kNs + 123456789, g = wall + uint64_t(kEpoch1904) * kNs;
        gFake.realtime = SplitNanoseconds(wall);
        EXPECT_EQ(ToGlobal(m + later), g + later);
        EXPECT_EQ(ToMonotonic(g - later), m - later);
        timespec ts = SplitNanoseconds(raw + 1);
        ASSERT_EQ(ConvertClockTime(CLOCK_MONOTONIC_RAW, CLOCK_MONOTONIC, &ts), 0);
        EXPECT_EQ(JoinNanoseconds(ts), m + 1);
        ts = Ts(1, 0);  // 1 s + m - wall
        ASSERT_EQ(ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts), 0);
        EXPECT_EQ(static_cast<int64_t>(ts.tv_sec) * kNs + ts.tv_nsec, (5001 - sec) * int64_t(kNs) + 864197532);
        gFake.realtime = SplitNanoseconds(wall - 7200 * kNs);  // a step back
        EXPECT_EQ(ToGlobal(m), g - 7200 * kNs);
    }
    gFake.failReads = true;  // no clock to read: the time point stays, the engine degrades to the offset
    timespec ts = Ts(8, 9);
    EXPECT_NE(ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts), 0);
    EXPECT_EQ(JoinNanoseconds(ts), 8 * kNs + 9);
    EXPECT_EQ(ToGlobal(1500000000ull), 2082844801500000000ull);
}

// Each read moves time on by readNs, one read 100 us more (a preemption); realtime runs kReal ahead.
constexpr uint64_t kReal = 1700000000ull * kNs + 123;
struct TickingClock { uint64_t now, readNs; int delayedRead, reads; } gTicking;
int TickingGetTime(clockid_t id, timespec* ts) {
    gTicking.now += gTicking.readNs + (++gTicking.reads == gTicking.delayedRead ? 100000 : 0);
    return *ts = SplitNanoseconds(id == CLOCK_REALTIME ? gTicking.now + kReal : gTicking.now), 0;
}

// A tight bracket (readNs 50) ends the tries at once; else all three are made and the tightest wins.
TEST_F(Engine, StandInTakesTheMidpointOfTheTightestBracket) {
    quelta::gSystemClock.getTime = &TickingGetTime;
    const uint64_t point = 1234 * kNs + 5678;
    const struct { uint64_t readNs; int delayed, reads; } cases[] = {
        {50, 0, 3}, {50, 1, 3}, {50, 2, 6}, {50, 3, 6}, {400, 2, 9}, {400, 5, 9}, {400, 8, 9}};
    for (const auto& c : cases) {
        for (bool toReal : {true, false}) {
            SCOPED_TRACE(testing::Message() << c.readNs << "/" << c.delayed << " to realtime " << toReal);
            gTicking = TickingClock{5 * kNs, c.readNs, c.delayed, 0};
            timespec ts = SplitNanoseconds(toReal ? point : point + kReal);
            const int from = toReal ? CLOCK_MONOTONIC : CLOCK_REALTIME, to = toReal ? CLOCK_REALTIME : CLOCK_MONOTONIC;
            ASSERT_EQ(ConvertClockTime(from, to, &ts), 0);
            EXPECT_EQ(JoinNanoseconds(ts), toReal ? point + kReal : point);
            EXPECT_EQ(gTicking.reads, c.reads);
        }
    }
}


// W = 1000 * 2^32 * (tick + freq / 2^16) split in the documented order; announced once; refusal reported.
TEST_F(Engine, SetClockRateSplitsTheRateWordIntoTickAndFreq) {
    const struct { double rate; long tick, freq; } cases[] = {  // freq < 0: not checked
        {100.0, 10000, 0}, {101.0, 10100, 0}, {50.0, 5000, 0}, {0.0, 0, 0},
        {100.01, 10000, 65535}, {99.99, 9998, 65535},  // double rounding: W just below the next tick
        {1e300, 2147483, -1}, {HUGE_VAL, 2147483, -1}, {-1e300, -2147483, -1},  // W saturates
        {std::nan(""), 0, 0}, {1e-300, 0, 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.rate);
        gFake.setCalls = 0;
        SetRate(c.rate);
        EXPECT_EQ(output, &c == cases ? "ticks_per_sec= 100\n" : "");
        const struct timex& tx = gFake.lastSet;
        EXPECT_EQ(gFake.setCalls, 1);
        EXPECT_EQ(tx.modes, 0x4002u);
        EXPECT_EQ(tx.tick, c.tick);
        EXPECT_TRUE(c.freq < 0 || tx.freq == c.freq) << tx.freq;
        EXPECT_EQ(tx.offset | tx.maxerror | tx.esterror | tx.status | tx.constant | tx.time.tv_sec, 0);
    }
    testing::internal::CaptureStdout();
    Slot<void, double>(e, 56, 50.0 / 1e6);  // ticks per microsecond
    EXPECT_EQ(gFake.lastSet.tick, 5000);
    gFake.setResult = -1;
    Slot<void, double>(e, 56, 101.0 / 1e6);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "unable to update frequency [adjtimex(tick= 10100, freq= 0) failed]\n");
    SetRate(0.0);
    EXPECT_EQ(output, "unable to update frequency [adjtimex(tick= 0, freq= 0) failed]\n");
}

// The rate read back from tick and freq; set back, it is kept within one freq unit and reads the same.
TEST_F(Engine, GetClockRateRebuildsTheRateWordAndSetBackKeepsIt) {
    struct timex host {};
    adjtimex(&host);  // modes 0: reads the machine's values, changes nothing
    const struct { long tick, freq; double rate, within; } cases[] = {  // within < 0: rate not checked
        {10000, 0, 100.0, 0}, {10000, 65535, 100.0099998474121, 0}, {10100, 0, 101.0, 0},
        {9999, -32768, 99.985, 1e-9},  // a negative frequency offset lowers the rate
        {10000, 1234567, 0, -1}, {9999, -2000000, 0, -1}, {10001, 32768000, 0, -1}, {10000, -32768000, 0, -1},
        {9000, 1, 0, -1}, {static_cast<long>(host.tick), static_cast<long>(host.freq), 0, -1},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << c.tick << "/" << c.freq);
        gFake.readTick = c.tick, gFake.readFreq = c.freq;
        const double rate = Slot<double>(e, 12);
        if (c.within >= 0) { EXPECT_NEAR(rate, c.rate, c.within); }
        SetRate(rate);
        EXPECT_LE(std::llabs((gFake.lastSet.tick - c.tick) * 65536ll + gFake.lastSet.freq - c.freq), 1);
        gFake.readTick = gFake.lastSet.tick, gFake.readFreq = gFake.lastSet.freq;
        EXPECT_NEAR(Slot<double>(e, 12), rate, rate * 1e-8);
    }
    gFake.readTick = 10000, gFake.readFreq = 0;
    EXPECT_EQ(quelta::CurrentClockRate(), 1e-4) << "in ticks per microsecond";
}

// A signed delta in 64-bit seconds, the epoch offset playing no part; settime's result comes back.
TEST_F(Engine, StepGlobalClockAddsASignedDelta) {
    engine->SetEpochOffset(kEpoch1904);
    const struct { int64_t sec; uint64_t delta; int64_t wantSec; long wantNsec; } cases[] = {
        {1700000000, 0, 1700000000, 999999999}, {1700000000, 3600 * kNs, 1700003600, 999999999},
        {1700000000, 0xFFFFFFFFC4653600ull, 1699999999, 999999999},  // -1e9: one second back
        {1700000000, 1, 1700000001, 0}, {1700000000, uint64_t(0) - 1, 1700000000, 999999998},
        {0x7FFFFFFF, kNs, 0x80000000ll, 999999999},  // across 2038-01-19
        {k2100, 0xFFFFFFFFC4653600ull, k2100 - 1, 999999999},
    };
    for (const auto& c : cases) {
        gFake.realtime = Ts(c.sec, 999999999);
        EXPECT_EQ((Slot<int32_t, const ClockTime&>(e, 14, CT(c.delta))), 0);
        EXPECT_EQ(static_cast<int64_t>(gFake.setTimeArg.tv_sec), c.wantSec) << c.delta;
        EXPECT_EQ(gFake.setTimeArg.tv_nsec, c.wantNsec) << c.delta;
    }
    gFake.setTimeResult = -1;
    EXPECT_EQ(e->StepGlobalClock(CT(0)), -1);
    gFake.failReads = true;  // a clock that cannot be read is not set at all
    EXPECT_EQ(e->StepGlobalClock(CT(kNs)), -1);
    EXPECT_EQ(gFake.setTimeCalls, 8);
}


TEST_F(Engine, HistogramModeRules) {
    const struct { std::vector<uint32_t> samples; uint32_t width, limit, mode; } cases[] = {
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
        {{}, 10, 100, 0}, {{15, 25, 25, 35}, 0, 100, 0}, {{0, 0, 5}, 0, 100, 0},  // none; width 0
        {{0xFFFFFFFFu, 0xFFFFFFFFu}, 1, 100, 0},
        {{70, 70, 10}, 3, 100, 69},  // 70/3 + 0.5 -> 23; 23 * 3 + 0.5 -> 69
    };
    auto mode = [&](const std::vector<uint32_t>& s, uint32_t width, uint32_t limit) {
        return Slot<uint32_t, const uint32_t*, uint32_t, uint32_t, uint32_t>(e, 32, s.data(), uint32_t(s.size()), width, limit);
    };
    for (const auto& c : cases) EXPECT_EQ(mode(c.samples, c.width, c.limit), c.mode) << testing::PrintToString(c.samples);
    const uint32_t before = quelta::gPalAllocCount.load();  // counters allocated per call; without them 0
    EXPECT_EQ(mode(cases[0].samples, 10, 100), 30u);
    EXPECT_EQ(quelta::gPalAllocCount.load() - before, 1u);
    quelta::gPalAllocFailCountdown.store(1);
    EXPECT_EQ(mode(cases[0].samples, 10, 100), 0u);
    quelta::gPalAllocFailCountdown.store(0);
    EXPECT_EQ(mode(cases[0].samples, 10, 100), 30u);
}

// Exactly the record, or its header, to any address (the words' order: the calibration test).
TEST_F(Engine, CopyStatisticsWritesExactlyTheBlockOrItsHeader) {
    quelta::StatisticsBlock& s = engine->stats;  // word i holds i + 1, the reserved word 0
    s.jitterMode.store(2), s.rawReadCost.store(3), s.globalReadExtra.store(4);
    for (uint32_t i = 0; i < 1000; ++i) {
        s.jitterSamples[i].store(5 + i), s.rawReadSamples[i].store(1005 + i), s.globalReadSamples[i].store(2005 + i);
    }
    constexpr size_t kBlock = 12016, kGuard = 65;  // an odd start: unaligned destination
    std::vector<unsigned char> buf(kBlock + 2 * kGuard);
    for (uint32_t full : {0u, 1u, 0x80000000u}) {
        const size_t size = full ? kBlock : 16;
        std::fill(buf.begin(), buf.end(), 0xA5);
        Slot<void, void*, uint32_t>(e, 31, &buf[kGuard], full);
        uint32_t words[2];  // the reserved first word, the last one written
        std::memcpy(&words[0], &buf[kGuard], 4), std::memcpy(&words[1], &buf[kGuard + size - 4], 4);
        EXPECT_EQ(std::tuple(words[0], words[1]), std::tuple(0u, uint32_t(size / 4))) << full;
        size_t outside = 0;
        for (size_t i = 0; i < buf.size(); ++i) outside += (i < kGuard || i >= kGuard + size) && buf[i] != 0xA5;
        EXPECT_EQ(outside, 0u) << "writes " << size << " bytes exactly";
    }
}

// Stands in for the tick service: one of `samples` per "tick" while recording is on, `ticks` at most.
struct FakeTicker {
    std::atomic<bool> stop{false};
    std::thread thread;
    FakeTicker(tKPusTimingEngine* en, std::vector<uint32_t> samples, int ticks) : thread([=] {
        for (int served = 0; !stop.load(); std::this_thread::sleep_for(std::chrono::microseconds(20))) {
            const int32_t n = en->statsCount.load();
            if (served >= ticks || en->statsEnabled.load() == 0 || n >= 1000) continue;
            en->stats.jitterSamples[n].store(samples[static_cast<size_t>(n)]);
            en->statsCount.store(n + 1), ++served;
        }
    }) {}
    ~FakeTicker() { stop.store(true), thread.join(); }
};

// The n-th raw read pair 40 ns apart (41 for odd n), the n-th wall-clock pair 103 ns (n % 4 == 0) or 100.
struct PairedClock { uint64_t raw = 5 * kNs, real = 1700000000ull * kNs; int rawReads = 0, realReads = 0; } gPaired;
int PairedGetTime(clockid_t id, timespec* ts) {
    const int k = id == CLOCK_MONOTONIC_RAW ? gPaired.rawReads++ : gPaired.realReads++;
    if (id == CLOCK_MONOTONIC_RAW) return *ts = SplitNanoseconds(gPaired.raw += k % 2 == 0 ? 1000 : 40 + (k / 2) % 2), 0;
    return *ts = SplitNanoseconds(gPaired.real += k % 2 == 0 ? 1000 : (k / 2) % 4 == 0 ? 103 : 100), 0;
}

TEST_F(Engine, CalibrateFillsTheRecordFromReadPairsAndTicks) {
    gFake.ticksPerSecond = 1000000;  // and tick 1000: a raw sample is the raw pair's distance in ns
    gFake.readTick = 1000;
    gPaired = PairedClock{};
    quelta::gSystemClock.getTime = &PairedGetTime;
    std::vector<uint32_t> jitter(1000, 7000);
    for (size_t i = 0; i < 600; ++i) jitter[i * 5 / 3] = 52;  // bucket 5 -> 50
    FakeTicker ticker(engine, jitter, 1000);
    EXPECT_EQ(engine->CalibrateWithin(10000), 50u);
    EXPECT_EQ(engine->statsEnabled.load() * 10000 + engine->statsCount.load(), 1000u);
    std::vector<uint32_t> block(3004);
    e->CopyStatistics(block.data(), 1);
    for (size_t i = 0; i < 1000; ++i) {
        ASSERT_EQ(block[4 + i], jitter[i]) << i;
        ASSERT_EQ(block[1004 + i], 40u + i % 2) << i;
        ASSERT_EQ(block[2004 + i], i % 4 == 0 ? 103u : 100u) << i;
    }
    // Raw pairs 40.5 ns on average, rounded to 41; wall-clock pairs 100.75 -> 101, 60 more than raw.
    EXPECT_EQ((std::vector<uint32_t>(block.begin(), block.begin() + 4)), (std::vector<uint32_t>{0, 50, 41, 60}));
    EXPECT_EQ(Read(e, 48), gPaired.real) << "the pairs are read through the engine";
}

// Without ticks it gives up; a raw pair 1 us apart at 100 kernel ticks per second saturates its sample.
TEST_F(Engine, CalibrateWithinGivesUpWhenTheTicksStop) {
    quelta::gSystemClock.getTime = [](clockid_t id, timespec* ts) {
        return *ts = id == CLOCK_MONOTONIC_RAW ? SplitNanoseconds(gPaired.raw += 1000) : Ts(1, 0), 0;
    };
    {
        FakeTicker ticker(engine, std::vector<uint32_t>(1000, 52), 500);
        EXPECT_EQ(engine->CalibrateWithin(100), 0u);
    }
    EXPECT_EQ(engine->statsEnabled.load() * 10000 + engine->statsCount.load(), 500u);
    EXPECT_EQ(engine->stats.jitterMode.load(), 0u);
    EXPECT_EQ(engine->stats.rawReadSamples[0].load(), 0xFFFFFFFFu);
    EXPECT_EQ(engine->CalibrateWithin(20), 0u);  // no tick service at all
    EXPECT_EQ(engine->statsEnabled.load(), 0u);
}


// The library's engine (gEngine) over a scheduler under the test's control, on the real clocks.
class EngineSlots : public ::testing::Test {
protected:
    static constexpr int32_t kEpoch = 1000;  // seconds: tells the global base from the monotonic one
    void SetUp() override {
        e = engine = quelta::gEngine.load();
        engine->SetEpochOffset(kEpoch);
        quelta::gCpuSpeed.store(1000);
    }
    void TearDown() override { quelta::gCpuSpeed.store(cpuSpeed); }
    uint64_t GlobalNow() { return testsupport::RealNowNs() + kEpoch * kNs; }
    const uint32_t cpuSpeed = quelta::gCpuSpeed.load();
    testsupport::SchedulerHarness harness;
    tKPusTimingEngine* engine = nullptr;
    iKPusTimingEngine* e = nullptr;
};

uint32_t NeverCalled(void*) { return 0; }

// 33 refuses a null semaphore, takes a posted one; 34 queues a node and hands it out; 35 cancels it.
TEST_F(EngineSlots, Slots33To35EventWaitsAndRelease) {
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, uint32_t>(e, 33, nullptr, 5u)), 3u);
    ASSERT_NE(quelta::PalInitialize(), 0u);
    PalSemaphore* sem = nullptr;
    ASSERT_EQ(quelta::PalSemaphoreCreate(&sem), 0);
    quelta::PalSemaphorePost(sem);
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, uint32_t>(e, 33, sem, 0xFFFFFFFFu)), 0u);
    const ClockTime deadline = CT(harness.Now() + 5 * kMs);
    WaitNode* node = nullptr;
    int marker = 0;
    EXPECT_EQ((Slot<uint32_t, PalSemaphore*, const ClockTime&, QueltaWaitCallbackFn, void*, uint32_t, WaitNode**>(
                  e, 34, sem, deadline, &NeverCalled, &marker, 1u, &node)), 0u);
    ASSERT_EQ(harness.ListOrder(), std::vector<WaitNode*>{node});
    EXPECT_EQ(node->deadline.load(), U64(deadline));
    EXPECT_EQ(node->callbackArg.load(), &marker);
    EXPECT_EQ(node->semaphore.load(), sem);
    EXPECT_EQ(node->isGlobal.load(), 1u);
    Slot<void, WaitNode*>(e, 35, node);
    EXPECT_TRUE(harness.ListOrder().empty());
    EXPECT_EQ(harness.FreeNodes(), quelta::kWaitNodeCount);
    quelta::PalSemaphoreDestroy(sem);
}

// 36-38 (us), 39-42 and 49 (ns) never wake before their target and return the time after. The
// 32-bit targets lie 20 ms ahead: a test thread held past one (plus the 1 ms tolerance) would wait
// for the low word to come round. Targets just passed are plainwait_test's, on a scripted clock.
TEST_F(EngineSlots, Slots36To42And49WaitForTheirTarget) {
    enum Kind { kFor, kNextMultiple, kUntil };
    const struct { int slot; uint64_t unitNs; Kind kind; int64_t amount; } cases[] = {
        {36, 1000, kFor, 2000},   {37, 1000, kNextMultiple, 3000}, {38, 1000, kUntil, 20000},
        {39, 1, kFor, 2000000},   {40, 1, kNextMultiple, 3000000}, {41, 1, kUntil, 1500000},
        {42, 1, kUntil, 20000000}, {49, 1, kNextMultiple, 2000000}, {49, 1, kUntil, 0},  // period 0: at once
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.slot);
        const uint64_t slack = c.unitNs == 1 ? 0 : 1;  // microseconds are rounded, not truncated
        const uint64_t before = testsupport::MonoNowNs() / c.unitNs;
        const uint64_t target = c.kind == kNextMultiple ? (before / c.amount + 1) * c.amount : before + c.amount;
        const ClockTime t64 = CT(c.slot == 41 ? target : c.amount);
        const uint64_t r = c.slot == 49 ? U64(Slot<ClockTime, const ClockTime&>(e, 49, t64))
                           : c.slot == 41 ? Slot<uint32_t, const ClockTime*>(e, 41, &t64)
                                          : Slot<uint32_t, uint32_t>(e, c.slot, uint32_t(c.kind == kUntil ? target : c.amount));
        const uint64_t after = testsupport::MonoNowNs() / c.unitNs, from = c.amount > 0 ? target : before;
        if (c.amount > 0) { EXPECT_GE(after + slack, target); }
        const uint64_t mask = c.slot == 49 ? ~uint64_t(0) : 0xFFFFFFFFu;
        EXPECT_LE((r - from) & mask, after + slack - from);
        EXPECT_TRUE((c.slot != 39 && c.amount != 0) || (Read(e, 46) & mask) == r) << "the wait records the time";
    }
}

void TickFn(uint64_t) {}

// 43: 1 sets the flag, 2 clears it; 44: 1 only for service mode 0; 54/55 (un)register the tick callback.
TEST_F(EngineSlots, Slots43To44And54To55FlagServiceAndTickCallback) {
    const uint32_t savedFlag = quelta::gControlFlag.load();
    for (uint32_t action : {1u, 3u, 2u}) {
        Slot<void, uint32_t>(e, 43, action);
        EXPECT_EQ(quelta::gControlFlag.load(), action == 2 ? 0u : 1u) << action;
    }
    quelta::gControlFlag.store(savedFlag);
    for (uint32_t mode : {0u, 1u, 2u, 0xFFFFFFFFu}) {
        engine->serviceMode.store(mode);
        EXPECT_EQ(Slot<uint32_t>(e, 44), mode == 0 ? 1u : 0u) << mode;
    }
    engine->serviceMode.store(0);
    Slot<void, QueltaTickCallbackFn>(e, 54, &TickFn);
    EXPECT_EQ(quelta::gTickCallback.load(), &TickFn);
    Slot<void, QueltaTickCallbackFn>(e, 55, nullptr);  // another function: cleared all the same
    EXPECT_EQ(quelta::gTickCallback.load(), nullptr);
}

// 52: a stale generation aborts at once; target 0 is no wait and gives the time after.
TEST_F(EngineSlots, Slot52GlobalWait) {
    const uint32_t saved = quelta::gGeneration.exchange(5);
    const ClockTime target = CT(0);
    uint32_t abortFlag = 77;
    ClockTime after = CT(0xDEADBEEFull);
    Slot<void, const ClockTime*, uint32_t*, ClockTime*, uint32_t>(e, 52, &target, &abortFlag, &after, 4u);
    EXPECT_EQ(abortFlag, 1u);
    EXPECT_EQ(U64(after), 0xDEADBEEFull);
    const uint64_t before = GlobalNow();
    Slot<void, const ClockTime*, uint32_t*, ClockTime*, uint32_t>(e, 52, &target, &abortFlag, &after, 5u);
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_GE(U64(after), before);
    EXPECT_LE(U64(after), GlobalNow());
    quelta::gGeneration.store(saved);
}

}  // namespace
