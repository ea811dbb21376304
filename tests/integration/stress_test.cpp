// A busy runtime's load (32 threads, every call, QUELTA_STRESS_SECONDS, default 20, 8 emulated or
// instrumented): nothing early, nothing hung, the pool whole, read-outs ordered, no post lost or invented.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <thread>
#include <vector>

#include "LibraryFixture.h"
#include "TestSupport.h"

using testsupport::CT, testsupport::MonoNowNs, testsupport::U64;

namespace {

constexpr uint64_t kUs = 1000, kMs = 1000000;
constexpr int kThreads = 32, kShared = 8;
const char* const kOpNames[] = {"own-semaphore wait", "held node",   "callback node", "event wait", "post",
                                "global wait",        "plain wait",  "callback time", "log record", "read-out",
                                "kept callback node"};
constexpr int kOps = std::size(kOpNames);

struct ThreadState {
    std::atomic<uint64_t> opStart{0};  // 0: not inside a call
    std::atomic<int> op{-1};
};
std::atomic<uint64_t> gEarly{0}, gBadLog{0}, gCount[kOps];
std::atomic<int> gCallbacksPending{0};
// A thread posts a shared semaphore only while no post of its own is pending
// there, so the semaphore never drops one by its own rule (waiters + 1).
std::atomic<int> gOutstanding[kShared];
std::atomic<uint64_t> gPosts[kShared], gTakes[kShared];
PalSemaphore* gSharedSems[kShared];

struct Ticket {
    std::atomic<uint64_t> deadline;
};
uint32_t NodeCallback(void* arg) {
    auto* t = static_cast<Ticket*>(arg);
    if (MonoNowNs() < t->deadline.load()) gEarly.fetch_add(1);
    delete t;
    gCallbacksPending.fetch_sub(1);
    return 1;
}
uint32_t KeepCallback(void* arg) {  // the ticket lives on its holder's stack
    if (MonoNowNs() < static_cast<Ticket*>(arg)->deadline.load()) gEarly.fetch_add(1);
    return 0;
}
void TimeCallback(void*) {}

void Worker(const testsupport::LoadedLibrary* lib, int id, ThreadState* st, const std::atomic<bool>* stop) {
    const testsupport::QueltaApi& api = lib->api();
    iKPusTimingEngine* e = lib->engine();
    std::mt19937 rng(99 + id);
    PalSemaphore* mine = testsupport::NewRuntimeSemaphore();
    const long cpus = sysconf(_SC_NPROCESSORS_ONLN);
    std::vector<uint32_t> lo(512), hi(512), ev(512), data(512);
    while (!stop->load()) {
        const int op = static_cast<int>(rng() % kOps);
        st->op = op, st->opStart = MonoNowNs();
        const uint64_t delay = rng() % (4 * kMs);
        ClockTime now;
        e->ReadMonotonic0(now);
        const ClockTime deadline = CT(U64(now) + delay);
        auto early = [&](uint64_t due) { gEarly.fetch_add(MonoNowNs() < due); };
        switch (op) {
            case 0:
                if (api.EventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr) == 0) early(U64(deadline));
                break;
            case 1: {  // cancelled early, or released after the post
                WaitNode* node = nullptr;
                if (api.EventWaitCallback(mine, &deadline, nullptr, nullptr, 0, &node) != 0) break;
                const bool cancel = rng() % 3 == 0;
                if (!cancel) quelta::PalSemaphoreWait(mine, -1), early(U64(deadline));
                e->ReleaseWait(node);
                if (cancel) quelta::PalSemaphoreWait(mine, 0);
                break;
            }
            case 2: {  // the tick service gives the node back itself
                auto* t = new Ticket{U64(deadline)};
                gCallbacksPending.fetch_add(1);
                if (api.EventWaitCallback(nullptr, &deadline, NodeCallback, t, 0, nullptr) != 0)
                    delete t, gCallbacksPending.fetch_sub(1);
                break;
            }
            case 3: {
                const int k = static_cast<int>(rng() % kShared);
                const uint32_t timeout = static_cast<uint32_t>(rng() % 4000);
                const uint64_t start = MonoNowNs();
                const uint32_t r = api.EventWait(gSharedSems[k], timeout);
                if (r == 0) gTakes[k].fetch_add(1), gOutstanding[k].store(0);
                if (r == 1) early(start + timeout * kUs);
                break;
            }
            case 4: {
                const int k = static_cast<int>(rng() % kShared);
                int none = 0;
                if (gOutstanding[k].compare_exchange_strong(none, 1)) gPosts[k]++, quelta::PalSemaphorePost(gSharedSems[k]);
                break;
            }
            case 5: {
                ClockTime g, after{};
                uint32_t generation = 0, abortFlag = 0;
                e->ReadGlobalWithGeneration(g, generation);
                const ClockTime target = CT(U64(g) + delay);
                api.WaitUntilGlobalClocks64(&target, &abortFlag, &after, generation);
                if (abortFlag == 0 && U64(after) < U64(target)) gEarly.fetch_add(1);
                break;
            }
            case 6: api.WaitUntilClocks64(&deadline), early(U64(deadline)); break;
            case 7: api.SetCallbackTime(&deadline, static_cast<int32_t>(rng() % 2) - 1); break;
            case 8: for (int i = 0; i < 16; ++i) lib->log()->LogNow5(static_cast<uint32_t>(id)); break;
            case 9: {
                uint32_t count = static_cast<uint32_t>(lo.size());
                lib->log()->ReadOutMerged(count, lo.data(), hi.data(), ev.data(), data.data(), 0);
                std::vector<uint64_t> lastPerCpu(256, 0);
                gBadLog += count > lo.size();
                for (uint32_t k = 0; k < count && k < lo.size(); ++k) {
                    // Two recorders on one CPU may tear an entry (accepted): only
                    // an inversion beyond a second counts.
                    const uint32_t cpu = (ev[k] >> 8) & 0xFF;
                    const uint64_t t = (static_cast<uint64_t>(hi[k]) << 32) | lo[k];
                    gBadLog += static_cast<long>(cpu) >= cpus || t + 1000 * kMs < lastPerCpu[cpu];
                    lastPerCpu[cpu] = std::max(lastPerCpu[cpu], t);
                }
                break;
            }
            case 10: {  // the holder releases, maybe while it fires; no call after the release
                Ticket ticket{U64(deadline)};
                WaitNode* node = nullptr;
                if (api.EventWaitCallback(nullptr, &deadline, KeepCallback, &ticket, 0, &node) != 0) break;
                usleep(static_cast<useconds_t>(rng() % 4000));
                e->ReleaseWait(node);
                ticket.deadline = ~0ull;  // a late call now counts as early
                break;
            }
        }
        st->opStart = 0, gCount[op].fetch_add(1);
    }
    quelta::PalSemaphoreDestroy(mine);
}

