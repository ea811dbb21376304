// The plain waits (clocks and microseconds) and the clock-rate queries.
//
// Waits are checked against CLOCK_MONOTONIC read by the test itself: never
// early, strictly; late only loosely, since this runs on a noisy machine.
// The 32-bit decisions (target just passed, or in the next 2^32 span) are
// driven by an engine whose first clock read is scripted, with the scripted
// time chosen so that the deadline the wait must compute lies a few tens of
// milliseconds ahead on the real clock. A wrong decision then shows as a wait
// that is early, or that does not sleep at all.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "engine/ClockWaits.h"
#include "engine/LibraryFrame.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"

namespace quelta {
namespace {

constexpr uint64_t kMs = 1000000;          // clocks per millisecond
constexpr uint64_t kLate = 50 * kMs;       // loose lateness bound
constexpr uint64_t kSpan = uint64_t(1) << 32;

uint32_t Low(uint64_t t) { return static_cast<uint32_t>(t); }
uint32_t High(uint64_t t) { return static_cast<uint32_t>(t >> 32); }
uint64_t Now() { return testsupport::MonoNowNs(); }

// An engine whose monotonic reads first return scripted times, then the real
// clock. Counts the reads, so a test can tell whether a wait took its sleeping
// path (two reads) or returned at once (one).
class ScriptedEngine : public tKPusTimingEngine {
public:
    void Script(std::vector<uint64_t> times) {
        script_ = std::move(times);
        next_ = 0;
        reads_ = 0;
    }
    int Reads() const { return reads_.load(); }
    void ReadMonotonic4(ClockTime& out) override {
        reads_.fetch_add(1);
        const size_t i = next_.load();
        if (i < script_.size()) {
            next_ = i + 1;
            out = FromU64(script_[i]);
            return;
        }
        tKPusTimingEngine::ReadMonotonic4(out);
    }

private:
    std::vector<uint64_t> script_;
    std::atomic<size_t> next_{0};
    std::atomic<int> reads_{0};
};

class PlainWaitTest : public ::testing::Test {
protected:
    void SetUp() override {
        savedSpeed_ = gCpuSpeed.load();
        gCpuSpeed = 1000;
        gEngine.store(&engine_);
    }
    void TearDown() override {
        gEngine.store(nullptr);
        gCpuSpeed = savedSpeed_;
    }
    uint64_t Us(uint64_t clocks) { return ToU64(engine_.ClocksToMicroseconds64Fwd(FromU64(clocks))); }
    // A clock value that the engine converts to exactly `us` microseconds
    // (its conversion is a rounded approximation, monotonic, in steps of 1).
    uint64_t ClocksFor(uint64_t us) {
        for (uint64_t c = us * 1000 - 2000; c < us * 1000 + 2000; ++c) {
            if (Us(c) == us) return c;
        }
        ADD_FAILURE() << "no clock value converts to " << us;
        return us * 1000;
    }

    // Runs wait() and checks that it ended at or after `deadline` (never
    // early) and not grossly late; returns the wait's result.
    template <typename Fn>
    uint32_t ExpectEndsAt(uint64_t deadline, Fn wait) {
        const uint32_t result = wait();
        const uint64_t end = Now();
        EXPECT_GE(end, deadline) << "early by " << (deadline - end) << " clocks";
        EXPECT_LT(end, deadline + kLate);
        return result;
    }

