// The plain waits, read off the sleeps they ask for (through the engine's seam) while the clock reads
// scripted times: each 32- and 64-bit branch exactly. Also the arithmetic they divide with, and queries.
#include <gtest/gtest.h>
#include <errno.h>

#include <atomic>
#include <random>
#include <tuple>
#include <vector>
#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "engine/ClockWaits.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "engine/U64Arith.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"

namespace quelta {
namespace {

constexpr uint64_t kMs = 1000000;
uint32_t Low(uint64_t t) { return static_cast<uint32_t>(t); }
uint64_t Join(uint32_t high, uint32_t low) { return (uint64_t(high) << 32) | low; }

// Monotonic reads: the scripted times first, then the real clock; counted.
struct ScriptedEngine : tKPusTimingEngine {
    std::vector<uint64_t> script;
    std::atomic<int> reads{0};
    void ReadMonotonic4(ClockTime& out) override {
        const size_t read = static_cast<size_t>(reads.fetch_add(1));
        read < script.size() ? void(out = FromU64(script[read])) : tKPusTimingEngine::ReadMonotonic4(out);
    }
};

// The sleeps asked for (absolute?, ns), recorded, not slept; the first gInterruptions end with EINTR.
using Sleep = std::pair<bool, uint64_t>;
using Sleeps = std::vector<Sleep>;
Sleeps gSleeps;
int gInterruptions = 0;
uint64_t gRemaining = 0;
int RecordSleep(clockid_t clock, int flags, const timespec* request, timespec* remaining) {
    EXPECT_EQ(clock, CLOCK_MONOTONIC);
    gSleeps.push_back({flags == TIMER_ABSTIME, JoinNanoseconds(*request)});
    if (gInterruptions == 0) return 0;
    if (--gInterruptions, remaining != nullptr) *remaining = SplitNanoseconds(gRemaining);
    return EINTR;
}
Sleep Until(uint64_t t) { return {true, t}; }  Sleep For(uint64_t d) { return {false, d}; }  // absolute, relative

class PlainWaitTest : public ::testing::Test {
protected:
    void SetUp() override { gCpuSpeed = 1000, gEngine.store(&engine), gSystemClock.sleep = &RecordSleep; }
    void TearDown() override { gEngine.store(nullptr), gCpuSpeed = 0, gSystemClock.sleep = realSleep, gInterruptions = 0; }
    template <typename Fn>
    Sleeps SleepsOf(std::vector<uint64_t> times, Fn fn) {  // what `fn` asks for while the clock reads `times`
        gSleeps.clear(), engine.script = std::move(times), engine.reads = 0;
        return fn(), gSleeps;
    }
    uint64_t Us(uint64_t clocks) { return ToU64(engine.ClocksToMicroseconds64Fwd(FromU64(clocks))); }
    ScriptedEngine engine;
    int (*const realSleep)(clockid_t, int, const timespec*, timespec*) = gSystemClock.sleep;
};

// A zero duration, period or target is no wait: one clock read, the time back, no sleep (also a
// microsecond target of 0 while the current low word is below the past tolerance).
TEST_F(PlainWaitTest, ZeroArgumentsNeitherSleepNorReadTwice) {
    uint32_t (*const waits[])(uint32_t) = {quelta_iTSC_WaitClocks_C, quelta_iTSC_WaitUntilNextMultipleClocks_C,
        quelta_iTSC_WaitMicroSeconds_C, quelta_iTSC_WaitUntilMicroSeconds_C, quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C};
    for (uint64_t n : {Join(5, 123456789), (Join(1, 0) + 500) * 1000}) {
        for (int i = 0; i < 5; ++i) {
            uint32_t r = 0;
            EXPECT_EQ(SleepsOf({n}, [&] { r = waits[i](0); }), Sleeps{}) << i << " at " << n;
            EXPECT_EQ(std::tuple(r, engine.reads.load()), std::tuple(i < 2 ? Low(n) : Low(Us(n)), 1)) << i;
        }
    }
    ClockTime r{0, 0};  // and a 64-bit period of 0
    EXPECT_EQ(SleepsOf({Join(5, 7)}, [&] { r = WaitUntilNextMultipleClocks64Impl(ClockTime{0, 0}); }), Sleeps{});
    EXPECT_EQ(std::tuple(ToU64(r), engine.reads.load()), std::tuple(Join(5, 7), 1));
}

// A next-multiple wait sleeps until the first multiple strictly after the call (on one: a whole
// period), by each division path (32-bit while high words are 0) and across the carry; it returns
// the time read after the sleep. Microsecond rows are in microseconds.
TEST_F(PlainWaitTest, NextMultipleIsTheFirstMultipleStrictlyLater) {
    enum Kind { kClocks, kSlot49, kMicro };
    const uint64_t after = Join(77, 0x12345), half = 500000000, wide = Join(3, 7), big = 5000000 * kMs;
    const struct { Kind kind; uint64_t now, period, deadline; } rows[] = {
        {kClocks, 7 * half, half, 8 * half},  {kClocks, 7 * half + 1, half, 8 * half},
        {kClocks, 7 * half - 1, half, 7 * half}, {kClocks, 0xFFFFFFFF, 3, 0x100000002},
        {kClocks, big, kMs, big + kMs},       {kClocks, big + 1, kMs, big + kMs},
        {kClocks, Join(3, 0), 0x80000000u, Join(3, 0x80000000u)},
        {kSlot49, 7 * half, half, 8 * half},  {kSlot49, 7 * half + 1, half, 8 * half},
        {kSlot49, 0xFFFFFFFF, 3, 0x100000002}, {kSlot49, big, kMs, big + kMs},
        {kSlot49, 4 * wide, wide, 5 * wide},  {kSlot49, 4 * wide + 1, wide, 5 * wide},
        {kSlot49, 4 * wide - 1, wide, 4 * wide}, {kSlot49, 5, wide, wide},
        {kMicro, 3500000, 500000, 4000000},   {kMicro, 3500001, 500000, 4000000},
        {kMicro, 3499999, 500000, 3500000},   {kMicro, 5000000000, 1000, 5000001000},
        {kMicro, 5000000001, 1000, 5000001000},
    };
    for (const auto& c : rows) {
        SCOPED_TRACE(testing::Message() << c.kind << ": " << c.now << " / " << c.period);
        const uint64_t unit = c.kind == kMicro ? 1000 : 1;
        uint64_t r = 0;
        EXPECT_EQ(SleepsOf({c.now * unit, after}, [&] {
            if (c.kind == kClocks) r = quelta_iTSC_WaitUntilNextMultipleClocks_C(Low(c.period));
            if (c.kind == kSlot49) r = ToU64(WaitUntilNextMultipleClocks64Impl(FromU64(c.period)));
            if (c.kind == kMicro) r = quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(Low(c.period));
        }), Sleeps{Until(c.deadline * unit)});
        EXPECT_EQ(r, c.kind == kSlot49 ? after : c.kind == kClocks ? Low(after) : Low(Us(after)));
    }
}

// 64-bit targets not after now (high word 0xFFFFFFFF: before all) do not sleep; durations are 64-bit.
TEST_F(PlainWaitTest, Targets64BitAndDurations) {
    const uint64_t n = Join(1, 0x80000000u);
    for (uint64_t target : {n - 1000 * kMs, n, Join(0xFFFFFFFFu, 0x12345678u), n + 1}) {
        const ClockTime t = FromU64(target);
        EXPECT_EQ(SleepsOf({n}, [&] { quelta_iTSC_WaitUntilClocks64_C(&t); }), target == n + 1 ? Sleeps{Until(target)} : Sleeps{}) << target;
        EXPECT_EQ(engine.reads.load(), 2);
    }
    EXPECT_EQ(SleepsOf({n}, [] { quelta_iTSC_WaitMicroSeconds_C(4294968u); }), Sleeps{For(4294968000ull)});
    EXPECT_EQ(SleepsOf({n}, [] { quelta_iTSC_WaitClocks_C(0xFFFFFFFFu); }), Sleeps{For(0xFFFFFFFFull)});
}

// A 32-bit target just passed (within 1000 * gCpuSpeed clocks, or 1000 us whatever gCpuSpeed) returns at
// once with one read; further behind, it lies in the next 2^32 span; above the low word, in this one.
TEST_F(PlainWaitTest, Targets32BitLieInThisSpanOrTheNext) {
    const uint64_t n = Join(1, 0x80000000u), m = Join(3, 987654321u), u = Us(m);
    const uint32_t lu = Low(u), hu = static_cast<uint32_t>(u >> 32);
    const struct { bool micro; uint32_t speed; uint64_t now; uint32_t target; uint64_t deadline; } rows[] = {
        {false, 1000, n, Low(n), 0}, {false, 1000, n, Low(n) - 999999, 0}, {false, 2000, n, Low(n) - 1999999, 0},
        {false, 1000, n, Low(n) - 1000000, Join(2, Low(n) - 1000000)},  // 1 ms behind: the next span
        {false, 1000, n, Low(n) + 1, n + 1}, {false, 1000, Join(1, 0xFFFFFF00u), 5, Join(2, 5)},  // ahead; across the wrap
        {true, 5000, m, lu, 0}, {true, 5000, m, lu - 999, 0},
        {true, 5000, m, lu - 1000, Join(hu + 1, lu - 1000) * 1000}, {true, 5000, m, lu + 1, Join(hu, lu + 1) * 1000}};
    for (const auto& c : rows) {
        SCOPED_TRACE(testing::Message() << c.micro << " " << c.target);
        gCpuSpeed = c.speed;
        uint32_t r = 0;
        EXPECT_EQ(SleepsOf({c.now}, [&] { r = (c.micro ? quelta_iTSC_WaitUntilMicroSeconds_C : quelta_iTSC_WaitUntilClocks_C)(c.target); }),
                  c.deadline ? Sleeps{Until(c.deadline)} : Sleeps{});
        EXPECT_EQ(engine.reads.load(), c.deadline ? 2 : 1);
        if (!c.deadline) { EXPECT_EQ(r, c.micro ? lu : Low(c.now)); }
    }
}

// A sleep ended by a signal resumes: absolute on its deadline, relative on what is left.
TEST_F(PlainWaitTest, InterruptedSleepsResume) {
    gRemaining = 12345678, gInterruptions = 2;
    EXPECT_EQ(SleepsOf({0}, [] { quelta_iTSC_WaitClocks_C(40000000u); }), (Sleeps{For(40000000), For(12345678), For(12345678)}));
    const ClockTime t = FromU64(Join(9, 9));
    gInterruptions = 2;
    EXPECT_EQ(SleepsOf({Join(9, 1)}, [&] { quelta_iTSC_WaitUntilClocks64_C(&t); }), Sleeps(3, Until(Join(9, 9))));
}

// Speed 0 falls back to 1 and to 1,000,000 ticks per ms; the product is 32-bit.
TEST_F(PlainWaitTest, QueriesFallBackIndependently) {
    for (auto [speed, reported, perMs] : {std::tuple{0u, 1u, 1000000u}, {1000u, 1000u, 1000000u}, {5000000u, 5000000u, uint32_t(5000000000ull)}}) {
        gCpuSpeed = speed;
        EXPECT_EQ(std::tuple(quelta_iTSC_GetCPUSpeed_C(), quelta_iTSC_GetCPUTicksPerMS_C()), std::tuple(reported, perMs));
    }
}

TEST(PlainWaitWithoutEngine, WaitsOnTheKernelClock) {
    const uint64_t start = testsupport::MonoNowNs();
    quelta_iTSC_WaitMicroSeconds_C(5000);
    EXPECT_GE(testsupport::MonoNowNs(), start + 5 * kMs);
}

using QR = std::pair<uint64_t, uint64_t>;  // quotient, remainder
uint64_t Mul(uint64_t x, uint32_t m) { ClockTime v = FromU64(x); return U64MulU32(v, m), ToU64(v); }
QR Div(uint64_t n, uint64_t d) { ClockTime q = FromU64(n), r = FromU64(d); return U64DivMod(q, r), QR(ToU64(q), ToU64(r)); }

// The library's multiply and divide against the compiler's, on word boundaries, powers of two and their
// neighbours crossed, then random operands of random bit length (quotients of every size). Division by
// 0, or of a high word 0xFFFFFFFF by a divisor without one, gives 0 and the dividend back.
TEST(U64Arith, MatchesNativeArithmeticButForItsTwoRules) {
    std::vector<uint64_t> v = {0, 3, 10, 999999, 1000000000, 0xFFFFFFFEFFFFFFFF, 0xFFFFFFFF00000000, 0xFFFFFFFF00000001, ~0ull};
    for (int bit = 0; bit < 64; bit += 5) for (int delta : {-1, 0, 1}) v.push_back((uint64_t(1) << bit) + delta);
    std::mt19937_64 rng(20240611);
    auto random = [&rng] { const unsigned bits = rng() % 65; return bits == 64 ? rng() : rng() & ((uint64_t(1) << bits) - 1); };
    const size_t crossed = v.size() * v.size();
    for (size_t i = 0; i < crossed + 200000; ++i) {
        const uint64_t a = i < crossed ? v[i / v.size()] : random(), b = i < crossed ? v[i % v.size()] : random();
        const bool rule = b == 0 || ((a >> 32) == 0xFFFFFFFFu && (b >> 32) != 0xFFFFFFFFu);
        ASSERT_EQ(Mul(a, Low(b)), a * Low(b)) << std::hex << a << " * " << Low(b);  // modulo 2^64
        ASSERT_EQ(Div(a, b), rule ? QR(0, a) : QR(a / b, a % b)) << std::hex << a << " / " << b;
    }
}

}  // namespace
}  // namespace quelta
