// Platform layer: start-up, CPU sets, affinity, priorities, sleeping,
// diagnostics and thread keys.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "tLinux/PalThreads.h"

namespace quelta {
namespace {

std::atomic<int> gTraps{0};
std::atomic<long> gFakeCpus{0};
std::atomic<int> gFakeQueries{0};

long FakeOnlineCpus() {
    gFakeQueries.fetch_add(1, std::memory_order_relaxed);
    return gFakeCpus.load(std::memory_order_relaxed);
}

void CountTrap(int) { gTraps.fetch_add(1, std::memory_order_relaxed); }
void IgnoreSignal(int) {}

// Replaces the online-CPU query for one test and puts the real one back.
class FakeCpuCount {
public:
    explicit FakeCpuCount(long cpus) : saved_(gPalOnlineCpuQuery) {
        gFakeCpus = cpus;
        gFakeQueries = 0;
        gPalOnlineCpuQuery = FakeOnlineCpus;
    }
    ~FakeCpuCount() { gPalOnlineCpuQuery = saved_; }

private:
    long (*saved_)();
};

int CountBits(const PalCpuSet& set) {
    int n = 0;
    for (uint32_t w : set.words) n += __builtin_popcount(w);
    return n;
}

// Runs fn on a fresh thread, so that pinning or renaming it leaves the test's
// own thread alone.
template <typename Fn>
void OnOwnThread(Fn fn) {
    std::thread t(fn);
    t.join();
}

class PalThreadsTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(PalInitialize(), 1u); }
    void TearDown() override { ASSERT_EQ(PalInitialize(), 1u); }  // the real CPU set again
};

TEST_F(PalThreadsTest, InitializePreparesAttributesAndReadiness) {
    EXPECT_EQ(gPalReady.load(), 1u);
    int protocol = -1;
    ASSERT_EQ(pthread_mutexattr_getprotocol(&gMutexAttr, &protocol), 0);
    EXPECT_EQ(protocol, PTHREAD_PRIO_INHERIT);
    clockid_t clock = -1;
    ASSERT_EQ(pthread_condattr_getclock(&gCondAttr, &clock), 0);
    EXPECT_EQ(clock, CLOCK_MONOTONIC);
    // A second call rebuilds everything and succeeds again.
    EXPECT_EQ(PalInitialize(), 1u);
    EXPECT_EQ(CountBits(gAllCpus), static_cast<int>(std::min(sysconf(_SC_NPROCESSORS_ONLN), 1024L)));
}

TEST_F(PalThreadsTest, AllCpuSetHoldsOnlineCpusBelow1024) {
    {
        FakeCpuCount fake(4);
        ASSERT_EQ(PalInitialize(), 1u);
        EXPECT_EQ(gAllCpus.words[0], 0xFu);
        EXPECT_EQ(CountBits(gAllCpus), 4);
    }
    {
        FakeCpuCount fake(33);  // crosses into the second word
        ASSERT_EQ(PalInitialize(), 1u);
        EXPECT_EQ(gAllCpus.words[0], 0xFFFFFFFFu);
        EXPECT_EQ(gAllCpus.words[1], 0x1u);
        EXPECT_EQ(CountBits(gAllCpus), 33);
    }
    {
        FakeCpuCount fake(2000);
        ASSERT_EQ(PalInitialize(), 1u);
        for (uint32_t w : gAllCpus.words) EXPECT_EQ(w, 0xFFFFFFFFu);
    }
    for (long answer : {0L, -1L}) {  // nothing online, or the query failed
        FakeCpuCount fake(answer);
        ASSERT_EQ(PalInitialize(), 1u);
        EXPECT_EQ(CountBits(gAllCpus), 0) << answer;
    }
}

TEST_F(PalThreadsTest, CpuCountIsCachedOnceKnownAndAskedAgainAfterFailure) {
    const int32_t saved = gCpuCount.load();
    gCpuCount = -1;
    {
        FakeCpuCount fake(-1);
        EXPECT_EQ(PalGetCpuCount(), -1);
        EXPECT_EQ(PalGetCpuCount(), -1);
        EXPECT_EQ(gFakeQueries.load(), 2);  // a failure is not cached
        gFakeCpus = 3;
        EXPECT_EQ(PalGetCpuCount(), 3);
        gFakeCpus = 5;  // CPUs come or go later: the first answer stays
        EXPECT_EQ(PalGetCpuCount(), 3);
        EXPECT_EQ(gFakeQueries.load(), 3);
    }
    gCpuCount = saved;
}