    ScriptedEngine engine_;
    uint32_t savedSpeed_ = 0;
};

// The result is the low word of a time read after the wait: between the
// test's readings before and after, modulo 2^32.
void ExpectLowWordBetween(uint32_t result, uint64_t before, uint64_t after) {
    EXPECT_LE(static_cast<uint32_t>(result - Low(before)), static_cast<uint32_t>(after - before));
}

// Runs fn in a child process and tells whether the child is still inside it
// 300 ms later (then kills it): for waits far too long to sit through.
template <typename Fn>
bool SleepsInChild(Fn fn) {
    const pid_t child = fork();
    if (child < 0) {
        ADD_FAILURE() << "fork failed";
        return false;
    }
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

// ---------------------------------------------------------------- clocks ---

TEST_F(PlainWaitTest, ZeroArgumentsReturnTheCurrentTimeWithoutSleeping) {
    engine_.Script({});
    uint64_t before = Now();
    uint32_t result = quelta_iTSC_WaitClocks_C(0);
    ExpectLowWordBetween(result, before, Now());
    EXPECT_EQ(engine_.Reads(), 1);

    engine_.Script({});
    before = Now();
    result = quelta_iTSC_WaitUntilNextMultipleClocks_C(0);
    ExpectLowWordBetween(result, before, Now());
    EXPECT_EQ(engine_.Reads(), 1);

    engine_.Script({});
    before = Now();
    const ClockTime zero{0, 0};
    const ClockTime after = WaitUntilNextMultipleClocks64Impl(zero);
    const uint64_t end = Now();
    EXPECT_GE(ToU64(after), before);
    EXPECT_LE(ToU64(after), end);
    EXPECT_EQ(engine_.Reads(), 1);
}

TEST_F(PlainWaitTest, RelativeClockWaitIsNeverEarly) {
    for (uint32_t duration : {1u, 20u * 1000000u, 1000000000u + 5u}) {
        engine_.Script({});
        const uint64_t start = Now();
        const uint32_t result =
            ExpectEndsAt(start + duration, [&] { return quelta_iTSC_WaitClocks_C(duration); });
        ExpectLowWordBetween(result, start + duration, Now());
    }
}

TEST_F(PlainWaitTest, AbsoluteClockWaitsReachTheirTarget) {
    engine_.Script({});
    const uint64_t target = Now() + 20 * kMs;
    const ClockTime t64 = FromU64(target);
    uint32_t result = ExpectEndsAt(target, [&] { return quelta_iTSC_WaitUntilClocks64_C(&t64); });
    ExpectLowWordBetween(result, target, Now());

    // A 32-bit target a little ahead waits only the difference (across the
    // wrap of the low word too, should it fall in between).
    const uint64_t target32 = Now() + 20 * kMs;
    result = ExpectEndsAt(target32, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(target32)); });
    ExpectLowWordBetween(result, target32, Now());
}

TEST_F(PlainWaitTest, SixtyFourBitTargetsNotLaterDoNotSleep) {
    const uint64_t now = Now();
    for (uint64_t target : {now - 1000 * kMs, now, (uint64_t(0xFFFFFFFFu) << 32) | 0x12345678u,
                            uint64_t(0xFFFFFFFFFFFFFFFFull)}) {
        engine_.Script({now});
        const ClockTime t = FromU64(target);
        const uint64_t start = Now();
        quelta_iTSC_WaitUntilClocks64_C(&t);
        EXPECT_LT(Now() - start, kLate) << std::hex << target;
        EXPECT_EQ(engine_.Reads(), 2);
    }
}

TEST_F(PlainWaitTest, ThirtyTwoBitTargetJustPassedReturnsAtOnce) {
    const uint64_t n = (uint64_t(1) << 32) | 0x80000000u;
    for (uint32_t behind : {0u, 1u, 999999u}) {
        engine_.Script({n});
        EXPECT_EQ(quelta_iTSC_WaitUntilClocks_C(Low(n) - behind), Low(n)) << behind;
        EXPECT_EQ(engine_.Reads(), 1) << behind;  // no sleep, no second read
    }
    // The tolerance is 1000 * gCpuSpeed clocks.
    gCpuSpeed = 2000;
    engine_.Script({n});
    EXPECT_EQ(quelta_iTSC_WaitUntilClocks_C(Low(n) - 1999999u), Low(n));
    EXPECT_EQ(engine_.Reads(), 1);
    gCpuSpeed = 0;  // before start-up: no tolerance at all
    engine_.Script({n});
    quelta_iTSC_WaitUntilClocks_C(Low(n));  // next span of a long-past time: no real sleep
    EXPECT_EQ(engine_.Reads(), 2);
}

TEST_F(PlainWaitTest, ThirtyTwoBitTargetFurtherBehindWaitsForTheNextSpan) {
    // The deadline the wait must find: R, 30 ms ahead. Seen from a clock one
    // span earlier whose low word is 1,000,000 (or far more) past R's, the
    // target lies in the next span, which is R itself.
    for (uint32_t behind : {1000000u, 0x40000000u}) {
        const uint64_t r = Now() + 30 * kMs;
        if (Low(r) > 0xFFFFFFFFu - behind) continue;  // would wrap the scripted low word
        engine_.Script({(uint64_t(High(r) - 1) << 32) | (Low(r) + behind)});
        ExpectEndsAt(r, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(r)); });
        EXPECT_EQ(engine_.Reads(), 2);
    }
    // A clock just before the wrap of its low word and a small-looking target.
    const uint64_t r = Now() + 30 * kMs;
    if (Low(r) < 0xFFFFFF00u - 1000000u) {
        engine_.Script({(uint64_t(High(r) - 1) << 32) | 0xFFFFFF00u});
        ExpectEndsAt(r, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(r)); });
    }
    // A target above the current low word stays in the current span.
    const uint64_t r2 = Now() + 30 * kMs;
    if (Low(r2) > 5000000u) {
        engine_.Script({r2 - 5000000u});
        ExpectEndsAt(r2, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(r2)); });
    }
}

