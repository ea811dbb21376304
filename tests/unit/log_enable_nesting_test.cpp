// The log's nested switch, AdjustEnabled (log slot 12), used by several
// threads at once: recording stays on while the sum of all adjustments is
// above 0, so no adjustment may be lost when threads adjust together.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "engine/ClockTimeOps.h"
#include "log/tKPLogEngine.h"

using namespace quelta;  // the engine class, wherever its namespace

namespace {

// True when the engine records: an entry of its own (a new time and event)
// is logged and looked for among the newest entries read back. The read-out
// puts the CPU into bits 8-15 of each event, so the events leave them 0.
bool Records(iKPLogEngine* log) {
    static uint32_t probe = 0;
    ++probe;
    const uint32_t event = probe << 16;
    log->LogAt1(FromU64(1000000 + probe), event);
    uint32_t low[64], high[64], events[64];
    uint32_t count = 64;
    log->ReadOutMerged(count, low, high, events, nullptr, 0);
    for (uint32_t i = 0; i < count; ++i) {
        if ((events[i] & ~0xFF00u) == event) return true;
    }
    return false;
}

TEST(LogEnableNesting, AdjustmentsFromManyThreadsAreAllCounted) {
    iKPLogEngine* log = tKPLogEngine::Create();
    ASSERT_NE(log, nullptr);
    // Each thread adjusts for 200 ms (not a fixed count, which a loaded
    // machine could run one thread after another within single time slices,
    // never at the same time), counting what it added.
    constexpr int kThreads = 4;
    std::atomic<int> ready{0};
    std::atomic<bool> stop{false};
    std::atomic<int64_t> sum{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([log, &ready, &stop, &sum] {
            ready.fetch_add(1);
            while (ready.load() < kThreads) std::this_thread::yield();  // all start together
            int64_t rounds = 0;
            while (!stop.load(std::memory_order_relaxed)) {
                for (int i = 0; i < 256; ++i) {
                    log->AdjustEnabled(+2);
                    log->AdjustEnabled(-1);
                }
                rounds += 256;
            }
            sum.fetch_add(rounds);
        });
    }
    while (ready.load() < kThreads) std::this_thread::yield();
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    stop.store(true);
    for (auto& t : threads) t.join();
    // One less than the sum keeps recording on, the last one switches it off.
    const int64_t total = sum.load();
    ASSERT_LT(total, int64_t(1) << 30);
    log->AdjustEnabled(-static_cast<int32_t>(total - 1));
    EXPECT_TRUE(Records(log)) << "adjustments made at the same time were lost";
    log->AdjustEnabled(-1);
    EXPECT_FALSE(Records(log)) << "adjustments made at the same time were lost (or counted twice)";
    delete log;
}

}  // namespace
