// Platform layer: the bounded counting semaphore and the mutex helpers.
#include <gtest/gtest.h>

#include <signal.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalMutex.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {
namespace {

using std::chrono::milliseconds;

class PalSemaphoreTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() { ASSERT_EQ(PalInitialize(), 1u); }
    void SetUp() override { ASSERT_EQ(PalSemaphoreCreate(&sem_), 0); }
    void TearDown() override {
        EXPECT_EQ(sem_ == nullptr ? 0 : PalSemaphoreDestroy(sem_), 0);
    }
    // count and waiters, read under the semaphore's own mutex.
    std::pair<int32_t, int32_t> Counters() {
        pthread_mutex_lock(&sem_->mutex);
        const std::pair<int32_t, int32_t> c{sem_->count, sem_->waiters};
        pthread_mutex_unlock(&sem_->mutex);
        return c;
    }
    void AwaitWaiters(int32_t n) {
        while (Counters().second != n) std::this_thread::sleep_for(milliseconds(1));
    }
    PalSemaphore* sem_ = nullptr;
};

using Pair = std::pair<int32_t, int32_t>;

TEST_F(PalSemaphoreTest, WithNobodyWaitingAtMostOnePostIsKept) {
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);  // fresh: times out at once
    EXPECT_EQ(Counters(), Pair(0, 0));
    EXPECT_EQ(PalSemaphorePost(sem_) + PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);
}

// An unlimited and a minute-long waiter: signals do not end the wait, the
// first of two posts does (long before the minute), the second is kept.
TEST_F(PalSemaphoreTest, BlockedWaiterTakesOneOfTwoPostsAndSignalsDoNotWakeIt) {
    struct sigaction action {}, old{};
    action.sa_handler = [](int) {};
    sigemptyset(&action.sa_mask);
    sigaction(SIGUSR1, &action, &old);
    for (int32_t timeout : {-1, 60000}) {
        std::atomic<uint32_t> result{99};
        std::thread waiter([&] { result = PalSemaphoreWait(sem_, timeout); });
        AwaitWaiters(1);
        for (int i = 0; i < 10; ++i) {
            pthread_kill(waiter.native_handle(), SIGUSR1);
            std::this_thread::sleep_for(milliseconds(2));
        }
        EXPECT_EQ(result.load(), 99u);
        PalSemaphorePost(sem_);
        PalSemaphorePost(sem_);
        waiter.join();
        EXPECT_EQ(result.load(), 0u);
        EXPECT_EQ(Counters(), Pair(1, 0));
        EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    }
    sigaction(SIGUSR1, &old, nullptr);
}

// A sole waiter times out while posts arrive: it holds no post (result 1),
// and the count comes back within waiters + 1 by dropping only what is
// surplus. One post is kept for the next wait; of two, one is dropped. The
// posts are made by other threads, which queue on the semaphore's mutex
// (held here past the waiter's deadline) before the timed-out waiter does,
// so they land first: the mutex hands itself over in arrival order.
TEST_F(PalSemaphoreTest, AWaiterTimingOutDropsOnlySurplusPosts) {
    for (int posts : {1, 2}) {
        SCOPED_TRACE(posts);
        std::atomic<uint32_t> result{99};
        std::thread waiter([&] { result = PalSemaphoreWait(sem_, 300); });
        AwaitWaiters(1);
        pthread_mutex_lock(&sem_->mutex);
        std::vector<std::thread> posters;
        for (int i = 0; i < posts; ++i) posters.emplace_back([this] { PalSemaphorePost(sem_); });
        std::this_thread::sleep_for(milliseconds(700));  // the waiter's deadline passes
        pthread_mutex_unlock(&sem_->mutex);
        for (auto& t : posters) t.join();
        waiter.join();
        EXPECT_EQ(result.load(), 1u);
        EXPECT_EQ(Counters(), Pair(1, 0));
        EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    }
}

// Timed on CLOCK_MONOTONIC: never early on it.
TEST_F(PalSemaphoreTest, TimedWaitIsNeverEarly) {
    const uint64_t start = testsupport::MonoNowNs();
    EXPECT_EQ(PalSemaphoreWait(sem_, 150), 1u);
    const uint64_t elapsed = testsupport::MonoNowNs() - start;
    EXPECT_GE(elapsed, 150000000ull);
    EXPECT_LT(elapsed, 5000000000ull);
    EXPECT_EQ(Counters(), Pair(0, 0));
}

