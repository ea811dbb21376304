// The loaded library under the load a busy runtime puts on it: 32 threads mix
// every wait of the interface, callback times, log recording and read-outs for
// a bounded time (QUELTA_STRESS_SECONDS, default 20; shorter under emulation).
//
// Checked: no wait that reports a timeout or completion returns before its
// deadline; every call returns within a generous bound (a watchdog aborts with
// the stuck operation named rather than hanging); afterwards exactly 128 nodes
// can be taken and the 129th is refused with 3; read-outs stay in time order
// per CPU and carry only CPU indices that exist; every post a thread made is
// either taken by an event wait that returned 0 or still pending at the end.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <thread>
#include <vector>

#include "LoadedLibrary.h"
#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"

using testsupport::MonoNowNs;

namespace {

constexpr uint64_t kUs = 1000;
constexpr uint64_t kMs = 1000000;
constexpr int kThreads = 32;
constexpr uint64_t kStuckAfter = 10000 * kMs;  // any single call

uint64_t U64(const ClockTime& t) { return (static_cast<uint64_t>(t.high) << 32) | t.low; }
ClockTime CT(uint64_t v) { return ClockTime{static_cast<uint32_t>(v), static_cast<uint32_t>(v >> 32)}; }

const char* const kOpNames[] = {"own-semaphore wait", "held node",        "callback node",
                                "event wait",         "post",             "global wait",
                                "plain wait",         "callback time",    "log record",
                                "read-out"};
constexpr int kOps = sizeof(kOpNames) / sizeof(kOpNames[0]);

struct ThreadState {
    std::atomic<uint64_t> opStart{0};  // 0: not inside a call
    std::atomic<int> op{-1};
};

std::atomic<uint64_t> gEarly{0};
std::atomic<uint64_t> gOrderViolations{0};
std::atomic<uint64_t> gBadCpu{0};
std::atomic<uint64_t> gCount[kOps];
std::atomic<int> gCallbacksPending{0};

// Post accounting for the shared semaphores. A thread posts only while no
// post of its own is outstanding on that semaphore, so the semaphore never
// drops one by its own rule (at most waiters + 1 pending) and every post
// must be accounted for.
constexpr int kShared = 8;
std::atomic<int> gOutstanding[kShared];
std::atomic<uint64_t> gPosts[kShared], gTakes[kShared];

struct Ticket {
    uint64_t deadline;
};
uint32_t NodeCallback(void* arg) {
    auto* t = static_cast<Ticket*>(arg);
    if (MonoNowNs() < t->deadline) gEarly.fetch_add(1);
    delete t;
    gCallbacksPending.fetch_sub(1);
    return 1;
}
void TimeCallback(void*) {}

class Stress {
public:
    explicit Stress(testsupport::LoadedLibrary& lib) : lib_(lib), api_(lib.api()), e_(lib.engine()) {}

