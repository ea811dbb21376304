// Platform layer: the bounded counting semaphore, mutexes, start-up and CPU
// sets, affinity, the precondition trap, sleeping, diagnostics, thread keys.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <atomic>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "TestSupport.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalMutex.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {
namespace {

using Pair = std::pair<int32_t, int32_t>;
class PalSemaphoreTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(PalInitialize() == 1u && PalSemaphoreCreate(&sem_) == 0); }
    void TearDown() override { EXPECT_EQ(sem_ == nullptr ? 0 : PalSemaphoreDestroy(sem_), 0); }
    Pair Counters() {  // count and waiters, under the semaphore's own mutex
        pthread_mutex_lock(&sem_->mutex);
        const Pair c{sem_->count, sem_->waiters};
        return pthread_mutex_unlock(&sem_->mutex), c;
    }
    void AwaitWaiters(int32_t n) { while (Counters().second != n) usleep(1000); }
    PalSemaphore* sem_ = nullptr;
};

// With nobody waiting at most one post is kept; a timed wait is never early.
TEST_F(PalSemaphoreTest, AtMostOnePostIsKeptAndTimedWaitsAreNeverEarly) {
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 1u);
    EXPECT_EQ(PalSemaphorePost(sem_) + PalSemaphorePost(sem_), 0);
    EXPECT_EQ(PalSemaphoreWait(sem_, 0), 0u);
    const uint64_t start = testsupport::MonoNowNs();
    EXPECT_EQ(PalSemaphoreWait(sem_, 150), 1u);
    EXPECT_TRUE(testsupport::MonoNowNs() - start >= 150000000ull && Counters() == Pair(0, 0));
}

// A blocked waiter (unlimited, a minute): signals do not end the wait, the
// first of two posts does, the second is kept. A waiter timing out while
// posts arrive (queued on the mutex, held here past its deadline, so they
// land first) holds no post, and only the surplus beyond one is dropped.
TEST_F(PalSemaphoreTest, WaitersTakeOnePostAndATimedOutOneDropsOnlySurplus) {
    struct sigaction action {}, old{};
    action.sa_handler = [](int) {};
    sigaction(SIGUSR1, &action, &old);
    struct Row { int32_t timeout; int posts; uint32_t result; };
    for (const Row& row : {Row{-1, 2, 0}, Row{60000, 2, 0}, Row{300, 1, 1}, Row{300, 2, 1}}) {
        std::atomic<uint32_t> result{99};
        std::thread waiter([&] { result = PalSemaphoreWait(sem_, row.timeout); });
        AwaitWaiters(1);
        std::vector<std::thread> posters;
        if (row.result == 0) {
            for (int i = 0; i < 10; ++i) pthread_kill(waiter.native_handle(), SIGUSR1), usleep(2000);
            EXPECT_EQ(result.load(), 99u);
            for (int i = 0; i < row.posts; ++i) PalSemaphorePost(sem_);
        } else {
            pthread_mutex_lock(&sem_->mutex);
            for (int i = 0; i < row.posts; ++i) posters.emplace_back([this] { PalSemaphorePost(sem_); });
            usleep(700000);
            pthread_mutex_unlock(&sem_->mutex);
        }
        for (auto& t : posters) t.join();
        waiter.join();
        EXPECT_TRUE(result.load() == row.result && Counters() == Pair(1, 0) && PalSemaphoreWait(sem_, 0) == 0u)
            << row.timeout << " ms, " << row.posts << " posts";
    }
    sigaction(SIGUSR1, &old, nullptr);
}

