// Platform layer: the bounded counting semaphore and the mutex helpers.
#include <gtest/gtest.h>

#include <errno.h>
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

struct Counters {
    int32_t count;
    int32_t waiters;
};

Counters Read(PalSemaphore* s) {
    pthread_mutex_lock(&s->mutex);
    const Counters c{s->count, s->waiters};
    pthread_mutex_unlock(&s->mutex);
    return c;
}

// Waits (polling) until `n` threads are blocked inside the wait.
void AwaitWaiters(PalSemaphore* s, int32_t n) {
    while (Read(s).waiters != n) std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

// Every case starts from a ready platform layer and a fresh semaphore.
class PalSemaphoreTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() { ASSERT_EQ(PalInitialize(), 1u); }
    void SetUp() override { ASSERT_EQ(PalSemaphoreCreate(&sem_), 0); }
    void TearDown() override {
        if (sem_ != nullptr) {
            EXPECT_EQ(PalSemaphoreDestroy(sem_), 0);
        }
    }
    PalSemaphore* sem_ = nullptr;
};

TEST_F(PalSemaphoreTest, FreshSemaphoreTimesOutAtOnceAndStaysEmpty) {
    const uint64_t start = testsupport::MonoNowNs();
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);
    EXPECT_LT(testsupport::MonoNowNs() - start, 50000000ull);
    const Counters c = Read(sem_);
    EXPECT_EQ(c.count, 0);
    EXPECT_EQ(c.waiters, 0);
}

TEST_F(PalSemaphoreTest, WithNobodyWaitingOnlyOnePostIsRemembered) {
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    EXPECT_EQ(Read(sem_).count, 1);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);
}

TEST_F(PalSemaphoreTest, BlockedWaiterTakesOnePostAndOneRemains) {
    std::atomic<uint32_t> result{99};
    std::thread waiter([&] { result = PalSemaphoreWait(sem_, -1); });
    AwaitWaiters(sem_, 1);
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    waiter.join();
    EXPECT_EQ(result.load(), 0u);
    const Counters c = Read(sem_);
    EXPECT_EQ(c.count, 1);
    EXPECT_EQ(c.waiters, 0);
}

TEST_F(PalSemaphoreTest, TimedOutSoleWaiterTrimsTwoPendingPostsToOne) {
    std::atomic<uint32_t> result{99};
    std::thread waiter([&] { result = PalSemaphoreWait(sem_, 30); });
    AwaitWaiters(sem_, 1);
    // Hold the semaphore's mutex across the waiter's deadline, so that its
    // wait has timed out before it can look at the count, and let two posts
    // arrive meanwhile (what two posts do with one waiter: count 0 -> 1 -> 2).
    pthread_mutex_lock(&sem_->mutex);
    std::this_thread::sleep_for(std::chrono::milliseconds(80));
    ASSERT_EQ(sem_->waiters, 1);
    sem_->count = 2;
    pthread_mutex_unlock(&sem_->mutex);
    waiter.join();
    EXPECT_EQ(result.load(), 1u);  // timed out: the posts are not taken
    const Counters c = Read(sem_);
    EXPECT_EQ(c.count, 1);  // back within waiters + 1
    EXPECT_EQ(c.waiters, 0);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);
}

TEST_F(PalSemaphoreTest, TimedWaitIsNeverEarlyOnTheMonotonicClock) {
    clockid_t clock = -1;
    ASSERT_EQ(pthread_condattr_getclock(&gCondAttr, &clock), 0);
    EXPECT_EQ(clock, CLOCK_MONOTONIC);
    for (int32_t ms : {150, 1, 1001}) {
        const uint64_t start = testsupport::MonoNowNs();
        EXPECT_EQ(PalSemaphoreWait(sem_, ms), 1u);
        const uint64_t elapsed = testsupport::MonoNowNs() - start;
        EXPECT_GE(elapsed, ms * 1000000ull) << ms;
        EXPECT_LT(elapsed, ms * 1000000ull + 50000000ull) << ms;
        const Counters c = Read(sem_);
        EXPECT_EQ(c.waiters, 0);
        EXPECT_EQ(c.count, 0);
    }
}

TEST_F(PalSemaphoreTest, PostEndsATimedWaitEarly) {
    std::atomic<uint32_t> result{99};
    std::atomic<uint64_t> elapsed{0};
    std::thread waiter([&] {
        const uint64_t start = testsupport::MonoNowNs();
        result = PalSemaphoreWait(sem_, 10000);
        elapsed = testsupport::MonoNowNs() - start;
    });
    AwaitWaiters(sem_, 1);
    EXPECT_EQ(PalSemaphorePost(sem_), 0);
    waiter.join();
    EXPECT_EQ(result.load(), 0u);
    EXPECT_LT(elapsed.load(), 5000000000ull);
    EXPECT_EQ(Read(sem_).count, 0);
}

