// The one test that touches the machine's real clock discipline: the engine
// sets the kernel clock's current rate back to itself and steps the wall
// clock by zero. Opt-in (label hostclock, left out of the default runs): it
// writes the host's adjtimex and clock_settime. The same behaviour is covered
// on a fake kernel by engine_rate_test. Needs CAP_SYS_TIME; skipped without
// it. Whatever happens, tick and freq are put back to the values found at
// the start.
#include <gtest/gtest.h>
#include <sys/timex.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>

#include "TestSupport.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"

namespace {

// Writing back the tick and freq just read changes nothing; it tells whether
// we may write at all, and runs again at the end, also after a failed ASSERT.
struct KernelRateGuard {
    struct timex saved {};
    bool writable = false;
    int writeErrno = 0;

    KernelRateGuard() {
        if (adjtimex(&saved) == -1) return;
        writable = Restore();
        writeErrno = errno;
    }
    ~KernelRateGuard() {
        if (writable) Restore();
    }
    bool Restore() {
        struct timex w {};
        w.modes = ADJ_TICK | ADJ_FREQUENCY;
        w.tick = saved.tick;
        w.freq = saved.freq;
        return adjtimex(&w) != -1;
    }
};

TEST(EngineKernelClockTest, CurrentRateSetBackReadsTheSameAndAZeroStepKeepsTheTime) {
    quelta::ResetSystemClockHooks();
    KernelRateGuard guard;
    if (!guard.writable) GTEST_SKIP() << "no permission to set the kernel clock (errno " << guard.writeErrno << ")";
    std::unique_ptr<iKPusTimingEngine> e(new tKPusTimingEngine());

    const double rate = e->GetClockRate();
    ASSERT_GT(rate, 0.0);
    e->SetClockRate(rate);
    struct timex now {};
    ASSERT_NE(adjtimex(&now), -1);
    // The round trip through double may land one freq unit (2^-16 of a tick)
    // off the value read, as the engine's rounding allows.
    const int64_t before = static_cast<int64_t>(guard.saved.tick) * 65536 + guard.saved.freq;
    const int64_t after = static_cast<int64_t>(now.tick) * 65536 + now.freq;
    EXPECT_LE(std::llabs(after - before), 1);
    EXPECT_NEAR(e->GetClockRate(), rate, rate * 1e-8);
    std::printf("kernel tick %ld freq %ld -> %.9f ticks per second; set back: tick %ld freq %ld\n",
                static_cast<long>(guard.saved.tick), static_cast<long>(guard.saved.freq), rate,
                static_cast<long>(now.tick), static_cast<long>(now.freq));

    const uint64_t t0 = testsupport::RealNowNs();
    EXPECT_EQ(e->StepGlobalClock(ClockTime{0, 0}), 0);
    EXPECT_LT(testsupport::RealNowNs() - t0, 100000000u) << "a zero step moved the wall clock by 0.1 s or more";
}

}  // namespace
