// The promises that only races can break, through the loaded library:
// no post is lost or invented by an event wait that meets a post at its
// timeout; a caller blocked in I/O never holds up the tick service; unloading
// leaves the application's signal handler alone and every waiter out of the
// library; a global deadline from before the machine booted is simply past.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <memory>
#include <thread>
#include <vector>

#include "LibraryFixture.h"
#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"

using testsupport::CT;
using testsupport::LoadedLibrary;
using testsupport::MonoNowNs;
using testsupport::U64;

namespace {

constexpr uint64_t kUs = 1000;
constexpr uint64_t kMs = 1000000;

// Posts not yet taken, taking them all.
int Drain(PalSemaphore* s) {
    int n = 0;
    while (quelta::PalSemaphoreWait(s, 0) == 0) ++n;
    return n;
}

bool WaitFor(const std::atomic<bool>& flag, uint64_t timeoutNs) {
    for (const uint64_t end = MonoNowNs() + timeoutNs; !flag.load();) {
        if (MonoNowNs() > end) return false;
        usleep(200);
    }
    return true;
}

void SleepUntil(uint64_t monotonicNs) {
    timespec ts{static_cast<time_t>(monotonicNs / 1000000000u), static_cast<long>(monotonicNs % 1000000000u)};
    while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr) == EINTR) {
    }
}

using RaceGuarantees = testsupport::LibraryFixture;

// Another thread posts the runtime's semaphore around the moment the wait
// times out, from 150 us before to 90 us after. Whatever the interleaving,
// that one post is either what the wait returned 0 for, or still pending:
// never gone, and never doubled by the library's own timeout.
TEST_F(RaceGuarantees, EventWaitNeitherLosesNorInventsAPostAtItsTimeout) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    constexpr uint32_t kTimeoutUs = 300;
    int lost = 0, invented = 0, signalled = 0;
    const int rounds = 1500;
    for (int round = 0; round < rounds; ++round) {
        const uint64_t start = MonoNowNs();
        const uint64_t postAt = start + kTimeoutUs * kUs - 150 * kUs + (round % 241) * kUs;
        std::thread poster([&] {
            SleepUntil(postAt);
            quelta::PalSemaphorePost(s);
        });
        const uint32_t r = api().EventWait(s, kTimeoutUs);
        poster.join();
        ASSERT_TRUE(r == 0 || r == 1) << r;
        if (r == 0) ++signalled;
        const int accounted = (r == 0 ? 1 : 0) + Drain(s);
        if (accounted < 1) ++lost;
        if (accounted > 1) ++invented;
    }
    printf("%d rounds: %d signalled, %d lost, %d invented\n", rounds, signalled, lost, invented);
    EXPECT_EQ(lost, 0) << "posts taken back by the library";
    EXPECT_EQ(invented, 0) << "posts the library left behind";
    testsupport::DeleteRuntimeSemaphore(s);
}

std::atomic<uint64_t> gCallbackAt{0};
void RecordCallbackTime(void*) { gCallbackAt.store(MonoNowNs()); }

// A double release writes a diagnostic line to standard error. With standard
// error on a full pipe that write blocks its caller, and nothing else: the
// tick service goes on and a callback due meanwhile runs on time.
TEST_F(RaceGuarantees, ACallerBlockedWritingADiagnosticHoldsUpNoTick) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    const ClockTime far = CT(MonoNow() + 60000 * kMs);
    WaitNode* node = nullptr;
    ASSERT_EQ(api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &node), 0u);
    engine()->ReleaseWait(node);

    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    fcntl(fds[1], F_SETFL, O_NONBLOCK);
    char block[4096] = {};
    while (write(fds[1], block, sizeof block) > 0) {
    }
    fcntl(fds[1], F_SETFL, 0);
    fflush(stderr);
    const int savedStderr = dup(2);
    dup2(fds[1], 2);

    std::atomic<bool> releaseDone{false};
    std::thread releaser([&] {
        engine()->ReleaseWait(node);  // refused, with a line to the full pipe
        releaseDone.store(true);
    });
    usleep(20000);  // the releaser is blocked in its write
    gCallbackAt.store(0);
    api().SetCallback(&RecordCallbackTime, nullptr);
    const uint64_t due = MonoNow() + 5 * kMs;
    std::atomic<bool> armed{false};
    std::thread setter([&] {
        const ClockTime when = CT(due);
        api().SetCallbackTime(&when, 0);
        armed.store(true);
    });
    std::atomic<bool> fired{false};
    for (const uint64_t end = MonoNowNs() + 500 * kMs; MonoNowNs() < end && !fired.load();) {
        fired.store(gCallbackAt.load() != 0);
        usleep(500);
    }
    const bool releaserStillBlocked = !releaseDone.load();

    dup2(savedStderr, 2);
    close(savedStderr);
    char sink[4096];
    fcntl(fds[0], F_SETFL, O_NONBLOCK);
    while (!releaseDone.load()) {
        while (read(fds[0], sink, sizeof sink) > 0) {
        }
        usleep(1000);
    }
    releaser.join();
    setter.join();
    close(fds[0]);
    close(fds[1]);
    api().SetCallback(nullptr, nullptr);

    EXPECT_TRUE(releaserStillBlocked) << "the diagnostic did not block: the test proves nothing";
    EXPECT_TRUE(armed.load());
    ASSERT_TRUE(fired.load()) << "no callback while a caller was blocked writing to standard error";
    EXPECT_GE(gCallbackAt.load(), due);
    testsupport::DeleteRuntimeSemaphore(s);
}

