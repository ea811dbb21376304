// Every call through the loaded library: never early, results as the README's table says, bad input refused.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <thread>

#include "LibraryFixture.h"
#include "TestSupport.h"

using testsupport::CT, testsupport::MonoNowNs, testsupport::NewRuntimeSemaphore, testsupport::U64;
using quelta::PalSemaphorePost, quelta::PalSemaphoreWait;

namespace {

constexpr uint64_t kUs = 1000, kMs = 1000000;
constexpr uint64_t kLoose = 200 * kMs;  // lateness bound for a noisy VM; lateness is benchmarked

using LibraryCalls = testsupport::LibraryFixture;

TEST_F(LibraryCalls, PlainWaitsNeverReturnEarly) {
    const std::function<void(uint64_t start, uint64_t delay)> waits[] = {  // each due at start + delay
        [&](uint64_t s, uint64_t d) { const ClockTime t = CT(s + d); api().WaitUntilClocks64(&t); },
        [&](uint64_t, uint64_t d) { api().WaitClocks(static_cast<uint32_t>(d)); },
        [&](uint64_t, uint64_t d) { api().WaitMicroSeconds(static_cast<uint32_t>(d / kUs + 1)); },
    };
    for (uint64_t delay : {kMs / 3, 2 * kMs + 123456, 5 * kMs}) {
        for (const auto& wait : waits) {
            const uint64_t start = MonoNowNs();
            wait(start, delay);
            EXPECT_GE(MonoNowNs(), start + delay) << &wait - waits << ": " << delay << " ns";
            EXPECT_LT(MonoNowNs(), start + delay + kLoose);
        }
    }
    const uint64_t before = MonoNowNs();
    api().WaitUntilNextMultipleClocks(3 * kMs);
    EXPECT_GE(MonoNowNs(), (before / (3 * kMs) + 1) * 3 * kMs);
}

TEST_F(LibraryCalls, EventWaitResults) {
    PalSemaphore* s = NewRuntimeSemaphore();
    uint64_t start = MonoNowNs();
    EXPECT_EQ(api().EventWait(s, 2500), 1u);  // 2.5 ms, between ticks: times out
    EXPECT_GE(MonoNowNs(), start + 2500 * kUs);
    EXPECT_LT(MonoNowNs(), start + 2500 * kUs + kLoose);
    EXPECT_EQ(PalSemaphoreWait(s, 0), 1u) << "the timeout left a post behind";
    std::thread poster([s] { usleep(3000), PalSemaphorePost(s); });
    EXPECT_EQ(api().EventWait(s, 2000000), 0u);  // woken by the post
    poster.join();
    EXPECT_EQ(api().EventWait(nullptr, 10), 3u);
    PalSemaphorePost(s);
    EXPECT_EQ(api().EventWait(s, 0xFFFFFFFFu), 0u);  // no timeout: waits for the post
    start = MonoNowNs();  // timeouts become a 32-bit clock count: 4,294,968 us wraps to 704 clocks
    EXPECT_EQ(api().EventWait(s, 4294968u), 1u);
    EXPECT_LT(MonoNowNs() - start, 500 * kMs);
    // With neither semaphore nor callback the call blocks until the deadline;
    // a caller's semaphore is posted then, and the call returns at once.
    for (uint64_t delay : {300 * kUs, 2 * kMs + 400 * kUs, 7 * kMs + 1}) {
        const ClockTime deadline = CT(MonoNow() + delay);
        EXPECT_EQ(api().EventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr), 0u);
        EXPECT_GE(MonoNowNs(), U64(deadline));
    }
    const ClockTime deadline = CT(MonoNow() + 4 * kMs);
    EXPECT_EQ(api().EventWaitCallback(s, &deadline, nullptr, nullptr, 0, nullptr), 0u);
    EXPECT_EQ(PalSemaphoreWait(s, 2000), 0u);
    EXPECT_GE(MonoNowNs(), U64(deadline));
    testsupport::DeleteRuntimeSemaphore(s);
}

