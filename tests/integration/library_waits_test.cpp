// Every wait of the exported interface, through the loaded library: never
// early, results as documented, refusals when the library cannot serve.
#include <gtest/gtest.h>
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <thread>
#include <vector>

#include "LibraryFixture.h"
#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"

using testsupport::CT;
using testsupport::LoadedLibrary;
using testsupport::U64;
using testsupport::MonoNowNs;

namespace {

constexpr uint64_t kUs = 1000;
constexpr uint64_t kMs = 1000000;
constexpr uint64_t kLooseLateness = 200 * kMs;  // noisy VMs; lateness is benchmarked

using LibraryWaits = testsupport::LibraryFixture;

TEST_F(LibraryWaits, PlainWaitsNeverReturnEarly) {
    for (uint64_t delay : {1 * kMs / 3, 2 * kMs + 123456, 5 * kMs}) {
        const uint64_t start = MonoNowNs();
        const ClockTime target = CT(start + delay);
        api().WaitUntilClocks64(&target);
        const uint64_t end = MonoNowNs();
        EXPECT_GE(end, start + delay);
        EXPECT_LT(end - start - delay, kLooseLateness);

        const uint64_t s2 = MonoNowNs();
        api().WaitClocks(static_cast<uint32_t>(delay));
        EXPECT_GE(MonoNowNs(), s2 + delay);

        const uint64_t s3 = MonoNowNs();
        const uint32_t targetLow = static_cast<uint32_t>(s3 + delay);
        api().WaitUntilClocks(targetLow);
        EXPECT_GE(MonoNowNs(), s3 + delay);

        const uint64_t s4 = MonoNowNs();
        api().WaitMicroSeconds(static_cast<uint32_t>(delay / 1000));
        EXPECT_GE(MonoNowNs(), s4 + delay / 1000 * kUs);
    }
    const uint32_t period = 3 * kMs;
    const uint64_t before = MonoNowNs();
    api().WaitUntilNextMultipleClocks(period);
    const uint64_t after = MonoNowNs();
    EXPECT_GE(after, (before / period + 1) * period);
}

TEST_F(LibraryWaits, EventWaitTimesOutWithOneAndLeavesTheCountAlone) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    const uint64_t start = MonoNowNs();
    EXPECT_EQ(api().EventWait(s, 2500), 1u);  // 2.5 ms: a deadline between ticks
    const uint64_t end = MonoNowNs();
    EXPECT_GE(end, start + 2500 * kUs);
    EXPECT_LT(end - start, 2500 * 1000 + kLooseLateness);
    EXPECT_EQ(quelta::PalSemaphoreWait(s, 0), 1u);  // nothing left behind
    testsupport::DeleteRuntimeSemaphore(s);
}

TEST_F(LibraryWaits, EventWaitWokenByAPostReturnsZero) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    std::thread poster([s] {
        timespec ts{0, 3 * 1000000};
        nanosleep(&ts, nullptr);
        quelta::PalSemaphorePost(s);
    });
    const uint64_t start = MonoNowNs();
    EXPECT_EQ(api().EventWait(s, 2000000), 0u);
    EXPECT_LT(MonoNowNs() - start, 1000 * kMs);
    poster.join();
    EXPECT_EQ(api().EventWait(nullptr, 10), 3u);
    quelta::PalSemaphorePost(s);
    EXPECT_EQ(api().EventWait(s, 0xFFFFFFFFu), 0u);  // no timeout: waits for the post
    testsupport::DeleteRuntimeSemaphore(s);
}

TEST_F(LibraryWaits, OwnSemaphoreWaitBlocksUntilTheDeadline) {
    for (uint64_t delay : {300 * kUs, 2 * kMs + 400 * 1000, 7 * kMs + 1}) {
        ClockTime now;
        engine()->ReadMonotonic0(now);
        const ClockTime deadline = CT(U64(now) + delay);
        EXPECT_EQ(api().EventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr), 0u);
        EXPECT_GE(MonoNowNs(), U64(deadline));
    }
}

TEST_F(LibraryWaits, CallerSemaphoreIsPostedAtTheDeadline) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    ClockTime now;
    engine()->ReadMonotonic0(now);
    const ClockTime deadline = CT(U64(now) + 4 * kMs);
    EXPECT_EQ(api().EventWaitCallback(s, &deadline, nullptr, nullptr, 0, nullptr), 0u);  // at once
    EXPECT_EQ(quelta::PalSemaphoreWait(s, 2000), 0u);
    EXPECT_GE(MonoNowNs(), U64(deadline));
    testsupport::DeleteRuntimeSemaphore(s);
}

