// The plain waits and the clock-rate queries. The deadlines come from a
// scripted clock and are read off the sleep each wait asks the kernel for
// (the plain waits sleep through the engine's kernel-clock seam), so every
// 32-bit and 64-bit branch is checked exactly and without waiting; the real
// sleeps are checked on the test's CLOCK_MONOTONIC: never early, strictly,
// under a flood of signals; late only loosely.
#include <gtest/gtest.h>

#include <errno.h>
#include <signal.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <tuple>
#include <vector>

#include "TestSupport.h"
#include "engine/ClockWaits.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"

namespace quelta {
namespace {

constexpr uint64_t kMs = 1000000;  // clocks
constexpr uint64_t kLate = 250 * kMs;  // loose: lateness is measured in benchmarks

uint32_t Low(uint64_t t) { return static_cast<uint32_t>(t); }
uint64_t Now() { return testsupport::MonoNowNs(); }
uint64_t NextMultiple(uint64_t t, uint64_t p) { return (t / p + 1) * p; }
uint64_t Join(uint32_t high, uint32_t low) { return (uint64_t(high) << 32) | low; }

// Monotonic reads: the scripted times first, then the real clock; counted.
class ScriptedEngine : public tKPusTimingEngine {
public:
    void Script(std::vector<uint64_t> times) {
        script_ = std::move(times);
        reads_ = 0;
    }
    int Reads() const { return reads_.load(); }
    void ReadMonotonic4(ClockTime& out) override {
        const size_t read = static_cast<size_t>(reads_.fetch_add(1));
        if (read < script_.size()) return void(out = FromU64(script_[read]));
        tKPusTimingEngine::ReadMonotonic4(out);
    }

private:
    std::vector<uint64_t> script_;
    std::atomic<int> reads_{0};
};

// The sleeps a wait asks for, taken through the seam instead of the kernel:
// recorded and not slept. The first `interruptions` of them end with EINTR
// and report `remaining` still to sleep, as a signal would.
struct Sleep {
    int flags;
    uint64_t request;
    bool operator==(const Sleep& o) const { return flags == o.flags && request == o.request; }
};
void PrintTo(const Sleep& s, std::ostream* os) {
    *os << (s.flags == TIMER_ABSTIME ? "until " : "for ") << s.request;
}
std::vector<Sleep> gSleeps;
int gInterruptions = 0;
uint64_t gRemaining = 0;
int RecordSleep(clockid_t clock, int flags, const timespec* request, timespec* remaining) {
    EXPECT_EQ(clock, CLOCK_MONOTONIC);
    gSleeps.push_back({flags, JoinNanoseconds(*request)});
    if (gInterruptions == 0) return 0;
    --gInterruptions;
    if (remaining != nullptr) *remaining = SplitNanoseconds(gRemaining);
    return EINTR;
}
Sleep Until(uint64_t t) { return {TIMER_ABSTIME, t}; }
Sleep For(uint64_t d) { return {0, d}; }
using Sleeps = std::vector<Sleep>;

class PlainWaitTest : public ::testing::Test {
protected:
    void SetUp() override { gCpuSpeed = 1000, gEngine.store(&engine_); }
    void TearDown() override {
        gEngine.store(nullptr), gCpuSpeed = 0;
        gSystemClock.sleep = realSleep_;
        gInterruptions = 0;
    }
    // From here on the waits' sleeps are recorded, not slept.
    void RecordSleeps() {
        gSystemClock.sleep = &RecordSleep;
        gSleeps.clear();
    }
    // The sleeps the wait `fn` asks for when the clock reads `times`.
    template <typename Fn>
    Sleeps SleepsOf(std::vector<uint64_t> times, Fn fn) {
        gSleeps.clear();
        engine_.Script(std::move(times));
        fn();
        return gSleeps;
    }
    uint64_t Us(uint64_t clocks) { return ToU64(engine_.ClocksToMicroseconds64Fwd(FromU64(clocks))); }
    // Runs the wait and checks it ended at or after `deadline`, not grossly late.
    template <typename Fn>
    void ExpectEndsAtImpl(int line, uint64_t deadline, Fn wait) {
        SCOPED_TRACE(line);
        wait();
        const uint64_t end = Now();
        EXPECT_GE(end, deadline) << "early by " << (deadline - end);
        EXPECT_LT(end, deadline + kLate);
    }
    ScriptedEngine engine_;
    int (*const realSleep_)(clockid_t, int, const timespec*, timespec*) = gSystemClock.sleep;
};
#define ExpectEndsAt(...) ExpectEndsAtImpl(__LINE__, __VA_ARGS__)

// A zero duration, period or target is no wait at all: one clock read, the
// current time back, no sleep, also for a microsecond target of 0 while the
// current microsecond low word is itself small (below the past tolerance).
TEST_F(PlainWaitTest, ZeroArgumentsNeitherSleepNorReadTwice) {
    RecordSleeps();
    uint32_t (*const waits[])(uint32_t) = {
        quelta_iTSC_WaitClocks_C, quelta_iTSC_WaitUntilNextMultipleClocks_C,
        quelta_iTSC_WaitMicroSeconds_C, quelta_iTSC_WaitUntilMicroSeconds_C,
        quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C};
    for (uint64_t n : {Join(5, 123456789), (Join(1, 0) + 500) * 1000}) {
        for (int i = 0; i < 5; ++i) {
            uint32_t r = 0;
            EXPECT_EQ(SleepsOf({n}, [&] { r = waits[i](0); }), Sleeps{}) << i << " at " << n;
            EXPECT_EQ(r, i < 2 ? Low(n) : Low(Us(n))) << i;
            EXPECT_EQ(engine_.Reads(), 1) << i;
        }
    }
    ClockTime r{0, 0};
    EXPECT_EQ(SleepsOf({Join(5, 7)}, [&] { r = WaitUntilNextMultipleClocks64Impl(ClockTime{0, 0}); }), Sleeps{});
    EXPECT_EQ(ToU64(r), Join(5, 7));
    EXPECT_EQ(engine_.Reads(), 1);
}

// Every next-multiple wait sleeps until the first multiple of its period
// strictly later than the time of the call: called exactly on a multiple it
// waits one whole period. Each division path (32-bit while the high word is
// 0, 64-bit otherwise) and the carry into the high word; the result is the
// time read after the sleep.
TEST_F(PlainWaitTest, NextMultipleIsTheFirstMultipleStrictlyLater) {
    RecordSleeps();
    const uint64_t after = Join(77, 0x12345);
    const uint32_t half = 500000000u;  // 0.5 s
    const struct {
        uint64_t now;
        uint32_t period;
        uint64_t deadline;
    } clocks[] = {
        {7ull * half, half, 8ull * half},  // high word 0: exactly on a multiple
        {7ull * half + 1, half, 8ull * half},
        {7ull * half - 1, half, 7ull * half},
        {0xFFFFFFFFull, 3u, 0x100000002ull},                       // the product carries
        {5000000ull * kMs, 1000000u, 5000000ull * kMs + kMs},     // high word 1164
        {5000000ull * kMs + 1, 1000000u, 5000000ull * kMs + kMs},
        {Join(3, 0), 0x80000000u, Join(3, 0x80000000u)},
    };
    for (const auto& c : clocks) {
        SCOPED_TRACE(testing::Message() << c.now << " / " << c.period);
        uint32_t r = 0;
        EXPECT_EQ(SleepsOf({c.now, after}, [&] { r = quelta_iTSC_WaitUntilNextMultipleClocks_C(c.period); }),
                  Sleeps{Until(c.deadline)});
        EXPECT_EQ(r, Low(after));
    }

    // Engine slot 49: a 64-bit period, and a 64-bit time.
    const uint64_t wide = Join(3, 7);
    const struct {
        uint64_t now, period, deadline;
    } clocks64[] = {
        {7ull * half, half, 8ull * half},  // both high words 0: one 32-bit division
        {7ull * half + 1, half, 8ull * half},
        {0xFFFFFFFFull, 3, 0x100000002ull},
        {5000000ull * kMs, kMs, 5000000ull * kMs + kMs},
        {4 * wide, wide, 5 * wide},
        {4 * wide + 1, wide, 5 * wide},
        {4 * wide - 1, wide, 4 * wide},
        {5, wide, wide},
    };
    for (const auto& c : clocks64) {
        SCOPED_TRACE(testing::Message() << c.now << " / " << c.period);
        ClockTime r{0, 0};
        EXPECT_EQ(SleepsOf({c.now, after}, [&] { r = WaitUntilNextMultipleClocks64Impl(FromU64(c.period)); }),
                  Sleeps{Until(c.deadline)});
        EXPECT_EQ(ToU64(r), after);
    }

    // Microseconds: the time in microseconds (whole ones here), the deadline
    // back in clocks.
    const struct {
        uint64_t nowUs;
        uint32_t period;
        uint64_t deadlineUs;
    } micro[] = {
        {3500000, 500000, 4000000},  // high word 0: exactly on a multiple
        {3500001, 500000, 4000000},
        {3499999, 500000, 3500000},
        {5000000000ull, 1000, 5000001000ull},  // high word 1
        {5000000001ull, 1000, 5000001000ull},
    };
    for (const auto& c : micro) {
        SCOPED_TRACE(testing::Message() << c.nowUs << " us / " << c.period);
        uint32_t r = 0;
        EXPECT_EQ(SleepsOf({c.nowUs * 1000, after},
                           [&] { r = quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(c.period); }),
                  Sleeps{Until(c.deadlineUs * 1000)});
        EXPECT_EQ(r, Low(Us(after)));
    }
}

// Absolute 64-bit and 32-bit clock targets. A 32-bit target just passed
// (within 1000 * gCpuSpeed clocks) returns at once with one read; further
// behind, it lies in the next 2^32-clock span; above the current low word,
// in the current one.
TEST_F(PlainWaitTest, AbsoluteClockTargets) {
    RecordSleeps();
    const uint64_t n = Join(1, 0x80000000u);
    for (uint64_t target : {n - 1000 * kMs, n, Join(0xFFFFFFFFu, 0x12345678u)}) {
        const ClockTime t = FromU64(target);
        EXPECT_EQ(SleepsOf({n}, [&] { quelta_iTSC_WaitUntilClocks64_C(&t); }), Sleeps{}) << target;
        EXPECT_EQ(engine_.Reads(), 2);
    }
    const ClockTime later = FromU64(n + 1);
    EXPECT_EQ(SleepsOf({n}, [&] { quelta_iTSC_WaitUntilClocks64_C(&later); }), Sleeps{Until(n + 1)});

    for (auto [speed, behind] : {std::pair{1000u, 0u}, {1000u, 999999u}, {2000u, 1999999u}}) {
        gCpuSpeed = speed;
        uint32_t r = 0;
        EXPECT_EQ(SleepsOf({n}, [&] { r = quelta_iTSC_WaitUntilClocks_C(Low(n) - behind); }), Sleeps{}) << behind;
        EXPECT_EQ(r, Low(n));
        EXPECT_EQ(engine_.Reads(), 1);
    }
    gCpuSpeed = 1000;
    const struct {
        uint64_t now;
        uint32_t target;
        uint64_t deadline;
    } spans[] = {
        {n, Low(n) - 1000000u, Join(2, Low(n) - 1000000u)},  // 1 ms behind: the next span
        {n, Low(n) + 1, n + 1},                              // ahead: this span
        {Join(1, 0xFFFFFF00u), 5, Join(2, 5)},               // across the wrap
    };
    for (const auto& c : spans) {
        SCOPED_TRACE(c.target);
        EXPECT_EQ(SleepsOf({c.now}, [&] { quelta_iTSC_WaitUntilClocks_C(c.target); }), Sleeps{Until(c.deadline)});
        EXPECT_EQ(engine_.Reads(), 2);
    }
}

// The microsecond waits: past tolerance 1000 us whatever gCpuSpeed; the next
// 2^32-us span beyond it; a duration multiplied in 64 bits.
TEST_F(PlainWaitTest, MicrosecondTargetsAndDurations) {
    RecordSleeps();
    gCpuSpeed = 5000;
    const uint64_t n = Join(3, 987654321u);
    const uint64_t u = Us(n);
    const uint32_t low = Low(u), high = static_cast<uint32_t>(u >> 32);
    for (uint32_t behind : {0u, 999u}) {
        uint32_t r = 0;
        EXPECT_EQ(SleepsOf({n}, [&] { r = quelta_iTSC_WaitUntilMicroSeconds_C(low - behind); }), Sleeps{}) << behind;
        EXPECT_EQ(r, low);
        EXPECT_EQ(engine_.Reads(), 1);
    }
    EXPECT_EQ(SleepsOf({n}, [&] { quelta_iTSC_WaitUntilMicroSeconds_C(low - 1000u); }),
              Sleeps{Until(Join(high + 1, low - 1000u) * 1000)});
    EXPECT_EQ(SleepsOf({n}, [&] { quelta_iTSC_WaitUntilMicroSeconds_C(low + 1); }),
              Sleeps{Until(Join(high, low + 1) * 1000)});
    // 4,294,968 us is 4,294,968,000 clocks, not that product cut to 32 bits.
    EXPECT_EQ(SleepsOf({n}, [] { quelta_iTSC_WaitMicroSeconds_C(4294968u); }), Sleeps{For(4294968000ull)});
    EXPECT_EQ(SleepsOf({n}, [] { quelta_iTSC_WaitClocks_C(0xFFFFFFFFu); }), Sleeps{For(0xFFFFFFFFull)});
}

// A signal ends the sleep with EINTR: an absolute sleep is asked for again
// with the same deadline, a relative one with what the kernel reports left.
TEST_F(PlainWaitTest, InterruptedSleepsResume) {
    RecordSleeps();
    gRemaining = 12345678;
    gInterruptions = 2;
    EXPECT_EQ(SleepsOf({0}, [] { quelta_iTSC_WaitClocks_C(40000000u); }),
              (Sleeps{For(40000000), For(12345678), For(12345678)}));
    gInterruptions = 2;
    const ClockTime t = FromU64(Join(9, 9));
    EXPECT_EQ(SleepsOf({Join(9, 1)}, [&] { quelta_iTSC_WaitUntilClocks64_C(&t); }),
              (Sleeps{Until(Join(9, 9)), Until(Join(9, 9)), Until(Join(9, 9))}));
}

std::atomic<int> gSignals{0};

// Every wait under a flood of SIGUSR1 (every 0.5 ms, handler without
// SA_RESTART) to the waiting thread: absolute sleeps must restart on the same
// deadline, relative ones on what is left, and none may end early.
TEST_F(PlainWaitTest, WaitsAreNeverEarlyEvenUnderASignalFlood) {
    struct sigaction action {}, old{};
    action.sa_handler = [](int) { gSignals.fetch_add(1); };
    sigemptyset(&action.sa_mask);
    sigaction(SIGUSR1, &action, &old);
    // Whole seconds in a relative wait, before the flood: every interruption
    // of a relative sleep costs its handling time on top.
    ExpectEndsAt(Now() + 1000 * kMs + 5, [&] { return quelta_iTSC_WaitClocks_C(1000000005u); });
    std::atomic<bool> stop{false};
    const pthread_t self = pthread_self();
    std::thread flood([&] {
        while (!stop) {
            pthread_kill(self, SIGUSR1);
            std::this_thread::sleep_for(std::chrono::microseconds(500));
        }
    });
    const uint64_t d = 40 * kMs;
    ExpectEndsAt(Now() + d, [&] { return quelta_iTSC_WaitClocks_C(Low(d)); });
    ExpectEndsAt(Now() + d, [] { return quelta_iTSC_WaitMicroSeconds_C(40000); });
    const ClockTime t64 = FromU64(Now() + d);
    ExpectEndsAt(ToU64(t64), [&] { return quelta_iTSC_WaitUntilClocks64_C(&t64); });
    const uint64_t t32 = Now() + d;  // across the low word's wrap, should it fall here
    ExpectEndsAt(t32, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(t32)); });
    const uint64_t tUs = Us(Now()) + 40000;
    ExpectEndsAt(tUs * 1000, [&] { return quelta_iTSC_WaitUntilMicroSeconds_C(Low(tUs)); });
    // Next multiples: the first one strictly after the call.
    for (uint32_t period : {10u * 1000000u, 7777777u}) {
        const uint64_t first = NextMultiple(Now(), period);
        ExpectEndsAt(first, [&] { return quelta_iTSC_WaitUntilNextMultipleClocks_C(period); });
        const uint64_t firstUs = NextMultiple(Us(Now()), period / 1000);
        ExpectEndsAt(firstUs * 1000,
                     [&] { return quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(period / 1000); });
    }
    stop = true;
    flood.join();
    sigaction(SIGUSR1, &old, nullptr);
    EXPECT_GT(gSignals.load(), 0);  // few under a sanitizer, which defers signals
}

TEST_F(PlainWaitTest, QueriesFallBackIndependently) {
    // Speed 0 falls back to 1 and to 1,000,000 ticks; the product is 32-bit.
    for (auto [speed, reported, perMs] : {std::tuple{0u, 1u, 1000000u}, {1000u, 1000u, 1000000u},
                                          {5000000u, 5000000u, uint32_t(5000000000ull)}}) {
        gCpuSpeed = speed;
        EXPECT_EQ(quelta_iTSC_GetCPUSpeed_C(), reported);
        EXPECT_EQ(quelta_iTSC_GetCPUTicksPerMS_C(), perMs);
    }
}

TEST(PlainWaitWithoutEngine, WaitsOnTheKernelClock) {
    ASSERT_EQ(gEngine.load(), nullptr);
    const uint64_t start = Now();
    quelta_iTSC_WaitMicroSeconds_C(5000);
    EXPECT_GE(Now(), start + 5 * kMs);
}

}  // namespace
}  // namespace quelta