// Waiters (unlimited and timed, retried) against a poster: every wait is
// served and the bound holds whenever the poster looks.
TEST_F(PalSemaphoreTest, ConcurrentWaitersAreAllServed) {
    constexpr int kThreads = 4, kRounds = 300;
    std::atomic<int> served{0};
    std::vector<std::thread> waiters;
    for (int i = 0; i < kThreads; ++i) {
        waiters.emplace_back([&] {
            for (int r = 0; r < kRounds; served.fetch_add(1), ++r) {
                while (PalSemaphoreWait(sem_, (r & 1) ? 5 : -1) != 0) continue;
            }
        });
    }
    int outOfBounds = 0;
    while (served.load() < kThreads * kRounds) {
        PalSemaphorePost(sem_);
        const Pair c = Counters();
        if (c.first < 0 || c.first > c.second + 1) ++outOfBounds;
    }
    for (auto& t : waiters) t.join();
    EXPECT_EQ(outOfBounds, 0);
    EXPECT_LE(Counters().first, 1);
}

TEST_F(PalSemaphoreTest, CreateAndDestroyFailures) {
    EXPECT_EQ(PalSemaphoreDestroy(nullptr), 22);
    PalSemaphorePost(sem_);
    EXPECT_EQ(PalSemaphoreDestroy(sem_), 0);  // takes the pending post
    sem_ = nullptr;

    auto* const untouched = reinterpret_cast<PalSemaphore*>(0x1234);
    PalSemaphore* out = untouched;
    gPalAllocFailCountdown = 1;
    EXPECT_EQ(PalSemaphoreCreate(&out), 12);
    EXPECT_EQ(out, untouched);

    // A mutex attribute the system refuses (priority-protected and robust):
    // the error comes back and nothing half-made is handed out.
    pthread_mutexattr_setprotocol(&gMutexAttr, PTHREAD_PRIO_PROTECT);
    pthread_mutexattr_setrobust(&gMutexAttr, PTHREAD_MUTEX_ROBUST);
    pthread_mutex_t probe;
    const int refused = pthread_mutex_init(&probe, &gMutexAttr);
    pthread_mutex_t* mutex = nullptr;
    if (refused != 0) {
        EXPECT_EQ(PalSemaphoreCreate(&out), refused);
        EXPECT_EQ(PALCreateMutexInternal(&mutex), refused);
        EXPECT_TRUE(out == nullptr && mutex == nullptr);
    } else {
        pthread_mutex_destroy(&probe);
    }
    ASSERT_EQ(PalInitialize(), 1u);  // the priority-inheriting attribute again
}

TEST(PalMutex, TimedLockResults) {
    ASSERT_EQ(PalInitialize(), 1u);
    pthread_mutex_t* mutex = nullptr;
    gPalAllocFailCountdown = 1;
    EXPECT_EQ(PALCreateMutexInternal(&mutex), 12);
    EXPECT_EQ(mutex, nullptr);
    ASSERT_EQ(PALCreateMutexInternal(&mutex), 0);
    std::atomic<int> stage{0};
    std::thread owner([&] {
        pthread_mutex_lock(mutex);
        for (stage = 1; stage != 2;) std::this_thread::sleep_for(milliseconds(1));
        std::this_thread::sleep_for(milliseconds(30));
        pthread_mutex_unlock(mutex);
    });
    while (stage != 1) std::this_thread::yield();
    EXPECT_EQ(PalLockMutexTimed(mutex, 40), 1);
    stage = 2;
    EXPECT_EQ(PalLockMutexTimed(mutex, -1), 0);  // waits for the owner
    pthread_mutex_unlock(mutex);
    owner.join();
    pthread_mutex_destroy(mutex);
    PalMemFree(mutex);

    pthread_mutex_t own = PTHREAD_ERRORCHECK_MUTEX_INITIALIZER_NP;  // relocking it: EDEADLK
    pthread_mutex_lock(&own);
    EXPECT_EQ(PalLockMutexTimed(&own, 10), 2);
    pthread_mutex_unlock(&own);
}

}  // namespace
}  // namespace quelta