// A global-clock deadline from before the machine booted converts to a
// monotonic time before the clock's zero. It has passed: the wait ends at
// once, it is not parked in the far future.
TEST_F(RaceGuarantees, GlobalDeadlinesFromBeforeBootAreDueAtOnce) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    const uint64_t beforeBoot = GlobalNow() - MonoNow() - 10000 * kMs;
    for (uint64_t target : {beforeBoot, beforeBoot - 3600000 * kMs, 1 * kMs}) {
        SCOPED_TRACE(target);
        const ClockTime deadline = CT(target);
        WaitNode* node = nullptr;
        ASSERT_EQ(api().EventWaitCallback(s, &deadline, nullptr, nullptr, 1, &node), 0u);
        const bool posted = quelta::PalSemaphoreWait(s, 1000) == 0;
        engine()->ReleaseWait(node);
        EXPECT_TRUE(posted) << "a past global deadline was not fired";

        std::atomic<bool> done{false};
        uint32_t abortFlag = 77;
        ClockTime after{};
        uint32_t generation = 0;
        ClockTime unused;
        engine()->ReadGlobalWithGeneration(unused, generation);
        std::thread waiter([&] {
            api().WaitUntilGlobalClocks64(&deadline, &abortFlag, &after, generation);
            done.store(true);
        });
        if (!WaitFor(done, 2000 * kMs)) {
            ADD_FAILURE() << "a global wait for a time before boot does not end";
            fflush(stdout);
            _exit(1);  // the waiter can never leave the library
        }
        waiter.join();
        EXPECT_EQ(abortFlag, 0u);
        EXPECT_GE(U64(after), target);
    }
    testsupport::DeleteRuntimeSemaphore(s);
}

std::atomic<int> gApplicationAlarms{0};
void ApplicationAlarm(int) { gApplicationAlarms.fetch_add(1); }

// The library puts back the SIGALRM action it found only while its own is
// still installed; a handler the application installed since is left alone.
TEST(RaceGuaranteesUnload, UnloadLeavesTheApplicationsAlarmHandlerInPlace) {
    struct sigaction before {};
    sigaction(SIGALRM, nullptr, &before);
    {
        LoadedLibrary lib;
        ASSERT_TRUE(lib.ok()) << lib.error();
        struct sigaction mine {};
        mine.sa_handler = &ApplicationAlarm;
        sigemptyset(&mine.sa_mask);
        sigaction(SIGALRM, &mine, nullptr);
    }
    struct sigaction after {};
    sigaction(SIGALRM, nullptr, &after);
    EXPECT_EQ(after.sa_handler, &ApplicationAlarm);
    gApplicationAlarms.store(0);
    raise(SIGALRM);  // the default action would end this process
    EXPECT_EQ(gApplicationAlarms.load(), 1);

    // Without the application's handler, unloading restores what was there.
    sigaction(SIGALRM, &before, nullptr);
    { LoadedLibrary lib; }
    sigaction(SIGALRM, nullptr, &after);
    EXPECT_EQ(after.sa_handler, before.sa_handler);
}