// First multiple of p strictly after t.
uint64_t NextMultiple(uint64_t t, uint64_t p) { return (t / p + 1) * p; }

TEST_F(PlainWaitTest, NextMultipleLandsOnAMultipleStrictlyLater) {
    for (uint32_t period : {10u * 1000000u, 7777777u, 3u}) {
        engine_.Script({});
        const uint64_t start = Now();
        const uint64_t first = NextMultiple(start, period);
        const uint32_t result = quelta_iTSC_WaitUntilNextMultipleClocks_C(period);
        const uint64_t end = Now();
        EXPECT_GE(end, first) << period;
        EXPECT_LT(end, first + period + kLate) << period;
        ExpectLowWordBetween(result, first, end);
    }
    // Called exactly on a multiple (scripted), the deadline is one whole
    // period later; with a clock whose high word is 0 the division is 32-bit.
    // Both deadlines lie in the real past here, so only the path is seen.
    engine_.Script({uint64_t(40) * 1000000u});
    quelta_iTSC_WaitUntilNextMultipleClocks_C(1000000u);
    EXPECT_EQ(engine_.Reads(), 2);
}

// A 64-bit period P (high word non-zero) with a multiple R a little ahead:
// P = T / k for T 30 ms ahead and k = T / 2^32, so R = k * P lies within k
// clocks below T and the previous multiple more than 4 s back.
TEST_F(PlainWaitTest, SixtyFourBitNextMultipleUsesTheWideDivision) {
    engine_.Script({});
    const uint64_t t = Now() + 30 * kMs;
    const uint64_t k = t / kSpan;
    ASSERT_GE(k, 1u) << "needs a clock more than 4.3 s past its zero";
    const uint64_t period = t / k;
    ASSERT_NE(High(period), 0u);
    const uint64_t r = k * period;
    ASSERT_GT(r, Now());
    const ClockTime p = FromU64(period);
    const ClockTime after = WaitUntilNextMultipleClocks64Impl(p);
    const uint64_t end = Now();
    EXPECT_GE(end, r);
    EXPECT_LT(end, r + kLate);
    EXPECT_GE(ToU64(after), r);
    EXPECT_LE(ToU64(after), end);

    // The same period through the 32-bit-period wait is impossible; its own
    // wide-division path is the one taken whenever the clock's high word is
    // not 0, as on any machine up for more than 4.3 s.
    engine_.Script({});
    const uint64_t start = Now();
    ASSERT_NE(High(start), 0u);
    const uint64_t first = NextMultiple(start, 50 * kMs);
    quelta_iTSC_WaitUntilNextMultipleClocks_C(50 * kMs);
    EXPECT_GE(Now(), first);

    // A 64-bit period whose high words are both 0 divides in 32 bits.
    engine_.Script({uint64_t(123456789)});
    const ClockTime small{1000u, 0u};
    WaitUntilNextMultipleClocks64Impl(small);
    EXPECT_EQ(engine_.Reads(), 2);
}

// ---------------------------------------------------------- microseconds ---

