// The one test that touches the machine's real clock discipline: the engine
// sets the kernel clock's current rate back to itself and steps the wall
// clock by zero. Needs CAP_SYS_TIME; skipped without it. Whatever happens,
// tick and freq are restored to the values found at the start.
#include <gtest/gtest.h>
#include <sys/timex.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>

#include "TestSupport.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"

using quelta::tKPusTimingEngine;

namespace {

// Saves tick and freq on construction and writes them back on destruction,
// also when an assertion ends the test early.
class KernelRateGuard {
public:
    KernelRateGuard() {
        struct timex tx {};
        readOk_ = adjtimex(&tx) != -1;
        tick_ = tx.tick;
        freq_ = tx.freq;
        if (!readOk_) return;
        // Writing the values just read changes nothing, and tells whether we
        // may write at all.
        struct timex w {};
        w.modes = ADJ_TICK | ADJ_FREQUENCY;
        w.tick = tick_;
        w.freq = freq_;
        writeOk_ = adjtimex(&w) != -1;
        writeErrno_ = errno;
    }
    ~KernelRateGuard() {
        if (!writeOk_) return;
        struct timex w {};
        w.modes = ADJ_TICK | ADJ_FREQUENCY;
        w.tick = tick_;
        w.freq = freq_;
        adjtimex(&w);
    }
    bool CanWrite() const { return readOk_ && writeOk_; }
    int WriteErrno() const { return writeErrno_; }
    long Tick() const { return tick_; }
    long Freq() const { return freq_; }

private:
    bool readOk_ = false;
    bool writeOk_ = false;
    int writeErrno_ = 0;
    long tick_ = 0;
    long freq_ = 0;
};

TEST(EngineKernelClockTest, CurrentRateSetBackReadsTheSameAndAZeroStepKeepsTheTime) {
    quelta::ResetSystemClockHooks();
    KernelRateGuard guard;
    if (!guard.CanWrite()) {
        GTEST_SKIP() << "no permission to set the kernel clock (errno " << guard.WriteErrno() << ")";
    }
    tKPusTimingEngine* engine = new tKPusTimingEngine();
    iKPusTimingEngine* e = engine;

    const double rate = e->GetClockRate();
    std::printf("kernel: tick %ld freq %ld -> %.9f ticks per second\n", guard.Tick(), guard.Freq(), rate);
    ASSERT_GT(rate, 0.0);
    e->SetClockRate(rate);

    struct timex now {};
    ASSERT_NE(adjtimex(&now), -1);
    // The round trip through double may land one freq unit (2^-16 of a tick)
    // below the value read, as the engine's rounding allows.
    const int64_t before = static_cast<int64_t>(guard.Tick()) * 65536 + guard.Freq();
    const int64_t after = static_cast<int64_t>(now.tick) * 65536 + now.freq;
    EXPECT_LE(after - before, 1);
    EXPECT_GE(after - before, -1);
    const double again = e->GetClockRate();
    EXPECT_NEAR(again, rate, rate * 1e-8);
    std::printf("set back: tick %ld freq %ld -> %.9f\n", static_cast<long>(now.tick), static_cast<long>(now.freq),
                again);

    const uint64_t t0 = testsupport::RealNowNs();
    EXPECT_EQ(e->StepGlobalClock(ClockTime{0, 0}), 0);
    const uint64_t t1 = testsupport::RealNowNs();
    // The clock was set to the time read just before: it did not jump.
    EXPECT_LT(t1 - t0, 100000000u) << "the wall clock moved by more than 0.1 s";

    delete engine;
}

}  // namespace
