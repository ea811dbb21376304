// A due callback never waits for a caller inside the scheduler's lock: the
// timer thread claims the callback time and makes the call before it takes
// the lock, so a low-priority caller preempted there cannot delay it.
#include <gtest/gtest.h>
#include <sched.h>
#include <time.h>

#include <atomic>

#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/WaitList.h"
#include "quelta/quelta.h"

using namespace quelta;

namespace {

constexpr uint64_t kUs = 1000, kMs = 1000000;
std::atomic<uint64_t> gCalledAt{0};
void Record(void*) { gCalledAt.store(testsupport::MonoNowNs()); }

}  // namespace

TEST(CallbackLock, ADueCallbackRunsWhileACallerHoldsTheSchedulerLock) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
    quelta_iTSC_SetCallback(&Record, nullptr);
    // The holder runs below the timer thread, but on time even on a busy machine.
    sched_param p{};
    p.sched_priority = 1;
    ASSERT_EQ(sched_setscheduler(0, SCHED_FIFO, &p), 0);
    int whileHeld = 0;
    for (int trial = 0; trial < 20 && whileHeld == 0; ++trial) {
        // Due with a tick, so that the pass which meets the held lock is the
        // one that finds the callback due.
        const uint64_t due = gNextTick.Load() + 2 * kMs;
        const ClockTime when = FromU64(due);
        gCalledAt.store(0);
        ASSERT_EQ(quelta_iTSC_SetCallbackTime(&when, 0), 1u);
        const uint64_t from = due - 400 * kUs;
        const timespec at{static_cast<time_t>(from / 1000000000u), static_cast<long>(from % 1000000000u)};
        clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &at, nullptr);
        uint64_t held = 0, released = 0;
        {
            SchedLockGuard hold;
            held = testsupport::MonoNowNs();
            while (testsupport::MonoNowNs() < due + 500 * kUs) {
            }
            released = testsupport::MonoNowNs();
        }
        const uint64_t called = testsupport::AwaitNonZero(gCalledAt, 200 * kMs);
        ASSERT_NE(called, 0u) << "callback lost";
        ASSERT_GE(called, due) << "callback early";
        if (held < due && called < released) ++whileHeld;  // a trial that took the lock late says nothing
    }
    p.sched_priority = 0;
    sched_setscheduler(0, SCHED_OTHER, &p);
    EXPECT_GT(whileHeld, 0) << "in 20 trials every callback waited for the lock's holder";
    quelta_iTSC_SetCallback(nullptr, nullptr);
    LibraryControl(0, 0, 0);
}