TEST_F(LibraryWaits, The129thPendingWaitIsRefusedAndThePoolComesBackWhole) {
    ExpectPoolWhole([&](PalSemaphore* s) { EXPECT_EQ(api().EventWait(s, 1000), 3u); });
    ExpectPoolWhole();  // and every node came back
}

TEST_F(LibraryWaits, GlobalClockWaitEndsAtTheWallClockTarget) {
    ClockTime g;
    uint32_t generation = 0;
    engine()->ReadGlobalWithGeneration(g, generation);
    for (uint64_t delay : {700 * kUs, 3 * kMs + 300 * 1000}) {
        const ClockTime target = CT(GlobalNow() + delay);
        uint32_t abortFlag = 77;
        ClockTime after{};
        api().WaitUntilGlobalClocks64(&target, &abortFlag, &after, generation);
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(U64(after), U64(target));
        EXPECT_GE(GlobalNow(), U64(target));
    }
    // A stale generation aborts at once and leaves the time alone.
    const ClockTime target = CT(GlobalNow() + 1000 * kMs);
    uint32_t abortFlag = 0;
    ClockTime after{1, 2};
    api().WaitUntilGlobalClocks64(&target, &abortFlag, &after, generation + 1);
    EXPECT_EQ(abortFlag, 1u);
    EXPECT_EQ(after.low, 1u);
    // Target 0: no wait, the current time comes back.
    const ClockTime zero{0, 0};
    api().WaitUntilGlobalClocks64(&zero, &abortFlag, &after, generation);
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_NEAR(static_cast<double>(U64(after)), static_cast<double>(GlobalNow()), 1e9);
}

void OnUsr1(int) {}

TEST_F(LibraryWaits, ASignalFloodShortensNoWait) {
    struct sigaction sa {};
    sa.sa_handler = OnUsr1;  // no SA_RESTART: every blocking call sees EINTR
    sigemptyset(&sa.sa_mask);
    struct sigaction old {};
    sigaction(SIGUSR1, &sa, &old);
    std::atomic<bool> done{false};
    std::atomic<int> early{0};
    std::thread waiter([&] {
        PalSemaphore* s = testsupport::NewRuntimeSemaphore();
        for (int i = 0; i < 4; ++i) {
            uint64_t t0 = MonoNowNs();
            if (api().EventWait(s, 8000) != 1 || MonoNowNs() < t0 + 8 * kMs) early++;
            ClockTime now;
            engine()->ReadMonotonic0(now);
            const ClockTime d = CT(U64(now) + 6 * kMs);
            api().EventWaitCallback(nullptr, &d, nullptr, nullptr, 0, nullptr);
            if (MonoNowNs() < U64(d)) early++;
            const ClockTime target = CT(GlobalNow() + 5 * kMs);
            ClockTime after{};
            api().WaitUntilGlobalClocks64(&target, nullptr, &after, 0);
            if (U64(after) < U64(target)) early++;
            t0 = MonoNowNs();
            api().WaitMicroSeconds(7000);
            if (MonoNowNs() < t0 + 7 * kMs) early++;
            engine()->ReadMonotonic0(now);
            const ClockTime until = CT(U64(now) + 5 * kMs);
            api().WaitUntilClocks64(&until);
            if (MonoNowNs() < U64(until)) early++;
        }
        testsupport::DeleteRuntimeSemaphore(s);
        done = true;
    });
    const pthread_t target = waiter.native_handle();
    uint64_t sent = 0;
    while (!done.load()) {
        pthread_kill(target, SIGUSR1);
        ++sent;
        usleep(100);
    }
    waiter.join();
    sigaction(SIGUSR1, &old, nullptr);
    EXPECT_EQ(early.load(), 0) << "signals sent: " << sent;
    EXPECT_GT(sent, 100u);
}

std::atomic<uint64_t> gCallbackAt{0};
void MarkCallback(void*) { gCallbackAt.store(MonoNowNs()); }

TEST_F(LibraryWaits, MonotonicCallbackTimeFiresNotBeforeItsTime) {
    api().SetCallback(MarkCallback, nullptr);
    for (uint64_t delay : {400 * kUs, 5 * kMs + 250 * 1000}) {
        gCallbackAt = 0;
        ClockTime now;
        engine()->ReadMonotonic0(now);
        const ClockTime when = CT(U64(now) + delay);
        ASSERT_EQ(api().SetCallbackTime(&when, 0), 1u);
        testsupport::AwaitNonZero(gCallbackAt, 2000 * kMs);
        ASSERT_NE(gCallbackAt.load(), 0u);
        EXPECT_GE(gCallbackAt.load(), U64(when));
    }
    api().SetCallback(nullptr, nullptr);
}

}  // namespace
