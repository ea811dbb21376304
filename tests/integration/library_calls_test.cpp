// Calls through the loaded library: global waits already due, signals that shorten no wait, bad input refused
// as the README's table says, no page fault after a first call.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "LibraryFixture.h"
#include "TestSupport.h"

using testsupport::CT, testsupport::MonoNowNs, testsupport::NewRuntimeSemaphore, testsupport::U64;
using quelta::PalSemaphoreWait;

namespace {

constexpr uint64_t kUs = 1000, kMs = 1000000;

using LibraryCalls = testsupport::LibraryFixture;

TEST_F(LibraryCalls, GlobalClockWaitResults) {
    ClockTime g, after{};
    uint32_t generation = 0, abortFlag = 7;
    engine()->ReadGlobalWithGeneration(g, generation);
    const ClockTime zero{0, 0}, past = CT(U64(g) - 1000 * kMs);
    for (const ClockTime* target : {&zero, &past, static_cast<const ClockTime*>(nullptr)}) {
        const uint64_t t0 = MonoNowNs(), g0 = GlobalNow();  // no wait, flag 0, the time after the call
        abortFlag = 7;
        api().WaitUntilGlobalClocks64(target, &abortFlag, &after, generation);
        EXPECT_LT(MonoNowNs() - t0, 100 * kMs);
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(U64(after), g0);
        EXPECT_LE(U64(after), GlobalNow());
    }
    api().WaitUntilGlobalClocks64(nullptr, nullptr, nullptr, 0);  // nothing to report
}

void OnUsr1(int) {}

// Every blocking call sees EINTR (no SA_RESTART) and must not end early.
TEST_F(LibraryCalls, ASignalFloodShortensNoWait) {
    struct sigaction sa {}, old {};
    sa.sa_handler = OnUsr1;
    sigaction(SIGUSR1, &sa, &old);
    std::atomic<bool> done{false};
    std::atomic<int> early{0};
    std::thread waiter([&] {
        PalSemaphore* s = NewRuntimeSemaphore();
        for (int i = 0; i < 4; ++i) {
            uint64_t t0 = MonoNowNs();
            early += api().EventWait(s, 8000) != 1 || MonoNowNs() < t0 + 8 * kMs;
            const ClockTime d = CT(MonoNow() + 6 * kMs), target = CT(GlobalNow() + 5 * kMs);
            api().EventWaitCallback(nullptr, &d, nullptr, nullptr, 0, nullptr);
            early += MonoNowNs() < U64(d);
            ClockTime after{};
            api().WaitUntilGlobalClocks64(&target, nullptr, &after, 0);
            early += U64(after) < U64(target);
            t0 = MonoNowNs();
            api().WaitMicroSeconds(7000);
            early += MonoNowNs() < t0 + 7 * kMs;
            const ClockTime until = CT(MonoNow() + 5 * kMs);
            api().WaitUntilClocks64(&until);
            early += MonoNowNs() < U64(until);
        }
        testsupport::DeleteRuntimeSemaphore(s);
        done = true;
    });
    uint64_t sent = 0;
    for (; !done.load(); ++sent, usleep(100)) pthread_kill(waiter.native_handle(), SIGUSR1);
    waiter.join();
    sigaction(SIGUSR1, &old, nullptr);
    EXPECT_EQ(early.load(), 0) << "signals sent: " << sent;
    EXPECT_GT(sent, 10u) << "too few signals to prove anything";
}

TEST_F(LibraryCalls, BadNodesAndNullsAreRefusedWithoutBlocking) {
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(api().EventWaitCallback(nullptr, nullptr, nullptr, nullptr, 0, nullptr), 3u);
    api().WaitUntilClocks64(nullptr);
    engine()->ReleaseWait(nullptr);
    EXPECT_LT(MonoNowNs() - t0, 200 * kMs);
    PalSemaphore* s = NewRuntimeSemaphore();
    const ClockTime never{0xFFFFFFFFu, 0xFFFFFFFEu};
    WaitNode *n = nullptr, *parked = nullptr;
    ASSERT_EQ(api().EventWaitCallback(s, &never, nullptr, nullptr, 0, &parked), 0u);  // waits until cancelled
    ASSERT_EQ(api().EventWaitCallback(s, &never, nullptr, nullptr, 0, &n), 0u);
    engine()->ReleaseWait(n);
    engine()->ReleaseWait(n);  // twice
    ClockTime notANode{};
    engine()->ReleaseWait(reinterpret_cast<WaitNode*>(&notANode));
    engine()->ReleaseWait(reinterpret_cast<WaitNode*>(reinterpret_cast<char*>(n) + 1));
    EXPECT_EQ(PalSemaphoreWait(s, 30), 1u) << "NeverTime fired";
    engine()->ReleaseWait(parked);
    testsupport::DeleteRuntimeSemaphore(s);
    ExpectPoolWhole([&](PalSemaphore* full) { EXPECT_EQ(api().EventWait(full, 1000), 3u); });  // the 129th refused
}

void Nothing(void*) {}
uint32_t Fire(void*) { return 1; }

// The node pool, the semaphores and the timer thread's stack are faulted in
// at start-up: after its first call no wait of any kind page-faults.
TEST_F(LibraryCalls, WaitsOfEveryKindDoNotFaultAfterTheirFirstCall) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer faults pages in for its own trace of every access";
#endif
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    PalSemaphore* s = NewRuntimeSemaphore();
    api().SetCallback(&Nothing, nullptr);
    uint32_t generation = 0, abortFlag = 0;
    ClockTime g, after{};
    engine()->ReadGlobalWithGeneration(g, generation);
    auto round = [&](int i) {
        const uint64_t ahead = (100 + (i % 7) * 50) * kUs;
        api().EventWait(s, static_cast<uint32_t>(ahead / kUs));
        const ClockTime mono = CT(MonoNow() + ahead), global = CT(GlobalNow() + ahead);
        api().EventWaitCallback(nullptr, &mono, nullptr, nullptr, 0, nullptr);
        api().WaitUntilGlobalClocks64(&global, &abortFlag, &after, generation);
        api().EventWaitCallback(nullptr, &global, nullptr, nullptr, 1, nullptr);
        api().EventWaitCallback(nullptr, &mono, &Fire, nullptr, 0, nullptr);
        api().SetCallbackTime(&mono, 0);
        api().WaitUntilClocks64(&mono);
    };
    for (int i = 0; i < 7; ++i) round(i);  // first calls, every timeout once
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    const long before = usage.ru_minflt;
    for (int i = 0; i < 300; ++i) round(i);
    getrusage(RUSAGE_SELF, &usage);
    api().SetCallback(nullptr, nullptr);
    EXPECT_EQ(usage.ru_minflt - before, 0) << "minor faults over 300 rounds of every wait";
    testsupport::DeleteRuntimeSemaphore(s);
}

}  // namespace
