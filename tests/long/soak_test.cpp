// Ten minutes of ticks (QUELTA_SOAK_SECONDS to change it) with waits running
// alongside, through the loaded library. The tick count must match the
// elapsed monotonic time: one tick per millisecond, except that a pass more
// than a period late restarts the grid instead of replaying missed ticks.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <thread>
#include <vector>

#include "LoadedLibrary.h"
#include "TestSupport.h"

using testsupport::MonoNowNs;

namespace {

constexpr uint64_t kMs = 1000000;

std::atomic<uint64_t> gTicks{0};
std::atomic<uint64_t> gLastSerial{0};
std::atomic<uint64_t> gSerialGaps{0};
std::atomic<uint64_t> gLastTickAt{0};
std::atomic<uint64_t> gLongGaps{0};  // more than 1.5 periods between ticks
std::atomic<uint64_t> gMaxGap{0};

void OnTick(uint64_t serial) {
    const uint64_t now = MonoNowNs();
    const uint64_t n = gTicks.fetch_add(1);
    if (n > 0 && serial != gLastSerial.load() + 1) gSerialGaps.fetch_add(1);
    gLastSerial = serial;
    const uint64_t last = gLastTickAt.exchange(now);
    if (last != 0) {
        const uint64_t gap = now - last;
        if (gap > kMs + kMs / 2) gLongGaps.fetch_add(1);
        if (gap > gMaxGap.load()) gMaxGap = gap;
    }
}

TEST(Soak, TicksKeepTimeForMinutesWithWaitsAlongside) {
    uint64_t seconds = 600;
    if (const char* s = std::getenv("QUELTA_SOAK_SECONDS")) seconds = std::strtoull(s, nullptr, 10);
    testsupport::LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    std::atomic<bool> stop{false};
    std::atomic<uint64_t> early{0}, waits{0};
    std::vector<std::thread> waiters;
    for (int i = 0; i < 4; ++i) {
        waiters.emplace_back([&, i] {
            PalSemaphore* s = testsupport::NewRuntimeSemaphore();
            while (!stop.load()) {
                const uint32_t timeout = 300 + 700 * static_cast<uint32_t>(i);
                const uint64_t t0 = MonoNowNs();
                if (lib.api().EventWait(s, timeout) == 1 && MonoNowNs() < t0 + timeout * 1000ull) early++;
                ClockTime g;
                lib.engine()->ReadGlobal2(g);
                const uint64_t t = ((static_cast<uint64_t>(g.high) << 32) | g.low) + 1700000;
                const ClockTime target{static_cast<uint32_t>(t), static_cast<uint32_t>(t >> 32)};
                ClockTime after{};
                lib.api().WaitUntilGlobalClocks64(&target, nullptr, &after, 0);
                if (((static_cast<uint64_t>(after.high) << 32) | after.low) < t) early++;
                waits += 2;
            }
            testsupport::DeleteRuntimeSemaphore(s);
        });
    }
    lib.engine()->RegisterTickCallback(OnTick);
    const uint64_t start = MonoNowNs();
    uint64_t nextReport = 60;
    while (MonoNowNs() - start < seconds * 1000 * kMs) {
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        const uint64_t elapsed = (MonoNowNs() - start) / (1000 * kMs);
        if (elapsed >= nextReport) {
            std::printf("%4llu s: %llu ticks, %llu grid restarts, max gap %.2f ms\n",
                        static_cast<unsigned long long>(elapsed),
                        static_cast<unsigned long long>(gTicks.load()),
                        static_cast<unsigned long long>(gLongGaps.load()),
                        static_cast<double>(gMaxGap.load()) / kMs);
            std::fflush(stdout);
            nextReport += 60;
        }
    }
    lib.engine()->UnregisterTickCallback(OnTick);
    const uint64_t elapsedMs = (MonoNowNs() - start) / kMs;
    stop = true;
    for (auto& t : waiters) t.join();
    const uint64_t ticks = gTicks.load();
    std::printf("elapsed %llu ms, ticks %llu, grid restarts %llu, max gap %.2f ms, waits %llu\n",
                static_cast<unsigned long long>(elapsedMs), static_cast<unsigned long long>(ticks),
                static_cast<unsigned long long>(gLongGaps.load()),
                static_cast<double>(gMaxGap.load()) / kMs, static_cast<unsigned long long>(waits.load()));
    EXPECT_EQ(gSerialGaps.load(), 0u);
    EXPECT_EQ(early.load(), 0u);
    // Never more ticks than the grid allows (a restart adds at most one at
    // once); fewer only by what late passes skipped.
    EXPECT_LE(ticks, elapsedMs + gLongGaps.load() + 2);
    EXPECT_GE(ticks + gLongGaps.load() * 50, elapsedMs * 95 / 100);
}

}  // namespace