// Failures come back as error numbers with nothing half-made handed out;
// destroying takes a pending post. PalLockMutexTimed: 1 on timeout, 0 once
// had (-1: no limit), 2 on an error.
TEST_F(PalSemaphoreTest, CreateDestroyAndTimedLockResults) {
    EXPECT_EQ(PalSemaphoreDestroy(nullptr), 22);
    PalSemaphorePost(sem_);
    EXPECT_EQ(PalSemaphoreDestroy(std::exchange(sem_, nullptr)), 0);
    PalSemaphore* out = reinterpret_cast<PalSemaphore*>(0x1234);
    pthread_mutex_t* mutex = nullptr;
    gPalAllocFailCountdown = 1;
    EXPECT_TRUE(PalSemaphoreCreate(&out) == 12 && out == reinterpret_cast<PalSemaphore*>(0x1234));
    gPalAllocFailCountdown = 1;
    EXPECT_TRUE(PALCreateMutexInternal(&mutex) == 12 && mutex == nullptr);
    // A mutex attribute the system refuses (priority-protected and robust).
    pthread_mutexattr_setprotocol(&gMutexAttr, PTHREAD_PRIO_PROTECT);
    pthread_mutexattr_setrobust(&gMutexAttr, PTHREAD_MUTEX_ROBUST);
    EXPECT_TRUE(PalSemaphoreCreate(&out) != 0 && PALCreateMutexInternal(&mutex) != 0 && out == nullptr && mutex == nullptr);
    ASSERT_EQ(PalInitialize(), 1u);  // the priority-inheriting attribute again
    ASSERT_EQ(PALCreateMutexInternal(&mutex), 0);
    std::atomic<int> stage{0};
    std::thread owner([&] {
        pthread_mutex_lock(mutex);
        for (stage = 1; stage != 2;) usleep(1000);
        usleep(30000);
        pthread_mutex_unlock(mutex);
    });
    while (stage != 1) std::this_thread::yield();
    EXPECT_EQ(PalLockMutexTimed(mutex, 40), 1);
    stage = 2;
    EXPECT_EQ(PalLockMutexTimed(mutex, -1), 0);
    pthread_mutex_unlock(mutex);
    owner.join();
    pthread_mutex_destroy(mutex), PalMemFree(mutex);
    pthread_mutex_t own = PTHREAD_ERRORCHECK_MUTEX_INITIALIZER_NP;  // relocking it: EDEADLK
    pthread_mutex_lock(&own);
    EXPECT_EQ(PalLockMutexTimed(&own, 10), 2);
}

std::atomic<long> gFakeCpus{0};
std::atomic<int> gFakeQueries{0};
long FakeOnlineCpus() { return gFakeQueries.fetch_add(1), gFakeCpus.load(); }

class PalThreadsTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(PalInitialize(), 1u); }
    void TearDown() override { gPalOnlineCpuQuery = real_; ASSERT_EQ(PalInitialize(), 1u); }
    void FakeCpus(long n) { gFakeCpus = n, gFakeQueries = 0, gPalOnlineCpuQuery = FakeOnlineCpus; }
    long (*real_)() = gPalOnlineCpuQuery;
};

int CountBits(const PalCpuSet& set) {
    int n = 0;
    for (uint32_t w : set.words) n += __builtin_popcount(w);
    return n;
}

// Start-up: the set of all CPUs is 0..n-1, at most the 1024 bits it holds,
// empty after a failed query; the CPU count is cached once known, asked
// again after a failure. Before start-up every guarded call raises SIGTRAP,
// then returns 22 with its out-pointer untouched.
std::atomic<int> gTraps{0};
TEST_F(PalThreadsTest, InitializeCpuSetCachedCountAndTheTrapBefore) {
    struct Row { long cpus; int bits; uint32_t word0; };
    for (const Row& row : {Row{4, 4, 0xFu}, Row{2000, 1024, 0xFFFFFFFFu}, Row{-1, 0, 0u}}) {
        FakeCpus(row.cpus);
        ASSERT_EQ(PalInitialize(), 1u);
        EXPECT_TRUE(CountBits(gAllCpus) == row.bits && gAllCpus.words[0] == row.word0) << row.cpus;
    }
    const int32_t saved = gCpuCount.exchange(-1);
    FakeCpus(-1);
    EXPECT_EQ(PalGetCpuCount(), -1);
    gFakeCpus = 3;
    EXPECT_EQ(PalGetCpuCount(), 3);
    gFakeCpus = 5;  // CPUs that come later do not count
    EXPECT_TRUE(PalGetCpuCount() == 3 && gFakeQueries.load() == 2);
    gCpuCount = saved;

    struct sigaction action {}, old{};
    action.sa_handler = [](int) { gTraps.fetch_add(1); };
    ASSERT_EQ(sigaction(SIGTRAP, &action, &old), 0);
    auto* const untouched = reinterpret_cast<void*>(0x1234);
    auto* sem = static_cast<PalSemaphore*>(untouched);
    auto* mutex = static_cast<pthread_mutex_t*>(untouched);
    gPalReady = 0;
    for (int call = 0; call < 3; ++call) {
        gTraps = 0;
        EXPECT_EQ(call == 0 ? PalSetAffinityAll() : call == 1 ? PalSemaphoreCreate(&sem) : PALCreateMutexInternal(&mutex), 22);
        EXPECT_EQ(gTraps.load(), 1) << call;
    }
    gPalReady = 1, sigaction(SIGTRAP, &old, nullptr);
    EXPECT_TRUE(sem == untouched && mutex == untouched);
}

