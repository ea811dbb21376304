// A due callback never waits for a caller inside the scheduler's lock: the timer thread claims the callback
// time and calls before it takes the lock, so a low-priority caller preempted there cannot delay it.
#include <gtest/gtest.h>
#include <sched.h>
#include <time.h>

#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/WaitList.h"
#include "quelta/quelta.h"

using namespace quelta;
using testsupport::MonoNowNs;

std::atomic<uint64_t> gCalledAt{0};

TEST(CallbackLock, ADueCallbackRunsWhileACallerHoldsTheSchedulerLock) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
    quelta_iTSC_SetCallback([](void*) { gCalledAt.store(MonoNowNs()); }, nullptr);
    sched_param p{1};  // the holder runs below the timer thread, but on time on a busy machine
    ASSERT_EQ(sched_setscheduler(0, SCHED_FIFO, &p), 0);
    int whileHeld = 0;
    for (int trial = 0; trial < 20 && whileHeld == 0; ++trial) {
        // Due with a tick, so that the pass which meets the held lock is the one that finds it due.
        const uint64_t due = gNextTick.Load() + 2000000, from = due - 400000;
        const ClockTime when = FromU64(due);
        gCalledAt.store(0);
        ASSERT_EQ(quelta_iTSC_SetCallbackTime(&when, 0), 1u);
        const timespec at{static_cast<time_t>(from / 1000000000u), static_cast<long>(from % 1000000000u)};
        clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &at, nullptr);
        uint64_t held = 0, released = 0;
        {
            SchedLockGuard hold;
            for (held = MonoNowNs(); gCalledAt.load() == 0 && MonoNowNs() < due + 200000000;) {}  // or lost
            released = MonoNowNs();
        }
        const uint64_t called = testsupport::AwaitNonZero(gCalledAt, 200000000);
        ASSERT_NE(called, 0u) << "callback lost";
        ASSERT_GE(called, due) << "callback early";
        whileHeld += held < due && called < released;  // a trial that took the lock late says nothing
    }
    p.sched_priority = 0;
    sched_setscheduler(0, SCHED_OTHER, &p);
    EXPECT_GT(whileHeld, 0) << "in 20 trials every callback waited for the lock's holder";
    quelta_iTSC_SetCallback(nullptr, nullptr);
    LibraryControl(0, 0, 0);
}
