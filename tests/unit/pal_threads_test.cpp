// Platform layer: start-up, CPU sets and affinity, the cached CPU count, the
// precondition trap, sleeping, diagnostics and thread keys.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "tLinux/PalMutex.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {
namespace {

std::atomic<long> gFakeCpus{0};
std::atomic<int> gFakeQueries{0};
std::atomic<int> gTraps{0};

long FakeOnlineCpus() {
    gFakeQueries.fetch_add(1);
    return gFakeCpus.load();
}

// Every case starts ready, with the real CPU query, and leaves it so.
class PalThreadsTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(PalInitialize(), 1u); }
    void TearDown() override {
        gPalOnlineCpuQuery = real_;
        ASSERT_EQ(PalInitialize(), 1u);
    }
    void FakeCpus(long n) {
        gFakeCpus = n;
        gFakeQueries = 0;
        gPalOnlineCpuQuery = FakeOnlineCpus;
    }
    long (*real_)() = gPalOnlineCpuQuery;
};

int CountBits(const PalCpuSet& set) {
    int n = 0;
    for (uint32_t w : set.words) n += __builtin_popcount(w);
    return n;
}

TEST_F(PalThreadsTest, InitializePreparesAttributesAndTheCpuSet) {
    int protocol = -1;
    clockid_t clock = -1;
    pthread_mutexattr_getprotocol(&gMutexAttr, &protocol);
    pthread_condattr_getclock(&gCondAttr, &clock);
    EXPECT_EQ(protocol, PTHREAD_PRIO_INHERIT);
    EXPECT_EQ(clock, CLOCK_MONOTONIC);
    EXPECT_EQ(gPalReady.load(), 1u);
    // CPUs 0..n-1; 2000 fills only the 1024 bits the set holds (bits 0-1023,
    // every word full); a failed query leaves the set empty.
    for (long cpus : {4L, 2000L, -1L}) {
        FakeCpus(cpus);
        ASSERT_EQ(PalInitialize(), 1u);
        EXPECT_EQ(CountBits(gAllCpus), cpus == 2000 ? 1024 : std::max(cpus, 0L)) << cpus;
        EXPECT_EQ(gAllCpus.words[0], cpus == 4 ? 0xFu : cpus < 0 ? 0u : 0xFFFFFFFFu) << cpus;
    }
}

TEST_F(PalThreadsTest, CpuCountIsCachedOnceKnownButAskedAgainAfterFailure) {
    const int32_t saved = gCpuCount.load();
    gCpuCount = -1;
    FakeCpus(-1);
    EXPECT_EQ(PalGetCpuCount(), -1);
    gFakeCpus = 3;
    EXPECT_EQ(PalGetCpuCount(), 3);
    gFakeCpus = 5;  // CPUs that come later do not count
    EXPECT_EQ(PalGetCpuCount(), 3);
    EXPECT_EQ(gFakeQueries.load(), 2);
    gCpuCount = saved;
}

// Before PalInitialize every guarded call raises SIGTRAP, then returns 22
// with its out-pointer untouched.
TEST_F(PalThreadsTest, CallsBeforeInitializeTrapThenReturnEinval) {
    struct sigaction action {}, old{};
    action.sa_handler = [](int) { gTraps.fetch_add(1); };
    sigemptyset(&action.sa_mask);
    ASSERT_EQ(sigaction(SIGTRAP, &action, &old), 0);
    auto* const untouched = reinterpret_cast<void*>(0x1234);
    auto* sem = static_cast<PalSemaphore*>(untouched);
    auto* mutex = static_cast<pthread_mutex_t*>(untouched);
    const std::function<int()> calls[] = {PalSetAffinityAll, [&] { return PalSemaphoreCreate(&sem); },
                                          [&] { return PALCreateMutexInternal(&mutex); }};
    gPalReady = 0;
    for (const auto& call : calls) {
        gTraps = 0;
        EXPECT_EQ(call(), 22);
        EXPECT_EQ(gTraps.load(), 1);
    }
    EXPECT_TRUE(sem == untouched && mutex == untouched);
    gPalReady = 1;
    sigaction(SIGTRAP, &old, nullptr);
}

