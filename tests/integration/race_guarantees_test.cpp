// The promises only races can break, through the loaded library.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <memory>
#include <thread>
#include <vector>

#include "LibraryFixture.h"
#include "TestSupport.h"

using testsupport::CT, testsupport::Drain, testsupport::Eventually, testsupport::LoadedLibrary, testsupport::MonoNowNs,
    testsupport::U64;

namespace {

constexpr uint64_t kUs = 1000, kMs = 1000000;

class RaceGuarantees : public testsupport::LibraryFixture {
protected:
    void SetUp() override {
        LibraryFixture::SetUp();
        if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    }
};

// A post from 150 us before to 90 us after a 300 us timeout is what the wait
// returned 0 for, or still pending: never gone, never doubled by the timeout.
TEST_F(RaceGuarantees, EventWaitNeitherLosesNorInventsAPostAtItsTimeout) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    int lost = 0, invented = 0;
    for (int round = 0; round < 1500; ++round) {
        const uint64_t postAt = MonoNowNs() + 150 * kUs + (round % 241) * kUs;
        std::thread poster([&] {
            const timespec ts{static_cast<time_t>(postAt / 1000000000u), static_cast<long>(postAt % 1000000000u)};
            while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr) == EINTR) {}
            quelta::PalSemaphorePost(s);
        });
        const uint32_t r = api().EventWait(s, 300);
        poster.join();
        ASSERT_TRUE(r == 0 || r == 1) << r;
        const int accounted = (r == 0) + Drain(s);
        lost += accounted < 1;
        invented += accounted > 1;
    }
    EXPECT_EQ(lost, 0) << "posts taken back by the library";
    EXPECT_EQ(invented, 0) << "posts the library left behind";
    testsupport::DeleteRuntimeSemaphore(s);
}

std::atomic<uint64_t> gCallbackAt{0};
void RecordCallbackTime(void*) { gCallbackAt.store(MonoNowNs()); }

// A double release's diagnostic to a full stderr pipe blocks its caller and
// nothing else: a callback due meanwhile runs on time.
TEST_F(RaceGuarantees, ACallerBlockedWritingADiagnosticHoldsUpNoTick) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    const ClockTime far = CT(MonoNow() + 60000 * kMs);
    WaitNode* node = nullptr;
    ASSERT_EQ(api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &node), 0u);
    engine()->ReleaseWait(node);
    int fds[2];
    char block[4096] = {};
    ASSERT_EQ(pipe2(fds, O_NONBLOCK), 0);
    while (write(fds[1], block, sizeof block) > 0) {}
    fcntl(fds[1], F_SETFL, 0), fflush(stderr);
    const int savedStderr = dup(2);
    dup2(fds[1], 2);
    std::atomic<bool> releaseDone{false}, armed{false};
    std::thread releaser([&] { engine()->ReleaseWait(node), releaseDone = true; });  // refused, with a line
    usleep(20000);
    gCallbackAt = 0, api().SetCallback(&RecordCallbackTime, nullptr);
    const uint64_t due = MonoNow() + 5 * kMs;
    std::thread setter([&] { const ClockTime when = CT(due); api().SetCallbackTime(&when, 0), armed = true; });
    const bool fired = Eventually([] { return gCallbackAt.load() != 0; }, 500 * kMs);
    const bool releaserStillBlocked = !releaseDone.load();
    dup2(savedStderr, 2), close(savedStderr);
    for (; !releaseDone.load(); usleep(1000)) while (read(fds[0], block, sizeof block) > 0) {}
    releaser.join(), setter.join(), close(fds[0]), close(fds[1]);
    api().SetCallback(nullptr, nullptr);
    EXPECT_TRUE(releaserStillBlocked) << "the diagnostic did not block: the test proves nothing";
    EXPECT_TRUE(armed.load());
    ASSERT_TRUE(fired) << "no callback while a caller was blocked writing to standard error";
    EXPECT_GE(gCallbackAt.load(), due);
    testsupport::DeleteRuntimeSemaphore(s);
}

std::atomic<int> gApplicationAlarms{0};
void ApplicationAlarm(int) { gApplicationAlarms.fetch_add(1); }

// The library puts back the SIGALRM action it found only while its own is
// still installed.
TEST(RaceGuaranteesUnload, UnloadLeavesTheApplicationsAlarmHandlerInPlace) {
    auto lib = std::make_unique<LoadedLibrary>();
    ASSERT_TRUE(lib->ok()) << lib->error();
    testsupport::ScopedAlarmHandler mine(&ApplicationAlarm);
    lib.reset();
    struct sigaction after {};
    sigaction(SIGALRM, nullptr, &after);
    EXPECT_EQ(after.sa_handler, &ApplicationAlarm);
    raise(SIGALRM);  // the default action would end this process
    EXPECT_EQ(gApplicationAlarms.load(), 1);
}