TEST_F(PlainWaitTest, MicrosecondQueriesFallBackIndependently) {
    gCpuSpeed = 0;
    EXPECT_EQ(quelta_iTSC_GetCPUSpeed_C(), 1u);
    EXPECT_EQ(quelta_iTSC_GetCPUTicksPerMS_C(), 1000000u);
    gCpuSpeed = 1000;
    EXPECT_EQ(quelta_iTSC_GetCPUSpeed_C(), 1000u);
    EXPECT_EQ(quelta_iTSC_GetCPUTicksPerMS_C(), 1000000u);
    gCpuSpeed = 5000000;  // the product is 32-bit
    EXPECT_EQ(quelta_iTSC_GetCPUSpeed_C(), 5000000u);
    EXPECT_EQ(quelta_iTSC_GetCPUTicksPerMS_C(), static_cast<uint32_t>(5000000000ull));
}

TEST_F(PlainWaitTest, MicrosecondWaitsWithZeroDoNotSleep) {
    for (int which = 0; which < 3; ++which) {
        engine_.Script({});
        const uint64_t before = Now();
        uint32_t result = 0;
        if (which == 0) result = quelta_iTSC_WaitMicroSeconds_C(0);
        if (which == 1) result = quelta_iTSC_WaitUntilMicroSeconds_C(0);
        if (which == 2) result = quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(0);
        const uint64_t after = Now();
        EXPECT_EQ(engine_.Reads(), 1) << which;
        EXPECT_LE(static_cast<uint32_t>(result - Low(Us(before))),
                  static_cast<uint32_t>(Us(after) - Us(before)))
            << which;
    }
    // A target of 0 means "do not wait" even when the current low word is
    // itself small (so 0 lies just behind it).
    engine_.Script({uint64_t(500) * 1000});
    EXPECT_EQ(quelta_iTSC_WaitUntilMicroSeconds_C(0), 500u);
    EXPECT_EQ(engine_.Reads(), 1);
}

TEST_F(PlainWaitTest, MicrosecondWaitsAreNeverEarly) {
    engine_.Script({});
    uint64_t start = Now();
    uint32_t result = ExpectEndsAt(start + 20 * kMs, [] { return quelta_iTSC_WaitMicroSeconds_C(20000); });
    EXPECT_LE(static_cast<uint32_t>(result - Low(Us(start + 20 * kMs))), 100000u);

    const uint64_t targetUs = Us(Now()) + 20000;
    result = ExpectEndsAt(targetUs * 1000,
                          [&] { return quelta_iTSC_WaitUntilMicroSeconds_C(Low(targetUs)); });
    EXPECT_LE(static_cast<uint32_t>(result - Low(targetUs)), 100000u);

    for (uint32_t period : {20000u, 7777u}) {
        start = Now();
        const uint64_t firstUs = NextMultiple(Us(start), period);
        result = quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(period);
        const uint64_t end = Now();
        EXPECT_GE(end, firstUs * 1000) << period;
        EXPECT_LT(end, (firstUs + period) * 1000 + kLate) << period;
        EXPECT_LE(static_cast<uint32_t>(result - Low(firstUs)), 100000u + period);
    }
}

TEST_F(PlainWaitTest, MicrosecondTargetJustPassedOrInTheNextSpan) {
    const uint64_t n = (uint64_t(3) << 32) + 987654321u;
    const uint32_t nowUs = Low(Us(n));
    for (uint32_t behind : {0u, 999u}) {
        engine_.Script({n});
        EXPECT_EQ(quelta_iTSC_WaitUntilMicroSeconds_C(nowUs - behind), nowUs) << behind;
        EXPECT_EQ(engine_.Reads(), 1) << behind;
    }
    // 1000 us or more behind, whatever gCpuSpeed says: the target is taken in
    // the next 2^32-us span, about 71.6 minutes ahead. Seen from a child
    // process that is still asleep a while later.
    for (uint32_t speed : {1000u, 5000u}) {
        gCpuSpeed = speed;
        engine_.Script({});
        const uint32_t target = Low(Us(Now())) - 1000u;
        EXPECT_TRUE(SleepsInChild([target] { quelta_iTSC_WaitUntilMicroSeconds_C(target); }))
            << speed;
    }
    gCpuSpeed = 1000;

    // Where the clock allows it (more than one 2^32-us span since its zero),
    // scripted one span earlier so that the next span is 30 ms ahead: the wait
    // must end exactly there.
    for (uint32_t behind : {1000u, 5000u}) {
        const uint64_t wUs = Us(Now()) + 30000;
        if (High(wUs) == 0) break;  // the span before lies before the clock's zero
        if (Low(wUs) >= 0xFFFFFFFFu - behind) continue;  // would wrap the scripted low word
        const uint64_t seenUs = (uint64_t(High(wUs) - 1) << 32) | (Low(wUs) + behind);
        engine_.Script({ClocksFor(seenUs)});
        ExpectEndsAt(wUs * 1000, [&] { return quelta_iTSC_WaitUntilMicroSeconds_C(Low(wUs)); });
        EXPECT_EQ(engine_.Reads(), 2);
    }
}