// On a thread of its own, so that the test's thread is never left pinned.
TEST_F(PalThreadsTest, AffinityOneAndAll) {
    const long online = sysconf(_SC_NPROCESSORS_ONLN);
    std::thread([online] {
        cpu_set_t set;
        EXPECT_EQ(PalSetAffinityOne(static_cast<int32_t>(online)), -1);
        ASSERT_EQ(PalSetAffinityOne(static_cast<int32_t>(online - 1)), 0);
        ASSERT_EQ(pthread_getaffinity_np(pthread_self(), sizeof set, &set), 0);
        EXPECT_EQ(CPU_COUNT(&set), 1);
        EXPECT_TRUE(CPU_ISSET(online - 1, &set));
        EXPECT_EQ(PalSetAffinityOne(-1), 22);  // passes the range test, empty set
        ASSERT_EQ(PalSetAffinityAll(), 0);
        ASSERT_EQ(pthread_getaffinity_np(pthread_self(), sizeof set, &set), 0);
        EXPECT_EQ(CPU_COUNT(&set), CountBits(gAllCpus));
    }).join();
    FakeCpus(2000);  // in range by the count, but not a CPU the kernel has
    std::thread([] {
        EXPECT_EQ(PalSetAffinityOne(1500), 22);
        EXPECT_EQ(PalSetAffinityOne(2000), -1);
    }).join();
}

TEST_F(PalThreadsTest, SleepIsNeverEarlyAcrossWholeSeconds) {
    for (uint64_t ms : {0u, 1005u}) {
        const uint64_t start = testsupport::MonoNowNs();
        PalSleepMilliseconds(static_cast<uint32_t>(ms));
        const uint64_t elapsed = testsupport::MonoNowNs() - start;
        EXPECT_GE(elapsed, ms * 1000000);
        EXPECT_LT(elapsed, (ms + 500) * 1000000);  // loosely: whole seconds are not dropped or doubled
    }
}

// What a call writes to standard error.
template <typename Fn>
std::string CaptureStderr(Fn fn) {
    FILE* file = tmpfile();
    const int saved = dup(2);
    dup2(fileno(file), 2);
    fn();
    dup2(saved, 2);
    close(saved);
    std::string text(256, '\0');
    text.resize(static_cast<size_t>(pread(fileno(file), &text[0], text.size(), 0)));
    fclose(file);
    return text;
}

TEST_F(PalThreadsTest, DebugPrintPrefixes) {
    const std::string tid = std::to_string(syscall(SYS_gettid));
    const char* none = nullptr;
    EXPECT_EQ(CaptureStderr([] { PalDebugPrint("a.cpp", "Fn", 42, "x=%d %s", 7, "y"); }),
              "a.cpp:Fn:42::" + tid + "::x=7 y\n");
    // Without a function its field and colon are absent, not empty.
    EXPECT_EQ(CaptureStderr([none] { PalDebugPrint("c.cpp", nullptr, -3, none); }),
              "c.cpp:-3::" + tid + "::\n");
    EXPECT_EQ(PalGetThreadId(), static_cast<int32_t>(syscall(SYS_gettid)));
}

TEST_F(PalThreadsTest, ThreadKeyExhaustionIsReported) {
    std::vector<pthread_key_t> keys;
    for (pthread_key_t key; (key = PalCreateThreadKey()) != kPalNoThreadKey && keys.size() < 100000;) {
        keys.push_back(key);
    }
    EXPECT_GT(keys.size(), 0u);
    EXPECT_LT(keys.size(), 100000u);  // exhaustion came back as "no key"
    for (pthread_key_t k : keys) pthread_key_delete(k);
}

}  // namespace
}  // namespace quelta