    void Worker(int id, ThreadState* st, const std::atomic<bool>* stop) {
        std::mt19937 rng(99 + id);
        PalSemaphore* mine = testsupport::NewRuntimeSemaphore();
        const long cpus = sysconf(_SC_NPROCESSORS_ONLN);
        std::vector<uint32_t> lo(512), hi(512), ev(512), data(512);
        while (!stop->load()) {
            const int op = static_cast<int>(rng() % kOps);
            st->op = op;
            st->opStart = MonoNowNs();
            const uint64_t delay = rng() % (4 * kMs);
            ClockTime now;
            e_->ReadMonotonic0(now);
            const ClockTime deadline = CT(U64(now) + delay);
            switch (op) {
                case 0:
                    if (api_.EventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr) == 0 &&
                        MonoNowNs() < U64(deadline))
                        gEarly.fetch_add(1);
                    break;
                case 1: {
                    WaitNode* node = nullptr;
                    if (api_.EventWaitCallback(mine, &deadline, nullptr, nullptr, 0, &node) != 0) break;
                    if (rng() % 3 == 0) {
                        e_->ReleaseWait(node);  // cancel early
                        quelta::PalSemaphoreWait(mine, 0);
                    } else {
                        quelta::PalSemaphoreWait(mine, -1);
                        if (MonoNowNs() < U64(deadline)) gEarly.fetch_add(1);
                        e_->ReleaseWait(node);  // release late
                    }
                    break;
                }
                case 2: {
                    auto* t = new Ticket{U64(deadline)};
                    gCallbacksPending.fetch_add(1);
                    if (api_.EventWaitCallback(nullptr, &deadline, NodeCallback, t, 0, nullptr) != 0) {
                        delete t;
                        gCallbacksPending.fetch_sub(1);
                    }
                    break;
                }
                case 3: {
                    const int k = static_cast<int>(rng() % kShared);
                    const uint32_t timeout = static_cast<uint32_t>(rng() % 4000);
                    const uint64_t start = MonoNowNs();
                    const uint32_t r = api_.EventWait(shared_[k], timeout);
                    if (r == 0) {
                        gTakes[k].fetch_add(1);
                        gOutstanding[k].store(0);
                    }
                    if (r == 1 && MonoNowNs() < start + timeout * kUs) gEarly.fetch_add(1);
                    break;
                }
                case 4: {
                    const int k = static_cast<int>(rng() % kShared);
                    int none = 0;
                    if (!gOutstanding[k].compare_exchange_strong(none, 1)) break;
                    gPosts[k].fetch_add(1);
                    quelta::PalSemaphorePost(shared_[k]);
                    break;
                }
                case 5: {
                    ClockTime g;
                    uint32_t generation = 0;
                    e_->ReadGlobalWithGeneration(g, generation);
                    const ClockTime target = CT(U64(g) + delay);
                    uint32_t abortFlag = 0;
                    ClockTime after{};
                    api_.WaitUntilGlobalClocks64(&target, &abortFlag, &after, generation);
                    if (abortFlag == 0 && U64(after) < U64(target)) gEarly.fetch_add(1);
                    break;
                }
                case 6: {
                    api_.WaitUntilClocks64(&deadline);
                    if (MonoNowNs() < U64(deadline)) gEarly.fetch_add(1);
                    break;
                }
                case 7:
                    api_.SetCallbackTime(&deadline, static_cast<int32_t>(rng() % 2) - 1);
                    break;
                case 8:
                    for (int i = 0; i < 16; ++i) lib_.log()->LogNow5(static_cast<uint32_t>(id));
                    break;
                case 9: {
                    uint32_t count = static_cast<uint32_t>(lo.size());
                    lib_.log()->ReadOutMerged(count, lo.data(), hi.data(), ev.data(), data.data(), 0);
                    CheckReadOut(count, lo, hi, ev, cpus);
                    break;
                }
            }
            st->opStart = 0;
            gCount[op].fetch_add(1);
        }
        quelta::PalSemaphoreDestroy(mine);
    }

    void CheckReadOut(uint32_t count, const std::vector<uint32_t>& lo, const std::vector<uint32_t>& hi,
                      const std::vector<uint32_t>& ev, long cpus) {
        if (count > lo.size()) {
            gBadCpu.fetch_add(1);
            return;
        }
        std::vector<uint64_t> lastPerCpu(256, 0);
        for (uint32_t k = 0; k < count; ++k) {
            const uint32_t cpu = (ev[k] >> 8) & 0xFF;
            if (static_cast<long>(cpu) >= cpus) gBadCpu.fetch_add(1);
            const uint64_t t = (static_cast<uint64_t>(hi[k]) << 32) | lo[k];
            // Entries of one CPU come out oldest first. Two recorders on one
            // CPU may tear an entry; the log accepts that, so only a gross
            // inversion (beyond a second) counts.
            if (t + 1000 * kMs < lastPerCpu[cpu]) gOrderViolations.fetch_add(1);
            if (t > lastPerCpu[cpu]) lastPerCpu[cpu] = t;
        }
    }

    std::vector<PalSemaphore*> shared_;

private:
    testsupport::LoadedLibrary& lib_;
    const testsupport::QueltaApi& api_;
    iKPusTimingEngine* e_;
};

uint64_t StressSeconds() {
    if (const char* s = std::getenv("QUELTA_STRESS_SECONDS")) return std::strtoull(s, nullptr, 10);
#if defined(__arm__) || defined(QUELTA_SANITIZED)
    return 8;  // emulated or instrumented: fewer operations per second anyway
#else
    return 20;
#endif
}