TEST_F(PalThreadsTest, CallsBeforeInitializeTrapAndReturnEinval) {
    struct sigaction action {}, old{};
    action.sa_handler = CountTrap;
    sigemptyset(&action.sa_mask);
    ASSERT_EQ(sigaction(SIGTRAP, &action, &old), 0);
    gTraps = 0;
    gPalReady = 0;
    EXPECT_EQ(PalSetAffinityAll(), 22);
    EXPECT_EQ(gTraps.load(), 1);
    gPalReady = 1;
    sigaction(SIGTRAP, &old, nullptr);
}

TEST_F(PalThreadsTest, SetAffinityAllPinsToEveryOnlineCpu) {
    OnOwnThread([] {
        ASSERT_EQ(PalSetAffinityOne(0), 0);
        ASSERT_EQ(PalSetAffinityAll(), 0);
        cpu_set_t set;
        CPU_ZERO(&set);
        ASSERT_EQ(pthread_getaffinity_np(pthread_self(), sizeof set, &set), 0);
        EXPECT_EQ(CPU_COUNT(&set), CountBits(gAllCpus));
    });
}

TEST_F(PalThreadsTest, SetAffinityOneChecksTheOnlineCount) {
    const long online = sysconf(_SC_NPROCESSORS_ONLN);
    ASSERT_GT(online, 0);
    OnOwnThread([online] {
        EXPECT_EQ(PalSetAffinityOne(static_cast<int32_t>(online)), -1);
        const int32_t last = static_cast<int32_t>(online - 1);
        ASSERT_EQ(PalSetAffinityOne(last), 0);
        cpu_set_t set;
        CPU_ZERO(&set);
        ASSERT_EQ(pthread_getaffinity_np(pthread_self(), sizeof set, &set), 0);
        EXPECT_EQ(CPU_COUNT(&set), 1);
        EXPECT_TRUE(CPU_ISSET(last, &set));
        // A negative number passes the range test and yields an empty set.
        EXPECT_EQ(PalSetAffinityOne(-1), 22);
    });
    // With a claimed 2000 CPUs, numbers beyond the set's 1024 bits get an
    // empty set, and a number in range but offline is refused by the kernel.
    FakeCpuCount fake(2000);
    OnOwnThread([] {
        EXPECT_EQ(PalSetAffinityOne(1500), 22);
        EXPECT_EQ(PalSetAffinityOne(1000), 22);
        EXPECT_EQ(PalSetAffinityOne(2000), -1);
    });
}

TEST_F(PalThreadsTest, PriorityOfOrdinaryThreadAndRefusedPriority) {
    EXPECT_EQ(PalGetThreadPriority(pthread_self()), 0);  // SCHED_OTHER reports 0
    errno = 0;
    EXPECT_EQ(PalSetThreadPriority(pthread_self(), 1000), 22);
    EXPECT_EQ(errno, 22);
    EXPECT_EQ(PalGetThreadPriority(pthread_self()), 0);
}

TEST_F(PalThreadsTest, SleepMillisecondsIsNeverEarlyAndSplitsSeconds) {
    for (uint32_t ms : {0u, 20u, 1100u}) {
        const uint64_t start = testsupport::MonoNowNs();
        PalSleepMilliseconds(ms);
        const uint64_t elapsed = testsupport::MonoNowNs() - start;
        EXPECT_GE(elapsed, ms * 1000000ull) << ms;
        EXPECT_LT(elapsed, ms * 1000000ull + 50000000ull) << ms;
    }
}

