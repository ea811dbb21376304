// The plain waits and the clock-rate queries. Waits are checked on the test's
// CLOCK_MONOTONIC: never early, strictly; late only loosely. The 32-bit
// decisions come from a scripted first clock read that puts the right deadline
// just ahead on the real clock, so a wrong one ends early or does not sleep.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <tuple>
#include <vector>

#include "TestSupport.h"
#include "engine/ClockWaits.h"
#include "engine/LibraryFrame.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"

namespace quelta {
namespace {

constexpr uint64_t kMs = 1000000;  // clocks
constexpr uint64_t kLate = 250 * kMs;  // loose: a wrong decision is off by seconds

uint32_t Low(uint64_t t) { return static_cast<uint32_t>(t); }
uint32_t High(uint64_t t) { return static_cast<uint32_t>(t >> 32); }
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

// Runs fn in a child process; true when it is still inside 300 ms later.
template <typename Fn>
bool SleepsInChild(Fn fn) {
    const pid_t child = fork();
    if (child == 0) {
        fn();
        _exit(0);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    int status = 0;
    const bool sleeping = waitpid(child, &status, WNOHANG) == 0;
    kill(child, SIGKILL);
    waitpid(child, &status, 0);
    return sleeping;
}

class PlainWaitTest : public ::testing::Test {
protected:
    void SetUp() override { gCpuSpeed = 1000, gEngine.store(&engine_); }
    void TearDown() override { gEngine.store(nullptr), gCpuSpeed = 0; }
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
};
#define ExpectEndsAt(...) ExpectEndsAtImpl(__LINE__, __VA_ARGS__)

TEST_F(PlainWaitTest, ZeroArgumentsReadOnceAndReturnTheCurrentTime) {
    uint32_t (*const waits[])(uint32_t) = {
        quelta_iTSC_WaitClocks_C, quelta_iTSC_WaitUntilNextMultipleClocks_C,
        quelta_iTSC_WaitMicroSeconds_C, quelta_iTSC_WaitUntilMicroSeconds_C,
        quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C};
    const uint64_t n = Join(5, 123456789);
    for (int i = 0; i < 5; ++i) {
        engine_.Script({n});
        EXPECT_EQ(waits[i](0), i < 2 ? Low(n) : Low(Us(n))) << i;
        EXPECT_EQ(engine_.Reads(), 1) << i;
    }
    engine_.Script({n});
    const ClockTime zero{0, 0};
    EXPECT_EQ(ToU64(WaitUntilNextMultipleClocks64Impl(zero)), n);
    EXPECT_EQ(engine_.Reads(), 1);
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

TEST_F(PlainWaitTest, SixtyFourBitTargetNotLaterDoesNotSleep) {
    const uint64_t n = Now();
    for (uint64_t target : {n - 1000 * kMs, n, Join(0xFFFFFFFFu, 0x12345678u)}) {
        engine_.Script({n});
        const ClockTime t = FromU64(target);
        ExpectEndsAt(n, [&] { return quelta_iTSC_WaitUntilClocks64_C(&t); });
        EXPECT_EQ(engine_.Reads(), 2);
    }
}

TEST_F(PlainWaitTest, ThirtyTwoBitClockTargets) {
    // Just passed (within 1 ms, 1000 * gCpuSpeed clocks): at once, one read.
    const uint64_t n = Join(1, 0x80000000u);
    for (auto [speed, behind] : {std::pair{1000u, 0u}, {1000u, 999999u}, {2000u, 1999999u}}) {
        gCpuSpeed = speed;
        engine_.Script({n});
        EXPECT_EQ(quelta_iTSC_WaitUntilClocks_C(Low(n) - behind), Low(n)) << behind;
        EXPECT_EQ(engine_.Reads(), 1);
    }
    gCpuSpeed = 1000;

    // Further behind: the next span. Seen from one span before R (30 ms
    // ahead), with the low word 1,000,000 or more past R's or just below the
    // wrap, the deadline must be R itself; a target above the current low
    // word stays in the current span.
    uint64_t r = Now() + 30 * kMs;
    if (Low(r) >= 0xF0000000u) {  // right at the wrap: wait until it has passed
        std::this_thread::sleep_for(std::chrono::milliseconds(300));
        r = Now() + 30 * kMs;
    }
    for (uint64_t seen : {Join(High(r) - 1, Low(r) + 1000000u), Join(High(r) - 1, 0xFFFFFF00u),
                          r - 5 * kMs}) {
        engine_.Script({seen});
        ExpectEndsAt(r, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(r)); });
        EXPECT_EQ(engine_.Reads(), 2);
    }
}

TEST_F(PlainWaitTest, ThirtyTwoBitMicrosecondTargets) {
    const uint64_t n = Join(3, 987654321u);
    const uint32_t nowUs = Low(Us(n));
    for (uint32_t behind : {0u, 999u}) {
        engine_.Script({n});
        EXPECT_EQ(quelta_iTSC_WaitUntilMicroSeconds_C(nowUs - behind), nowUs);
        EXPECT_EQ(engine_.Reads(), 1);
    }
    // 1000 us behind, whatever gCpuSpeed: the next 2^32-us span, 71.6 min on.
    gCpuSpeed = 5000;
    const uint32_t target = Low(Us(Now())) - 1000u;
    EXPECT_TRUE(SleepsInChild([target] { quelta_iTSC_WaitUntilMicroSeconds_C(target); }));
    // The duration is multiplied in 64 bits: 4,294,968 us is not 704 clocks.
    EXPECT_TRUE(SleepsInChild([] { quelta_iTSC_WaitMicroSeconds_C(4294968u); }));
}

TEST_F(PlainWaitTest, NextMultipleWithWideOperands) {
    // Clock high word 0: 32-bit division (the deadline lies in the past).
    engine_.Script({40 * kMs});
    quelta_iTSC_WaitUntilNextMultipleClocks_C(1000000u);
    EXPECT_EQ(engine_.Reads(), 2);
    // A 64-bit period with a multiple R just ahead: P = T / k for T 30 ms
    // ahead and k = T / 2^32; R = k * P lies less than k clocks below T.
    const uint64_t t = Now() + 30 * kMs;
    const uint64_t k = t >> 32;
    ASSERT_GE(k, 1u) << "needs a clock more than 4.3 s past its zero";
    const ClockTime period = FromU64(t / k);
    const uint64_t r = k * ToU64(period);
    ClockTime after{0, 0};
    ExpectEndsAt(r, [&] { return after = WaitUntilNextMultipleClocks64Impl(period), 0u; });
    EXPECT_GE(ToU64(after), r);
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