struct Waiter {
    int kind;  // event wait: 0 without, 4 with a timeout; 1 own-semaphore, 2 global-deadline node, 3 global wait
    std::atomic<int>*started, *returned;
    const testsupport::QueltaApi* api;
    ClockTime monoFar, globalFar;
    uint32_t generation;
    PalSemaphore* semaphore = testsupport::NewRuntimeSemaphore();
    uint32_t result = 99;
    pid_t tid = 0;  // written before `started` counts it
};
// Every waiter asleep in the kernel (state S), as one blocked inside the library is.
bool AllAsleep(const std::vector<std::unique_ptr<Waiter>>& waiters) {
    for (const auto& w : waiters) {
        char path[64], state = '?';
        std::snprintf(path, sizeof path, "/proc/self/task/%d/stat", static_cast<int>(w->tid));
        FILE* f = std::fopen(path, "r");
        const bool read = f != nullptr && std::fscanf(f, "%*d (%*[^)]) %c", &state) == 1;
        if (f != nullptr) std::fclose(f);
        if (!read || state != 'S') return false;
    }
    return true;
}
void* RunWaiter(void* arg) {
    auto* w = static_cast<Waiter*>(arg);
    ClockTime after{};
    w->tid = static_cast<pid_t>(syscall(SYS_gettid));
    w->started->fetch_add(1);
    switch (w->kind) {
        case 0: w->result = w->api->EventWait(w->semaphore, 0xFFFFFFFFu); break;
        case 1: w->result = w->api->EventWaitCallback(nullptr, &w->monoFar, nullptr, nullptr, 0, nullptr); break;
        case 2: w->result = w->api->EventWaitCallback(nullptr, &w->globalFar, nullptr, nullptr, 1, nullptr); break;
        case 3: w->api->WaitUntilGlobalClocks64(&w->globalFar, &w->result, &after, w->generation); break;
        case 4: w->result = w->api->EventWait(w->semaphore, 4000000); break;
    }
    w->returned->fetch_add(1);
    return nullptr;
}

// Unloading with threads blocked inside in every kind of node wait, and more
// runtime-semaphore waiters (each on its own semaphore) than the library can
// list (two per node): every wait returns cut short (3; abort flag 1 for the
// global wait) before the library is gone, and no semaphore is posted.
TEST(RaceGuaranteesUnload, UnloadEndsEveryWaitInsideTheLibrary) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    auto lib = std::make_unique<LoadedLibrary>();
    ASSERT_TRUE(lib->ok()) << lib->error();
    ClockTime mono, global;
    uint32_t generation = 0;
    lib->engine()->ReadMonotonic0(mono), lib->engine()->ReadGlobalWithGeneration(global, generation);
    constexpr int kUnlisted = 2 * 128 + 8, kWaiters = kUnlisted + 8;
    std::atomic<int> started{0}, returned{0};
    std::vector<std::unique_ptr<Waiter>> waiters;
    for (int i = 0; i < kWaiters; ++i)
        waiters.emplace_back(new Waiter{i < kUnlisted ? 0 : 1 + i % 4, &started, &returned, &lib->api(),
                                        CT(U64(mono) + 60000 * kMs), CT(U64(global) + 60000 * kMs), generation});
    std::vector<pthread_t> threads(kWaiters);
    pthread_attr_t small;
    pthread_attr_init(&small), pthread_attr_setstacksize(&small, 128 * 1024);  // 272 fit a 32-bit address space
    for (int i = 0; i < kWaiters; ++i) ASSERT_EQ(pthread_create(&threads[i], &small, RunWaiter, waiters[i].get()), 0);
    pthread_attr_destroy(&small);
    ASSERT_TRUE(Eventually([&] { return started.load() == kWaiters; }, 10000 * kMs));  // slow under an emulator
    int asleep = 0;  // in three looks 50 ms apart: inside, not on the way in
    for (int polls = 0; asleep < 3 && polls < 400; ++polls, usleep(50000)) asleep = AllAsleep(waiters) ? asleep + 1 : 0;
    ASSERT_EQ(asleep, 3) << "the waiters never all blocked";
    ASSERT_EQ(returned.load(), 0);
    lib.reset();  // the stop
    ASSERT_TRUE(Eventually([&] { return returned.load() == kWaiters; }, 2000 * kMs)) << "waits not ended by the unload";
    for (pthread_t t : threads) pthread_join(t, nullptr);
    for (auto& w : waiters) {
        EXPECT_EQ(w->result, w->kind == 3 ? 1u : 3u) << "kind " << w->kind;
        EXPECT_EQ(Drain(w->semaphore), 0) << "unloading posted the runtime's semaphore";
        testsupport::DeleteRuntimeSemaphore(w->semaphore);
    }
}

}  // namespace
