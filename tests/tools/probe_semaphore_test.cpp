// The runtime-side semaphore: its own rules, and the library waiting on it
// and posting it from its timer thread (the library loaded as a runtime
// loads it).
#include <gtest/gtest.h>
#include <time.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "LoadedLibrary.h"
#include "RuntimeSemaphore.h"

using namespace qtools;

namespace {

int64_t NowNs() {
    timespec t{};
    clock_gettime(CLOCK_MONOTONIC, &t);
    return static_cast<int64_t>(t.tv_sec) * 1000000000LL + t.tv_nsec;
}

struct Sem {
    PalSemaphore* s = nullptr;
    Sem() { EXPECT_EQ(RuntimeSemaphoreCreate(&s), 0); }
    ~Sem() { RuntimeSemaphoreDestroy(s); }
};

TEST(ProbeSemaphore, KeepsOnePostTimesOutAndWakesAWaiter) {
    Sem sem;
    EXPECT_EQ(RuntimeSemaphorePost(sem.s), 0);
    EXPECT_EQ(RuntimeSemaphorePost(sem.s), 0);  // nobody waiting: dropped
    EXPECT_EQ(RuntimeSemaphorePending(sem.s), 1);
    EXPECT_EQ(RuntimeSemaphoreWait(sem.s, 0), 0u);
    EXPECT_EQ(RuntimeSemaphoreWait(sem.s, 0), 1u);
    const int64_t start = NowNs();
    EXPECT_EQ(RuntimeSemaphoreWait(sem.s, 20), 1u);
    EXPECT_GE(NowNs() - start, 20 * 1000000LL);
    EXPECT_EQ(sem.s->waiters, 0);
    EXPECT_EQ(sem.s->count, 0);
    EXPECT_EQ(RuntimeSemaphoreDestroy(nullptr), 22);

    std::atomic<uint32_t> result{99};
    std::thread waiter([&] { result = RuntimeSemaphoreWait(sem.s, -1); });
    for (int32_t w = 0; w != 1; std::this_thread::yield()) {  // until the waiter is inside
        pthread_mutex_lock(&sem.s->mutex);
        w = sem.s->waiters;
        pthread_mutex_unlock(&sem.s->mutex);
    }
    EXPECT_EQ(RuntimeSemaphorePost(sem.s), 0);
    waiter.join();
    EXPECT_EQ(result.load(), 0u);
    EXPECT_EQ(RuntimeSemaphorePending(sem.s), 0);
}

TEST(ProbeSemaphore, TheLibraryWaitsOnItAndPostsIt) {
    testsupport::LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    Sem sem;

    // Timing out: the library's timer thread posts at the deadline and the
    // wait takes that post; nothing is left behind.
    const int64_t start = NowNs();
    EXPECT_EQ(lib.api().EventWait(sem.s, 1500), 1u);
    EXPECT_GE(NowNs() - start, 1500 * 1000LL);
    EXPECT_EQ(RuntimeSemaphorePending(sem.s), 0);

    // Posted by the runtime before the timeout: signalled.
    std::thread poster([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        RuntimeSemaphorePost(sem.s);
    });
    EXPECT_EQ(lib.api().EventWait(sem.s, 2000000), 0u);
    poster.join();
}

}  // namespace