// On threads of their own, so that the test's thread is never left pinned.
TEST_F(PalThreadsTest, AffinityOneAndAll) {
    const long online = sysconf(_SC_NPROCESSORS_ONLN);
    std::thread([online] {
        cpu_set_t set;
        EXPECT_EQ(PalSetAffinityOne(static_cast<int32_t>(online)), -1);
        ASSERT_EQ(PalSetAffinityOne(static_cast<int32_t>(online - 1)), 0);
        ASSERT_EQ(pthread_getaffinity_np(pthread_self(), sizeof set, &set), 0);
        EXPECT_TRUE(CPU_COUNT(&set) == 1 && CPU_ISSET(online - 1, &set));
        EXPECT_EQ(PalSetAffinityOne(-1), 22);  // passes the range test, empty set
        ASSERT_EQ(PalSetAffinityAll(), 0);
        ASSERT_EQ(pthread_getaffinity_np(pthread_self(), sizeof set, &set), 0);
        EXPECT_EQ(CPU_COUNT(&set), CountBits(gAllCpus));
    }).join();
    FakeCpus(2000);  // in range by the count, but not a CPU the kernel has
    std::thread([] { EXPECT_TRUE(PalSetAffinityOne(1500) == 22 && PalSetAffinityOne(2000) == -1); }).join();
}

// Sleeps are never early, whole seconds neither dropped nor doubled;
// diagnostics carry file, function (its field absent without one), line and
// thread id; thread-key exhaustion comes back as "no key".
TEST_F(PalThreadsTest, SleepDebugPrintAndThreadKeys) {
    for (uint64_t ms : {0u, 1005u}) {
        const uint64_t start = testsupport::MonoNowNs();
        PalSleepMilliseconds(static_cast<uint32_t>(ms));
        const uint64_t elapsed = testsupport::MonoNowNs() - start;
        EXPECT_TRUE(elapsed >= ms * 1000000 && elapsed < (ms + 500) * 1000000) << elapsed;
    }
    const std::string tid = std::to_string(syscall(SYS_gettid));
    EXPECT_EQ(PalGetThreadId(), static_cast<int32_t>(syscall(SYS_gettid)));
    FILE* file = tmpfile();
    const int saved = dup(2);
    dup2(fileno(file), 2);
    PalDebugPrint("a.cpp", "Fn", 42, "x=%d %s", 7, "y");
    PalDebugPrint("c.cpp", nullptr, -3, static_cast<const char*>(nullptr));
    dup2(saved, 2), close(saved);
    std::string text(256, '\0');
    text.resize(static_cast<size_t>(pread(fileno(file), &text[0], text.size(), 0))), fclose(file);
    EXPECT_EQ(text, "a.cpp:Fn:42::" + tid + "::x=7 y\n" + "c.cpp:-3::" + tid + "::\n");
    std::vector<pthread_key_t> keys;
    for (pthread_key_t key; keys.size() < 100000 && (key = PalCreateThreadKey()) != kPalNoThreadKey;) keys.push_back(key);
    EXPECT_TRUE(keys.size() > 0 && keys.size() < 100000);
    for (pthread_key_t k : keys) pthread_key_delete(k);
}

}  // namespace
}  // namespace quelta
