// Start-up and stop in this process (the internal library, without the load
// hook), including an allocation failure at every allocation start-up makes:
// each failure is reported, what the failure releases is gone at once, and the
// stop releases the rest exactly once (the sanitizer build checks for leaks
// and double frees).
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>

#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/LibraryUse.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

using namespace quelta;

namespace {

struct StartResult {
    uint32_t started;
    std::string out;
};

StartResult Start() {
    testing::internal::CaptureStdout();
    const uint32_t r = LibraryControl(0, 1, 0);
    return {r, testing::internal::GetCapturedStdout()};
}

TEST(Startup, UpLibraryHasEverythingInPlace) {
    StartResult r = Start();
    ASSERT_EQ(r.started, 1u) << r.out;
    EXPECT_EQ(r.out, "");
    ASSERT_NE(GetEngine__MERIDOX(), nullptr);
    ASSERT_NE(GetLogEngine__MERIDOX(), nullptr);
    EXPECT_EQ(gCpuSpeed.load(), 1000u);
    EXPECT_EQ(gTickPeriod.Load(), 1000000u);
    EXPECT_EQ(gEventSystemReady.load(), 1u);
    EXPECT_EQ(gEngine.load()->UsesTickService(), 1u);
    // 128 nodes on the free list, in pool order.
    WaitNode* pool = gWaitNodePool.load();
    uint32_t i = 0;
    for (WaitNode* n = gFreeList.load(); n != nullptr; n = n->next.load(), ++i) {
        ASSERT_EQ(n, pool + i);
        EXPECT_NE(n->ownSemaphore.load(), nullptr);
    }
    EXPECT_EQ(i, kWaitNodeCount);
    // Without the sysfs file the conversion call is unavailable.
    EXPECT_EQ(gConvertSyscallNr.load(), -1);
    // Any other command does nothing.
    EXPECT_EQ(LibraryControl(0, 2, 0), 1u);
    EXPECT_NE(GetEngine__MERIDOX(), nullptr);
    EXPECT_EQ(LibraryControl(0, 0, 0), 1u);
    EXPECT_EQ(GetEngine__MERIDOX(), nullptr);
    EXPECT_EQ(GetLogEngine__MERIDOX(), nullptr);
    EXPECT_EQ(LibraryControl(0, 0, 0), 1u);  // a second stop finds nothing to do
}

std::atomic<uint64_t> gFirstTickAt{0};
void MarkFirstTick(uint64_t) {
    uint64_t none = 0;
    gFirstTickAt.compare_exchange_strong(none, testsupport::MonoNowNs());
}

// Start-up reads the clock (recorded as the engine's last monotonic reading)
// and arms the first tick one period later. Seen right after the start, before
// the first tick's pass reads the clock again, the next tick is that reading
// plus 1 ms exactly; a start whose first pass came first is repeated. The
// tick is then served at that time, never before it.
TEST(Startup, TheFirstTickComesOnePeriodAfterStartUpReadsTheClock) {
    gTickCallback.store(&MarkFirstTick);
    bool seen = false;
    uint64_t lastDifference = 0;
    for (int attempt = 0; attempt < 10 && !seen; ++attempt) {
        gFirstTickAt.store(0);
        ASSERT_EQ(Start().started, 1u);
        if (!TimerServing()) {
            LibraryControl(0, 0, 0);
            gTickCallback.store(nullptr);
            GTEST_SKIP() << "the timer thread needs SCHED_FIFO; no tick service here";
        }
        const uint64_t next = gNextTick.Load();
        ClockTime read;
        gEngine.load()->LoadLastMonotonic(read);
        lastDifference = next - ToU64(read);
        if (lastDifference == kTickPeriodClocks) {
            seen = true;
            for (int ms = 0; ms < 2000 && gFirstTickAt.load() == 0; ++ms) PalSleepMilliseconds(1);
            ASSERT_NE(gFirstTickAt.load(), 0u) << "no tick in 2 s";
            EXPECT_GE(gFirstTickAt.load(), next) << "the first tick came early";
        }
        LibraryControl(0, 0, 0);
    }
    gTickCallback.store(nullptr);
    EXPECT_TRUE(seen) << "next tick minus start-up's reading: " << lastDifference << " ns";
}

TEST(Startup, EveryAllocationFailureIsReportedAndReleasedOnce) {
    gPalAllocFailCountdown.store(0);
    const uint32_t before = gPalAllocCount.load();
    ASSERT_EQ(Start().started, 1u);
    const uint32_t allocations = gPalAllocCount.load() - before;
    LibraryControl(0, 0, 0);
    ASSERT_GT(allocations, 130u);  // objects, log rings, pool, 128 semaphores

    int logFailures = 0, initFailures = 0, survived = 0;
    for (uint32_t k = 1; k <= allocations; ++k) {
        gPalAllocFailCountdown.store(static_cast<int32_t>(k));
        StartResult r = Start();
        gPalAllocFailCountdown.store(0);
        if (r.out.find("Log engine initialization FAILED!") != std::string::npos) {
            ++logFailures;
            EXPECT_EQ(r.started, 0u);
            EXPECT_EQ(GetEngine__MERIDOX(), nullptr) << k;
            EXPECT_EQ(GetLogEngine__MERIDOX(), nullptr) << k;
        } else if (r.out.find("iTSCEvent_Initialize_C FAILED!") != std::string::npos) {
            ++initFailures;
            EXPECT_EQ(r.started, 0u);
            EXPECT_EQ(GetLogEngine__MERIDOX(), nullptr) << k;  // released at once
            // A failed event system deletes the timer at once and keeps the
            // engine and the pool for the stop.
            if (gEngine.load() != nullptr) {
                EXPECT_EQ(gTimer.load(), nullptr) << k;
            }
        } else {
            // A log ring that cannot be had falls back to the inline ring.
            ++survived;
            EXPECT_EQ(r.started, 1u) << k << ": " << r.out;
        }
        EXPECT_EQ(LibraryControl(0, 0, 0), 1u);
        EXPECT_EQ(GetEngine__MERIDOX(), nullptr);
        EXPECT_EQ(GetLogEngine__MERIDOX(), nullptr);
        EXPECT_EQ(gTimer.load(), nullptr);
    }
    EXPECT_GE(logFailures, 1);
    EXPECT_GE(initFailures, 129);  // timer, engine, pool, every semaphore
    std::printf("allocations %u: log failures %d, init failures %d, survived %d\n",
                allocations, logFailures, initFailures, survived);
    // And the library still starts afterwards.
    ASSERT_EQ(Start().started, 1u);
    LibraryControl(0, 0, 0);
}

TEST(Startup, StopReleasesAWaiterBlockedOnItsOwnSemaphore) {
    ASSERT_EQ(Start().started, 1u);
    std::atomic<int> done{0};
    std::thread waiter([&] {
        ClockTime now;
        gEngine.load()->ReadMonotonic0(now);
        const ClockTime far = FromU64(ToU64(now) + 3600ull * 1000000000ull);
        quelta_iTSCEvent_Wait_Callback_C(nullptr, &far, nullptr, nullptr, 0, nullptr);
        done = 1;
    });
    while (gCallersInside.load() == 0) PalSleepMilliseconds(1);
    PalSleepMilliseconds(5);
    const uint64_t t0 = testsupport::MonoNowNs();
    LibraryControl(0, 0, 0);
    waiter.join();
    EXPECT_EQ(done.load(), 1);
    EXPECT_LT(testsupport::MonoNowNs() - t0, 1000000000ull);
}

}  // namespace