uint64_t StressSeconds() {
    if (const char* s = std::getenv("QUELTA_STRESS_SECONDS")) return std::strtoull(s, nullptr, 10);
#if defined(__arm__) || defined(QUELTA_SANITIZED)
    return 8;
#else
    return 20;
#endif
}

TEST(Stress, EveryWaitAtOnceFromManyThreads) {
    testsupport::LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    lib.log()->SetEnabled(1);
    lib.api().SetCallback(TimeCallback, nullptr);
    for (PalSemaphore*& s : gSharedSems) s = testsupport::NewRuntimeSemaphore();
    std::atomic<bool> stop{false};
    std::vector<ThreadState> states(kThreads);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) threads.emplace_back(Worker, &lib, i, &states[i], &stop);
    for (const uint64_t start = MonoNowNs(); MonoNowNs() - start < StressSeconds() * 1000 * kMs;) {
        usleep(100000);
        for (int i = 0; i < kThreads; ++i) {  // the watchdog: any call stuck for 10 s
            const uint64_t t = states[i].opStart.load();
            if (t == 0 || MonoNowNs() - t < 10000 * kMs) continue;
            std::fprintf(stderr, "watchdog: thread %d stuck in '%s'\n", i, kOpNames[states[i].op.load()]);
            std::abort();  // a core/stack dump beats a hung CI
        }
    }
    stop = true;
    for (auto& t : threads) t.join();
    for (int i = 0; i < 400 && gCallbacksPending.load() > 0; ++i) usleep(5000);
    lib.api().SetCallback(nullptr, nullptr);
    for (int op = 0; op < kOps; ++op) EXPECT_GT(gCount[op].load(), 0u) << kOpNames[op];
    EXPECT_EQ(gEarly.load(), 0u);
    EXPECT_EQ(gBadLog.load(), 0u) << "read-outs out of order or naming CPUs that do not exist";
    EXPECT_EQ(gCallbacksPending.load(), 0);
    for (int k = 0; k < kShared; ++k) {
        const uint64_t pending = testsupport::Drain(gSharedSems[k]);
        EXPECT_EQ(gPosts[k].load(), gTakes[k].load() + pending) << "semaphore " << k << ": posts lost or invented";
        testsupport::DeleteRuntimeSemaphore(gSharedSems[k]);
    }
    testsupport::ExpectPoolWhole(lib, [](PalSemaphore*) {});
}

}  // namespace