TEST(Stress, EveryWaitAtOnceFromManyThreads) {
    testsupport::LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    lib.log()->SetEnabled(1);
    lib.api().SetCallback(TimeCallback, nullptr);
    Stress stress(lib);
    for (int i = 0; i < kShared; ++i) stress.shared_.push_back(testsupport::NewRuntimeSemaphore());

    std::atomic<bool> stop{false};
    std::vector<ThreadState> states(kThreads);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) threads.emplace_back(&Stress::Worker, &stress, i, &states[i], &stop);

    const uint64_t seconds = StressSeconds();
    const uint64_t start = MonoNowNs();
    while (MonoNowNs() - start < seconds * 1000 * kMs) {
        usleep(100000);
        for (int i = 0; i < kThreads; ++i) {  // the watchdog
            const uint64_t t = states[i].opStart.load();
            if (t != 0 && MonoNowNs() - t > kStuckAfter) {
                std::fprintf(stderr, "watchdog: thread %d stuck in '%s' for %llu ms\n", i,
                             kOpNames[states[i].op.load()],
                             static_cast<unsigned long long>((MonoNowNs() - t) / kMs));
                std::fflush(stderr);
                std::abort();  // a core/stack dump beats a hung CI
            }
        }
    }
    stop = true;
    for (auto& t : threads) t.join();
    for (int i = 0; i < 400 && gCallbacksPending.load() > 0; ++i) usleep(5000);
    lib.api().SetCallback(nullptr, nullptr);

    uint64_t total = 0;
    for (int op = 0; op < kOps; ++op) {
        std::printf("%-20s %10llu\n", kOpNames[op], static_cast<unsigned long long>(gCount[op].load()));
        total += gCount[op].load();
        EXPECT_GT(gCount[op].load(), 0u) << kOpNames[op];
    }
    EXPECT_GT(total, 1000u);
    EXPECT_EQ(gEarly.load(), 0u);
    EXPECT_EQ(gBadCpu.load(), 0u);
    EXPECT_EQ(gOrderViolations.load(), 0u);
    EXPECT_EQ(gCallbacksPending.load(), 0);
    for (int k = 0; k < kShared; ++k) {
        uint64_t pending = 0;
        while (quelta::PalSemaphoreWait(stress.shared_[k], 0) == 0) ++pending;
        EXPECT_EQ(gPosts[k].load(), gTakes[k].load() + pending)
            << "semaphore " << k << ": posts lost or invented (" << gTakes[k].load() << " taken, " << pending
            << " pending)";
    }

    // The pool is whole: exactly 128 nodes can be taken, the 129th is refused.
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    ClockTime now;
    lib.engine()->ReadMonotonic0(now);
    const ClockTime far = CT(U64(now) + 60000 * kMs);
    std::vector<WaitNode*> nodes;
    for (int i = 0; i < 128; ++i) {
        WaitNode* n = nullptr;
        ASSERT_EQ(lib.api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &n), 0u) << i;
        nodes.push_back(n);
    }
    WaitNode* extra = nullptr;
    EXPECT_EQ(lib.api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &extra), 3u);
    for (WaitNode* n : nodes) lib.engine()->ReleaseWait(n);
    for (auto* sem : stress.shared_) testsupport::DeleteRuntimeSemaphore(sem);
    testsupport::DeleteRuntimeSemaphore(s);
}

TEST(Stress, TwoHundredLoadUnloadCycles) {
    const int threads = testsupport::CountThreads();
    const int fds = testsupport::CountOpenFds();
    uint64_t slowest = 0;
    for (int i = 0; i < 200; ++i) {
        const uint64_t t0 = MonoNowNs();
        {
            testsupport::LoadedLibrary lib;
            ASSERT_TRUE(lib.ok()) << lib.error();
        }
        slowest = std::max(slowest, MonoNowNs() - t0);
    }
    EXPECT_EQ(testsupport::CountThreads(), threads);
    EXPECT_EQ(testsupport::CountOpenFds(), fds);
    std::printf("slowest load+unload: %.1f ms\n", static_cast<double>(slowest) / kMs);
    EXPECT_LT(slowest, 2000 * kMs);
}

}  // namespace
