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
        if (sem_ != nullptr) {
            EXPECT_EQ(PalSemaphoreDestroy(sem_), 0);
        }
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
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);
}

TEST_F(PalSemaphoreTest, BlockedWaiterTakesOneOfTwoPostsAndSignalsDoNotWakeIt) {
    struct sigaction action {}, old{};
    action.sa_handler = [](int) {};
    sigemptyset(&action.sa_mask);
    sigaction(SIGUSR1, &action, &old);
    std::atomic<uint32_t> result{99};
    std::thread waiter([&] { result = PalSemaphoreWait(sem_, -1); });
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
    sigaction(SIGUSR1, &old, nullptr);
}

TEST_F(PalSemaphoreTest, TimedOutSoleWaiterTrimsTwoPostsToOne) {
    std::atomic<uint32_t> result{99};
    std::thread waiter([&] { result = PalSemaphoreWait(sem_, 30); });
    AwaitWaiters(1);
    // Hold the mutex past the waiter's deadline and let two posts land
    // meanwhile (count 0 -> 1 -> 2 with one waiter): the wait has timed out
    // before it sees them.
    pthread_mutex_lock(&sem_->mutex);
    std::this_thread::sleep_for(milliseconds(80));
    sem_->count = 2;
    pthread_mutex_unlock(&sem_->mutex);
    waiter.join();
    EXPECT_EQ(result.load(), 1u);
    EXPECT_EQ(Counters(), Pair(1, 0));
}

TEST_F(PalSemaphoreTest, TimedWaitIsNeverEarlyAndAPostEndsIt) {
    const uint64_t start = testsupport::MonoNowNs();
    EXPECT_EQ(PalSemaphoreWait(sem_, 150), 1u);
    const uint64_t elapsed = testsupport::MonoNowNs() - start;
    EXPECT_GE(elapsed, 150000000ull);
    EXPECT_LT(elapsed, 200000000ull);
    EXPECT_EQ(Counters(), Pair(0, 0));

    std::atomic<uint32_t> result{99};
    std::thread waiter([&] { result = PalSemaphoreWait(sem_, 60000); });
    AwaitWaiters(1);
    PalSemaphorePost(sem_);
    waiter.join();  // long before the minute
    EXPECT_EQ(result.load(), 0u);
}

// Waiters (unlimited and timed, retried) against a poster: every wait is
// served and the bound holds whenever the poster looks.
TEST_F(PalSemaphoreTest, ConcurrentWaitersAreAllServed) {
    constexpr int kThreads = 4, kRounds = 300;
    std::atomic<int> served{0};
    std::vector<std::thread> waiters;
    for (int i = 0; i < kThreads; ++i) {
        waiters.emplace_back([&] {
            for (int r = 0; r < kRounds; ++r) {
                while (PalSemaphoreWait(sem_, (r & 1) ? 5 : -1) != 0) {
                }
                served.fetch_add(1);
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
    if (refused != 0) {
        EXPECT_EQ(PalSemaphoreCreate(&out), refused);
        EXPECT_EQ(out, nullptr);
        pthread_mutex_t* mutex = nullptr;
        EXPECT_EQ(PALCreateMutexInternal(&mutex), refused);
        EXPECT_EQ(mutex, nullptr);
    } else {
        pthread_mutex_destroy(&probe);
    }
    ASSERT_EQ(PalInitialize(), 1u);  // the priority-inheriting attribute again

    // Before PalInitialize: SIGTRAP, then 22 with the out-pointer untouched.
    static std::atomic<int> traps{0};
    struct sigaction action {}, old{};
    action.sa_handler = [](int) { traps.fetch_add(1); };
    sigemptyset(&action.sa_mask);
    sigaction(SIGTRAP, &action, &old);
    gPalReady = 0;
    out = untouched;
    EXPECT_EQ(PalSemaphoreCreate(&out), 22);
    EXPECT_EQ(out, untouched);
    auto* mutex = reinterpret_cast<pthread_mutex_t*>(0x1234);
    EXPECT_EQ(PALCreateMutexInternal(&mutex), 22);
    EXPECT_EQ(mutex, reinterpret_cast<pthread_mutex_t*>(0x1234));
    EXPECT_EQ(traps.load(), 2);
    gPalReady = 1;
    sigaction(SIGTRAP, &old, nullptr);
}

TEST(PalMutex, TimedLockResults) {
    ASSERT_EQ(PalInitialize(), 1u);
    pthread_mutex_t* mutex = nullptr;
    ASSERT_EQ(PALCreateMutexInternal(&mutex), 0);
    std::atomic<int> stage{0};
    std::thread owner([&] {
        pthread_mutex_lock(mutex);
        stage = 1;
        while (stage != 2) std::this_thread::sleep_for(milliseconds(1));
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

    pthread_mutexattr_t attr;  // relocking an error-checking mutex: EDEADLK
    pthread_mutexattr_init(&attr);
    pthread_mutexattr_settype(&attr, PTHREAD_MUTEX_ERRORCHECK);
    pthread_mutex_t own;
    pthread_mutex_init(&own, &attr);
    pthread_mutex_lock(&own);
    EXPECT_EQ(PalLockMutexTimed(&own, 10), 2);
    pthread_mutex_unlock(&own);
    pthread_mutex_destroy(&own);

    gPalAllocFailCountdown = 1;
    EXPECT_EQ(PALCreateMutexInternal(&mutex), 12);
    EXPECT_EQ(mutex, nullptr);
}

}  // namespace
}  // namespace quelta