TEST_F(LibraryCalls, GlobalClockWaitResults) {
    ClockTime g, after{};
    uint32_t generation = 0, abortFlag = 77;
    engine()->ReadGlobalWithGeneration(g, generation);
    for (uint64_t delay : {700 * kUs, 3 * kMs + 300 * kUs}) {
        const ClockTime target = CT(GlobalNow() + delay);
        api().WaitUntilGlobalClocks64(&target, &abortFlag, &after, generation);
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(U64(after), U64(target));
        EXPECT_GE(GlobalNow(), U64(target));
    }
    const ClockTime far = CT(GlobalNow() + 1000 * kMs), zero{0, 0}, past = CT(U64(g) - 1000 * kMs);
    after = ClockTime{1, 2};
    api().WaitUntilGlobalClocks64(&far, &abortFlag, &after, generation + 1);
    EXPECT_EQ(abortFlag, 1u) << "a stale generation aborts at once";
    EXPECT_EQ(after.low, 1u) << "and leaves the time alone";
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

std::atomic<uint64_t> gCallbackAt{0};
std::atomic<int> gCalls{0};
void MarkCallback(void*) { gCallbackAt.store(MonoNowNs()), gCalls.fetch_add(1); }

TEST_F(LibraryCalls, CallbackTimesFireNotBeforeTheirTimeAndNeverTimeNever) {
    api().SetCallback(MarkCallback, nullptr);
    for (uint64_t delay : {400 * kUs, 5 * kMs + 250 * kUs}) {
        gCallbackAt = 0;
        const ClockTime when = CT(MonoNow() + delay);
        ASSERT_EQ(api().SetCallbackTime(&when, 0), 1u);
        ASSERT_NE(testsupport::AwaitNonZero(gCallbackAt, 2000 * kMs), 0u);
        EXPECT_GE(gCallbackAt.load(), U64(when));
    }
    gCalls = 0;
    const ClockTime never{0xFFFFFFFFu, 0xFFFFFFFEu};
    for (int32_t clock : {0, -1}) {
        EXPECT_EQ(api().SetCallbackTime(&never, clock), 1u);  // stored, never fires
        EXPECT_EQ(api().SetCallbackTime(nullptr, clock), 0u);
    }
    api().WaitMicroSeconds(20000);
    api().SetCallback(nullptr, nullptr);
    EXPECT_EQ(gCalls.load(), 0);
}

TEST_F(LibraryCalls, BadNodesNullsAndZerosAreRefusedWithoutBlocking) {
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(api().EventWaitCallback(nullptr, nullptr, nullptr, nullptr, 0, nullptr), 3u);
    api().WaitUntilClocks64(nullptr);
    engine()->ReleaseWait(nullptr);
    api().WaitClocks(0);  // zero arguments: no wait
    api().WaitUntilNextMultipleClocks(0);
    api().WaitMicroSeconds(0);
    api().WaitUntilMicroSeconds(0);
    api().WaitUntilNextMultipleMicroSeconds(0);
    engine()->WaitUntilNextMultipleClocks64(ClockTime{0, 0});
    const ClockTime zero{0, 0}, before{0, 0xFFFFFFFFu};  // high word 0xFFFFFFFF sorts before every time
    api().WaitUntilClocks64(&zero);
    EXPECT_EQ(api().EventWaitCallback(nullptr, &before, nullptr, nullptr, 0, nullptr), 0u);
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

TEST_F(LibraryCalls, LogCapacitiesAndReadOutCounts) {
    iKPLogEngine* log = lib->log()->CreateLogEngine();  // an engine of our own
    ASSERT_NE(log, nullptr);
    const struct { int32_t asked; uint32_t held; } rows[] = {
        {0, 0}, {1, 1}, {1 << 28, 10} /* would overflow: inline rings of 10 */, {-2, 10} /* unsigned: too large */, {-1, 5000}};
    for (const auto& row : rows) EXPECT_EQ(log->Configure(row.asked), row.held) << row.asked;
    log->SetEnabled(1);
    for (uint32_t i = 0; i < 5; ++i) log->LogNow5(i);
    uint32_t lo[16], hi[16], ev[16];
    const struct { uint32_t asked, got; } reads[] = {{16, 5} /* more than held: clipped */, {0, 0} /* restarts */, {16, 0}};
    for (const auto& read : reads) {
        uint32_t count = read.asked;
        log->ReadOut7(count, lo, hi, ev, 0);
        EXPECT_TRUE(read.asked == 0 || count == read.got) << count;
    }
    delete log;
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
