// The stop while callers keep calling: calls that were inside are ended,
// calls that enter during or after it are refused, and none of them touches
// a node, a semaphore or the engine after it is gone (the sanitizer build
// turns such a touch into a failure).
#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalSemaphoreOps.h"

using namespace quelta;

namespace {

constexpr uint64_t kUs = 1000, kMs = 1000000;

ClockTime Ct(uint64_t ns) { return ClockTime{static_cast<uint32_t>(ns), static_cast<uint32_t>(ns >> 32)}; }

// The global clock from the wall clock and the epoch offset taken while the
// engine existed (the engine itself goes away in the stop).
std::atomic<int64_t> gEpochSeconds{0};
uint64_t GlobalNow() {
    return testsupport::RealNowNs() + static_cast<uint64_t>(gEpochSeconds.load()) * 1000000000ull;
}

TEST(StopRace, CallsDuringTheStopAreEndedOrRefusedAndTouchNothingFreed) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    testing::internal::CaptureStdout();
    const uint32_t started = LibraryControl(0, 1, 0);
    const std::string out = testing::internal::GetCapturedStdout();
    ASSERT_EQ(started, 1u) << out;

    gEpochSeconds.store(gEngine.load()->epochOffset.load());
    PalSemaphore* runtimeSemaphore = nullptr;
    ASSERT_EQ(PalSemaphoreCreate(&runtimeSemaphore), 0);
    std::atomic<bool> stopCalling{false};
    std::atomic<int> calls{0}, unexpected{0};
    auto expectOneOf = [&](uint32_t r, std::initializer_list<uint32_t> allowed) {
        if (std::set<uint32_t>(allowed).count(r) == 0) unexpected.fetch_add(1);
        calls.fetch_add(1);
    };
    std::vector<std::thread> callers;
    for (int kind = 0; kind < 4; ++kind) {
        callers.emplace_back([&, kind] {
            while (!stopCalling.load()) {
                const ClockTime soon = Ct(testsupport::MonoNowNs() + 300 * kUs);
                switch (kind) {
                    case 0:
                        expectOneOf(quelta_iTSCEvent_Wait_C(runtimeSemaphore, 200), {0, 1, 3});
                        break;
                    case 1:
                        expectOneOf(quelta_iTSCEvent_Wait_Callback_C(nullptr, &soon, nullptr, nullptr, 0, nullptr),
                                    {0, 1, 3});
                        break;
                    case 2: {
                        WaitNode* node = nullptr;
                        const uint32_t r =
                            quelta_iTSCEvent_Wait_Callback_C(runtimeSemaphore, &soon, nullptr, nullptr, 0, &node);
                        expectOneOf(r, {0, 1, 3});
                        if (r != 3) ReleaseWaitNode(node);
                        break;
                    }
                    case 3: {
                        const ClockTime target = Ct(GlobalNow() + 300 * kUs);
                        uint32_t abortFlag = 0;
                        ClockTime after{};
                        quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, 0);
                        expectOneOf(abortFlag, {0, 1, 0xFFFFFFFFu});
                        break;
                    }
                }
            }
        });
    }
    usleep(50000);
    const int before = calls.load();
    LibraryControl(0, 0, 0);
    const int atStop = calls.load();
    usleep(30000);  // calls go on against the stopped library
    stopCalling.store(true);
    for (std::thread& t : callers) t.join();
    PalSemaphoreDestroy(runtimeSemaphore);

    printf("%d calls before the stop, %d by its end, %d in all\n", before, atStop, calls.load());
    EXPECT_GT(before, 20) << "the callers did not get going";
    EXPECT_GT(calls.load(), atStop) << "calls after the stop did not return";
    EXPECT_EQ(unexpected.load(), 0);
    EXPECT_EQ(GetEngine__MERIDOX(), nullptr);
}

}  // namespace