// A wrapping 32-bit product of 4,294,968 us would be 704 clocks; the wait
// must last the full 4.29 s.
TEST_F(PlainWaitTest, LongMicrosecondWaitDoesNotWrapAt32Bits) {
    EXPECT_TRUE(SleepsInChild([] { quelta_iTSC_WaitMicroSeconds_C(4294968u); }));
}

// ---------------------------------------------------------------- signals ---

std::atomic<int> gSignals{0};

// A thread that keeps sending SIGUSR1 (handler installed, no SA_RESTART) to
// a waiting thread, so that every sleep of the wait is interrupted many times.
class SignalFlood {
public:
    explicit SignalFlood(pthread_t target) : target_(target) {
        struct sigaction action {};
        action.sa_handler = [](int) { gSignals.fetch_add(1, std::memory_order_relaxed); };
        sigemptyset(&action.sa_mask);
        action.sa_flags = 0;
        sigaction(SIGUSR1, &action, &old_);
        gSignals = 0;
        sender_ = std::thread([this] {
            while (!stop_.load()) {
                pthread_kill(target_, SIGUSR1);
                std::this_thread::sleep_for(std::chrono::microseconds(500));
            }
        });
    }
    ~SignalFlood() {
        stop_ = true;
        sender_.join();
        sigaction(SIGUSR1, &old_, nullptr);
    }

private:
    pthread_t target_;
    std::atomic<bool> stop_{false};
    std::thread sender_;
    struct sigaction old_ {};
};

TEST_F(PlainWaitTest, SignalFloodDoesNotShortenAnyWait) {
    engine_.Script({});
    const pthread_t self = pthread_self();
    SignalFlood flood(self);
    const uint64_t d = 60 * kMs;

    uint64_t start = Now();
    ExpectEndsAt(start + d, [&] { return quelta_iTSC_WaitClocks_C(static_cast<uint32_t>(d)); });
    start = Now();
    ExpectEndsAt(start + d, [] { return quelta_iTSC_WaitMicroSeconds_C(60000); });
    const ClockTime t64 = FromU64(Now() + d);
    ExpectEndsAt(ToU64(t64), [&] { return quelta_iTSC_WaitUntilClocks64_C(&t64); });
    const uint64_t t32 = Now() + d;
    ExpectEndsAt(t32, [&] { return quelta_iTSC_WaitUntilClocks_C(Low(t32)); });
    const uint64_t tUs = Us(Now()) + 60000;
    ExpectEndsAt(tUs * 1000, [&] { return quelta_iTSC_WaitUntilMicroSeconds_C(Low(tUs)); });
    start = Now();
    const uint64_t multiple = NextMultiple(start, d);
    quelta_iTSC_WaitUntilNextMultipleClocks_C(static_cast<uint32_t>(d));
    EXPECT_GE(Now(), multiple);
    EXPECT_GT(gSignals.load(), 20);  // the sleeps really were interrupted
}

// Without an engine (a failed start) the waits still wait on the kernel clock.
TEST(PlainWaitWithoutEngine, WaitsStillWork) {
    ASSERT_EQ(gEngine.load(), nullptr);
    uint64_t start = testsupport::MonoNowNs();
    quelta_iTSC_WaitClocks_C(5 * kMs);
    EXPECT_GE(testsupport::MonoNowNs(), start + 5 * kMs);
    start = testsupport::MonoNowNs();
    const uint32_t us = quelta_iTSC_WaitMicroSeconds_C(5000);
    const uint64_t end = testsupport::MonoNowNs();
    EXPECT_GE(end, start + 5 * kMs);
    EXPECT_LE(static_cast<uint32_t>(Low(end / 1000) - us), 1000u);
}

}  // namespace
}  // namespace quelta