TEST_F(PalThreadsTest, InterruptedSleepIsNotResumed) {
    struct sigaction action {}, old{};
    action.sa_handler = IgnoreSignal;  // no SA_RESTART
    sigemptyset(&action.sa_mask);
    ASSERT_EQ(sigaction(SIGUSR1, &action, &old), 0);
    std::atomic<uint64_t> elapsed{0};
    std::atomic<bool> started{false};
    std::thread sleeper([&] {
        started = true;
        const uint64_t start = testsupport::MonoNowNs();
        PalSleepMilliseconds(5000);
        elapsed = testsupport::MonoNowNs() - start;
    });
    while (!started) std::this_thread::yield();
    // Keep signalling until the sleep has ended: the first signal might land
    // before the thread is inside nanosleep.
    while (elapsed.load() == 0) {
        pthread_kill(sleeper.native_handle(), SIGUSR1);
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    sleeper.join();
    EXPECT_LT(elapsed.load(), 4000000000ull);
    sigaction(SIGUSR1, &old, nullptr);
}

// Captures what a call writes to standard error.
template <typename Fn>
std::string CaptureStderr(Fn fn) {
    fflush(stderr);
    char path[] = "/tmp/pal_threads_stderr_XXXXXX";
    const int fd = mkstemp(path);
    EXPECT_GE(fd, 0);
    const int saved = dup(2);
    dup2(fd, 2);
    fn();
    fflush(stderr);
    dup2(saved, 2);
    close(saved);
    std::string text;
    lseek(fd, 0, SEEK_SET);
    char buf[512];
    ssize_t n;
    while ((n = read(fd, buf, sizeof buf)) > 0) text.append(buf, static_cast<size_t>(n));
    close(fd);
    unlink(path);
    return text;
}

TEST_F(PalThreadsTest, DebugPrintPrefixesAndFormats) {
    const std::string tid = std::to_string(static_cast<long>(syscall(SYS_gettid)));
    EXPECT_EQ(CaptureStderr([] { PalDebugPrint("a.cpp", "Fn", 42, "x=%d %s", 7, "y"); }),
              "a.cpp:Fn:42::" + tid + "::x=7 y\n");
    // No function: its field and its colon are absent, not empty.
    EXPECT_EQ(CaptureStderr([] { PalDebugPrint("b.cpp", nullptr, 9, "%s", "m"); }),
              "b.cpp:9::" + tid + "::m\n");
    const char* noFormat = nullptr;
    EXPECT_EQ(CaptureStderr([noFormat] { PalDebugPrint("c.cpp", nullptr, -3, noFormat); }),
              "c.cpp:-3::" + tid + "::\n");
    EXPECT_EQ(CaptureStderr([noFormat] { PalDebugPrint("d.cpp", "G", 1, noFormat); }),
              "d.cpp:G:1::" + tid + "::\n");
}

TEST_F(PalThreadsTest, ThreadNameIsCutToFifteenCharacters) {
    OnOwnThread([] {
        PalSetThreadName("QUELTAisr-and-more");
        char name[32] = {};
        ASSERT_EQ(pthread_getname_np(pthread_self(), name, sizeof name), 0);
        EXPECT_STREQ(name, "QUELTAisr-and-m");
    });
}

TEST_F(PalThreadsTest, ThreadIdIsTheKernelIdOfTheCaller) {
    const int32_t mine = PalGetThreadId();
    EXPECT_EQ(mine, static_cast<int32_t>(syscall(SYS_gettid)));
    EXPECT_EQ(mine, static_cast<int32_t>(getpid()));  // the test's main thread
    int32_t other = 0;
    OnOwnThread([&other] { other = PalGetThreadId(); });
    EXPECT_NE(other, mine);
    EXPECT_GT(other, 0);
}

TEST_F(PalThreadsTest, ThreadKeysWorkAndExhaustionIsReported) {
    const pthread_key_t key = PalCreateThreadKey();
    ASSERT_NE(key, kPalNoThreadKey);
    int value = 5;
    ASSERT_EQ(pthread_setspecific(key, &value), 0);
    EXPECT_EQ(pthread_getspecific(key), &value);

    std::vector<pthread_key_t> keys{key};
    pthread_key_t last = key;
    for (int i = 0; i < 4096 && last != kPalNoThreadKey; ++i) {
        last = PalCreateThreadKey();
        if (last != kPalNoThreadKey) keys.push_back(last);
    }
    EXPECT_EQ(last, kPalNoThreadKey);
    for (pthread_key_t k : keys) pthread_key_delete(k);
}

}  // namespace
}  // namespace quelta
