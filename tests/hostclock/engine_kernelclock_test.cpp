// Opt-in (label hostclock, CAP_SYS_TIME): the engine sets the kernel clock's rate back to itself and steps
// the wall clock by zero; tick and freq are put back to the values found, whatever happens.
#include <gtest/gtest.h>
#include <sys/timex.h>

#include <cerrno>
#include <cstdlib>
#include <memory>

#include "TestSupport.h"
#include "engine/SystemClock.h"
#include "engine/tKPusTimingEngine.h"

namespace {

// Writing back what was read changes nothing; it tells whether we may write.
struct KernelRateGuard {
    struct timex saved {};
    bool writable = adjtimex(&saved) != -1 && Restore();
    int writeErrno = errno;
    ~KernelRateGuard() { writable && Restore(); }
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
    // The round trip through double may land one freq unit (2^-16 of a tick) off.
    EXPECT_LE(std::llabs((int64_t(now.tick) - guard.saved.tick) * 65536 + now.freq - guard.saved.freq), 1);
    EXPECT_NEAR(e->GetClockRate(), rate, rate * 1e-8);
    const uint64_t t0 = testsupport::RealNowNs();
    EXPECT_EQ(e->StepGlobalClock(ClockTime{0, 0}), 0);
    EXPECT_LT(testsupport::RealNowNs() - t0, 100000000u) << "a zero step moved the wall clock by 0.1 s or more";
}

}  // namespace