TEST_F(PalSemaphoreTest, SignalsDoNotEndAWait) {
    struct sigaction action {}, old{};
    action.sa_handler = [](int) {};
    sigemptyset(&action.sa_mask);
    ASSERT_EQ(sigaction(SIGUSR1, &action, &old), 0);
    std::atomic<uint32_t> result{99};
    std::atomic<bool> done{false};
    std::thread waiter([&] {
        result = PalSemaphoreWait(sem_, -1);
        done = true;
    });
    AwaitWaiters(sem_, 1);
    for (int i = 0; i < 20; ++i) {
        pthread_kill(waiter.native_handle(), SIGUSR1);
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    EXPECT_FALSE(done.load());
    EXPECT_EQ(Read(sem_).waiters, 1);
    PalSemaphorePost(sem_);
    waiter.join();
    EXPECT_EQ(result.load(), 0u);
    sigaction(SIGUSR1, &old, nullptr);
}

// Many waiters and a poster: every wait is served, none is lost, and the
// bound holds at every moment the poster looks.
TEST_F(PalSemaphoreTest, ConcurrentWaitersAreAllServed) {
    constexpr int kThreads = 4;
    constexpr int kRounds = 500;
    std::atomic<int> served{0};
    std::vector<std::thread> waiters;
    for (int i = 0; i < kThreads; ++i) {
        waiters.emplace_back([&] {
            for (int r = 0; r < kRounds; ++r) {
                // Alternate unlimited and timed waits; retry timed-out ones.
                while (PalSemaphoreWait(sem_, (r & 1) ? 5 : -1) != 0) {
                }
                served.fetch_add(1);
            }
        });
    }
    int outOfBounds = 0;
    while (served.load() < kThreads * kRounds) {
        PalSemaphorePost(sem_);
        const Counters c = Read(sem_);
        if (c.count > c.waiters + 1 || c.count < 0) ++outOfBounds;
        if ((served.load() & 7) == 0) std::this_thread::yield();
    }
    for (auto& t : waiters) t.join();
    EXPECT_EQ(outOfBounds, 0);
    const Counters c = Read(sem_);
    EXPECT_EQ(c.waiters, 0);
    EXPECT_LE(c.count, 1);
}

TEST_F(PalSemaphoreTest, DestroyRulesAndPendingPost) {
    EXPECT_EQ(PalSemaphoreDestroy(nullptr), 22);
    ASSERT_EQ(PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphoreDestroy(sem_), 0);  // consumes the post
    sem_ = nullptr;
}

TEST_F(PalSemaphoreTest, CreateWithoutMemoryLeavesOutUntouched) {
    PalSemaphore* out = reinterpret_cast<PalSemaphore*>(0x1234);
    const uint32_t before = gPalAllocCount.load();
    gPalAllocFailCountdown = 1;
    EXPECT_EQ(PalSemaphoreCreate(&out), 12);
    EXPECT_EQ(out, reinterpret_cast<PalSemaphore*>(0x1234));
    EXPECT_EQ(gPalAllocFailCountdown.load(), 0);
    // One allocation per semaphore, and nothing on the wait and post paths.
    PalSemaphore* other = nullptr;
    const uint32_t mid = gPalAllocCount.load();
    EXPECT_EQ(mid - before, 1u);
    ASSERT_EQ(PalSemaphoreCreate(&other), 0);
    EXPECT_EQ(gPalAllocCount.load() - mid, 1u);
    PalSemaphorePost(other);
    PalSemaphoreWait(other, 0);
    PalSemaphoreWait(other, 1);
    EXPECT_EQ(gPalAllocCount.load() - mid, 1u);
    EXPECT_EQ(PalSemaphoreDestroy(other), 0);
}

// Makes pthread_mutex_init refuse gMutexAttr (a priority-protected robust
// mutex is not supported by the system's threads library); returns the error
// it then reports, or 0 when this system accepts such a mutex after all.
int BreakMutexAttr() {
    pthread_mutexattr_setprotocol(&gMutexAttr, PTHREAD_PRIO_PROTECT);
    pthread_mutexattr_setrobust(&gMutexAttr, PTHREAD_MUTEX_ROBUST);
    pthread_mutex_t probe;
    const int result = pthread_mutex_init(&probe, &gMutexAttr);
    if (result == 0) pthread_mutex_destroy(&probe);
    return result;
}

TEST_F(PalSemaphoreTest, FailedMutexInitLeavesNoHalfBuiltObject) {
    const int expected = BreakMutexAttr();
    if (expected == 0) {
        ASSERT_EQ(PalInitialize(), 1u);
        GTEST_SKIP() << "this system initialises every mutex attribute we can break";
    }
    PalSemaphore* sem = reinterpret_cast<PalSemaphore*>(0x1234);
    EXPECT_EQ(PalSemaphoreCreate(&sem), expected);
    EXPECT_EQ(sem, nullptr);
    pthread_mutex_t* mutex = reinterpret_cast<pthread_mutex_t*>(0x1234);
    EXPECT_EQ(PALCreateMutexInternal(&mutex), expected);
    EXPECT_EQ(mutex, nullptr);
    ASSERT_EQ(PalInitialize(), 1u);  // restores the priority-inheriting attribute
}

TEST(PalPrecondition, CreatingBeforeInitializeTrapsAndReturnsEinval) {
    static std::atomic<int> traps{0};
    struct sigaction action {}, old{};
    action.sa_handler = [](int) { traps.fetch_add(1); };
    sigemptyset(&action.sa_mask);
    ASSERT_EQ(sigaction(SIGTRAP, &action, &old), 0);
    const uint32_t ready = gPalReady.load();
    gPalReady = 0;

    PalSemaphore* sem = reinterpret_cast<PalSemaphore*>(0x1234);
    EXPECT_EQ(PalSemaphoreCreate(&sem), 22);
    EXPECT_EQ(sem, reinterpret_cast<PalSemaphore*>(0x1234));
    pthread_mutex_t* mutex = reinterpret_cast<pthread_mutex_t*>(0x1234);
    EXPECT_EQ(PALCreateMutexInternal(&mutex), 22);
    EXPECT_EQ(mutex, reinterpret_cast<pthread_mutex_t*>(0x1234));
    EXPECT_EQ(traps.load(), 2);

    gPalReady = ready;
    sigaction(SIGTRAP, &old, nullptr);
}

class PalMutexTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() { ASSERT_EQ(PalInitialize(), 1u); }
    void SetUp() override { ASSERT_EQ(PALCreateMutexInternal(&mutex_), 0); }
    void TearDown() override {
        pthread_mutex_destroy(mutex_);
        PalMemFree(mutex_);
    }
    pthread_mutex_t* mutex_ = nullptr;
};