// Unloading while threads wait inside the library, in every kind of wait that
// uses a wait node: every wait returns, saying it was cut short, before the
// library is gone.
TEST(RaceGuaranteesUnload, UnloadEndsEveryWaitInsideTheLibrary) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    auto lib = std::make_unique<LoadedLibrary>();
    ASSERT_TRUE(lib->ok()) << lib->error();
    const testsupport::QueltaApi api = lib->api();
    iKPusTimingEngine* engine = lib->engine();
    PalSemaphore* runtimeSemaphores[2] = {testsupport::NewRuntimeSemaphore(),
                                          testsupport::NewRuntimeSemaphore()};
    ClockTime mono, global;
    uint32_t generation = 0;
    engine->ReadMonotonic0(mono);
    engine->ReadGlobalWithGeneration(global, generation);
    const ClockTime monoFar = CT(U64(mono) + 60000 * kMs);
    const ClockTime globalFar = CT(U64(global) + 60000 * kMs);

    constexpr int kKinds = 4, kEach = 2;
    std::atomic<int> returned{0};
    std::vector<uint32_t> results(kKinds * kEach, 99);
    std::vector<std::thread> waiters;
    for (int i = 0; i < kKinds * kEach; ++i) {
        waiters.emplace_back([&, i] {
            switch (i % kKinds) {
                case 0: results[i] = api.EventWait(runtimeSemaphores[i / kKinds], 4000000); break;
                case 1: results[i] = api.EventWaitCallback(nullptr, &monoFar, nullptr, nullptr, 0, nullptr); break;
                case 2: results[i] = api.EventWaitCallback(nullptr, &globalFar, nullptr, nullptr, 1, nullptr); break;
                case 3: {
                    ClockTime after{};
                    api.WaitUntilGlobalClocks64(&globalFar, &results[i], &after, generation);
                    break;
                }
            }
            returned.fetch_add(1);
        });
    }
    usleep(100000);  // all of them blocked inside
    ASSERT_EQ(returned.load(), 0);
    const uint64_t t0 = MonoNowNs();
    lib.reset();  // the stop
    const uint64_t unloadTook = MonoNowNs() - t0;
    for (const uint64_t end = MonoNowNs() + 1000 * kMs; returned.load() < kKinds * kEach && MonoNowNs() < end;) {
        usleep(1000);
    }
    ASSERT_EQ(returned.load(), kKinds * kEach) << "waits not ended by the unload";
    for (std::thread& t : waiters) t.join();
    printf("unload with %d waiters inside took %.1f ms\n", kKinds * kEach, unloadTook / 1e6);
    for (int i = 0; i < kKinds * kEach; ++i) {
        SCOPED_TRACE(i);
        // Cut short by the unload: 3 from the event waits, abort flag 1 from
        // the global wait.
        EXPECT_EQ(results[i], i % kKinds == 3 ? 1u : 3u);
    }
    for (PalSemaphore* s : runtimeSemaphores) {
        EXPECT_EQ(Drain(s), 0) << "unloading posted the runtime's semaphore";
        testsupport::DeleteRuntimeSemaphore(s);
    }
}

// More threads blocked on runtime semaphores without a timeout than the
// library keeps a list of (two per wait node): the unload still ends every
// one of them, those it could not list included, before the library is gone.
struct UnlistedWaiter {
    testsupport::QueltaApi api;
    PalSemaphore* semaphore;
    std::atomic<int>* started;
    std::atomic<int>* returned;
    uint32_t result;
};

void* WaitWithoutTimeout(void* arg) {
    auto* w = static_cast<UnlistedWaiter*>(arg);
    w->started->fetch_add(1);
    w->result = w->api.EventWait(w->semaphore, 0xFFFFFFFFu);
    w->returned->fetch_add(1);
    return nullptr;
}

TEST(RaceGuaranteesUnload, UnloadEndsWaitsBeyondThoseItCanList) {
    auto lib = std::make_unique<LoadedLibrary>();
    ASSERT_TRUE(lib->ok()) << lib->error();
    // Each on a semaphore of its own: a wake of one listed semaphore's
    // waiters must not stand in for the others.
    constexpr int kWaiters = 2 * 128 + 8;
    std::atomic<int> started{0}, returned{0};
    std::vector<UnlistedWaiter> waiters;
    for (int i = 0; i < kWaiters; ++i) {
        waiters.push_back(UnlistedWaiter{lib->api(), testsupport::NewRuntimeSemaphore(), &started, &returned, 99});
    }
    std::vector<pthread_t> threads;
    pthread_attr_t small;
    pthread_attr_init(&small);
    pthread_attr_setstacksize(&small, 128 * 1024);  // 264 threads fit a 32-bit address space
    for (UnlistedWaiter& w : waiters) {
        pthread_t t;
        ASSERT_EQ(pthread_create(&t, &small, WaitWithoutTimeout, &w), 0);
        threads.push_back(t);
    }
    pthread_attr_destroy(&small);
    // Every thread on its way in (slow to start under an emulator), then a
    // moment for the last of them to block inside.
    for (const uint64_t end = MonoNowNs() + 10000 * kMs; started.load() < kWaiters && MonoNowNs() < end;) {
        usleep(1000);
    }
    ASSERT_EQ(started.load(), kWaiters);
    usleep(300000);
    ASSERT_EQ(returned.load(), 0);
    lib.reset();  // the stop
    for (const uint64_t end = MonoNowNs() + 2000 * kMs; returned.load() < kWaiters && MonoNowNs() < end;) {
        usleep(1000);
    }
    ASSERT_EQ(returned.load(), kWaiters) << "waits not ended by the unload";
    for (pthread_t t : threads) pthread_join(t, nullptr);
    for (const UnlistedWaiter& w : waiters) {
        EXPECT_EQ(w.result, 3u);
        EXPECT_EQ(Drain(w.semaphore), 0) << "unloading posted the runtime's semaphore";
        testsupport::DeleteRuntimeSemaphore(w.semaphore);
    }
}

}  // namespace