TEST_F(PalMutexTest, CreatedMutexInheritsPriorityAndLocks) {
    ASSERT_NE(mutex_, nullptr);
    EXPECT_EQ(PalLockMutexTimed(mutex_, 0), 0);
    EXPECT_EQ(pthread_mutex_unlock(mutex_), 0);
    int protocol = -1;
    ASSERT_EQ(pthread_mutexattr_getprotocol(&gMutexAttr, &protocol), 0);
    EXPECT_EQ(protocol, PTHREAD_PRIO_INHERIT);
}

TEST_F(PalMutexTest, UnlimitedLockWaitsForTheOwner) {
    std::atomic<bool> held{false};
    std::thread owner([&] {
        pthread_mutex_lock(mutex_);
        held = true;
        std::this_thread::sleep_for(std::chrono::milliseconds(60));
        pthread_mutex_unlock(mutex_);
    });
    while (!held) std::this_thread::yield();
    const uint64_t start = testsupport::MonoNowNs();
    EXPECT_EQ(PalLockMutexTimed(mutex_, -1), 0);
    EXPECT_GE(testsupport::MonoNowNs() - start, 30000000ull);
    pthread_mutex_unlock(mutex_);
    owner.join();
}

TEST_F(PalMutexTest, TimedLockTimesOutWhileHeld) {
    std::atomic<int> stage{0};
    std::thread owner([&] {
        pthread_mutex_lock(mutex_);
        stage = 1;
        while (stage != 2) std::this_thread::sleep_for(std::chrono::milliseconds(1));
        pthread_mutex_unlock(mutex_);
    });
    while (stage != 1) std::this_thread::yield();
    const uint64_t start = testsupport::MonoNowNs();
    EXPECT_EQ(PalLockMutexTimed(mutex_, 40), 1);
    const uint64_t elapsed = testsupport::MonoNowNs() - start;
    EXPECT_GE(elapsed, 39000000ull);  // measured against the wall clock: allow its slew
    EXPECT_LT(elapsed, 40000000ull + 50000000ull);
    stage = 2;
    owner.join();
}

TEST(PalMutexErrors, OtherFailuresMapToTwoAndNoMemoryToTwelve) {
    ASSERT_EQ(PalInitialize(), 1u);
    pthread_mutexattr_t attr;
    pthread_mutexattr_init(&attr);
    pthread_mutexattr_settype(&attr, PTHREAD_MUTEX_ERRORCHECK);
    pthread_mutex_t mutex;
    pthread_mutex_init(&mutex, &attr);
    pthread_mutex_lock(&mutex);
    EXPECT_EQ(PalLockMutexTimed(&mutex, 10), 2);  // EDEADLK: relock by the owner
    EXPECT_EQ(PalLockMutexTimed(&mutex, -1), 2);
    pthread_mutex_unlock(&mutex);
    pthread_mutex_destroy(&mutex);
    pthread_mutexattr_destroy(&attr);

    pthread_mutex_t* out = reinterpret_cast<pthread_mutex_t*>(0x1234);
    gPalAllocFailCountdown = 1;
    EXPECT_EQ(PALCreateMutexInternal(&out), 12);
    EXPECT_EQ(out, nullptr);
}

}  // namespace
}  // namespace quelta
