// What the runtime can get wrong, through the loaded library: each case is
// refused or handled as documented in the README's table, without blocking
// and without disturbing the wait nodes.
#include <gtest/gtest.h>

#include <atomic>
#include <vector>

#include "LibraryFixture.h"
#include "TestSupport.h"

using testsupport::CT;
using testsupport::LoadedLibrary;
using testsupport::U64;
using testsupport::MonoNowNs;

namespace {

constexpr uint64_t kMs = 1000000;

using BadInput = testsupport::LibraryFixture;

TEST_F(BadInput, NullPointersWhereTheInterfaceAllowsNoneAreRefused) {
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(api().EventWait(nullptr, 1000), 3u);
    EXPECT_EQ(api().EventWaitCallback(nullptr, nullptr, nullptr, nullptr, 0, nullptr), 3u);
    EXPECT_EQ(api().SetCallbackTime(nullptr, 0), 0u);
    EXPECT_EQ(api().SetCallbackTime(nullptr, -1), 0u);
    api().WaitUntilClocks64(nullptr);               // no target: no wait
    uint32_t abortFlag = 7;
    ClockTime after{};
    api().WaitUntilGlobalClocks64(nullptr, &abortFlag, &after, 0);  // as target 0
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_NE(U64(after), 0u);
    api().WaitUntilGlobalClocks64(nullptr, nullptr, nullptr, 0);    // nothing to report
    engine()->ReleaseWait(nullptr);
    EXPECT_LT(MonoNowNs() - t0, 100 * kMs);
    ExpectPoolWhole();
}

TEST_F(BadInput, ForeignAndTwiceReleasedNodesAreRefused) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    const ClockTime far = CT(MonoNow() + 60000 * kMs);
    WaitNode* n = nullptr;
    ASSERT_EQ(api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &n), 0u);
    engine()->ReleaseWait(n);
    engine()->ReleaseWait(n);  // twice
    ClockTime notANode{};
    WaitNode* foreign = reinterpret_cast<WaitNode*>(&notANode);
    engine()->ReleaseWait(foreign);
    engine()->ReleaseWait(reinterpret_cast<WaitNode*>(reinterpret_cast<char*>(n) + 1));
    testsupport::DeleteRuntimeSemaphore(s);
    ExpectPoolWhole();
}

TEST_F(BadInput, ZeroArgumentsMeanNoWait) {
    const uint64_t t0 = MonoNowNs();
    api().WaitClocks(0);
    api().WaitUntilNextMultipleClocks(0);
    api().WaitMicroSeconds(0);
    api().WaitUntilMicroSeconds(0);
    api().WaitUntilNextMultipleMicroSeconds(0);
    engine()->WaitUntilNextMultipleClocks64(ClockTime{0, 0});
    const ClockTime zero{0, 0};
    api().WaitUntilClocks64(&zero);  // long past
    EXPECT_LT(MonoNowNs() - t0, 50 * kMs);
}

std::atomic<int> gNeverCalls{0};
void CountNeverCall(void*) { gNeverCalls.fetch_add(1); }

TEST_F(BadInput, SpecialTimesAsDeadlines) {
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    // NeverTime never fires; the node waits until it is cancelled.
    const ClockTime never{0xFFFFFFFFu, 0xFFFFFFFEu};
    WaitNode* n = nullptr;
    ASSERT_EQ(api().EventWaitCallback(s, &never, nullptr, nullptr, 0, &n), 0u);
    // A high word of 0xFFFFFFFF sorts before every time: fires at once.
    const ClockTime before{0, 0xFFFFFFFFu};
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(api().EventWaitCallback(nullptr, &before, nullptr, nullptr, 0, nullptr), 0u);
    EXPECT_LT(MonoNowNs() - t0, 200 * kMs);
    engine()->ReleaseWait(n);
    // A past global target: no wait, abort flag 0, the time after the call.
    ClockTime g;
    uint32_t generation = 0;
    engine()->ReadGlobalWithGeneration(g, generation);
    const ClockTime past = CT(U64(g) - 1000 * kMs);
    uint32_t abortFlag = 7;
    ClockTime after{};
    const uint64_t t1 = MonoNowNs();
    api().WaitUntilGlobalClocks64(&past, &abortFlag, &after, generation);
    EXPECT_LT(MonoNowNs() - t1, 100 * kMs);
    EXPECT_EQ(abortFlag, 0u);
    EXPECT_GE(U64(after), U64(g));
    // NeverTime callback times are stored (1) and never fire.
    gNeverCalls.store(0);
    api().SetCallback(&CountNeverCall, nullptr);
    EXPECT_EQ(api().SetCallbackTime(&never, 0), 1u);
    EXPECT_EQ(api().SetCallbackTime(&never, -1), 1u);
    api().WaitMicroSeconds(20000);  // twenty ticks
    api().SetCallback(nullptr, nullptr);
    EXPECT_EQ(gNeverCalls.load(), 0);
    testsupport::DeleteRuntimeSemaphore(s);
    ExpectPoolWhole();
}

TEST_F(BadInput, TimeoutsBeyondTheTickPathRangeWrapAsDocumented) {
    // The tick-service timeout is converted to a 32-bit clock count: values
    // above 4,294,967 us wrap. 4,294,968 us becomes 704 clocks.
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(api().EventWait(s, 4294968u), 1u);
    EXPECT_LT(MonoNowNs() - t0, 500 * kMs);
    testsupport::DeleteRuntimeSemaphore(s);
}

TEST_F(BadInput, LogCapacitiesAndReadOutCounts) {
    iKPLogEngine* log = lib->log()->CreateLogEngine();  // an engine of our own
    ASSERT_NE(log, nullptr);
    EXPECT_EQ(log->Configure(0), 0u);        // inline rings of 10
    EXPECT_EQ(log->Configure(1), 1u);
    EXPECT_EQ(log->Configure(1 << 28), 10u); // would overflow: inline fallback
    EXPECT_EQ(log->Configure(-2), 10u);      // taken as unsigned: too large
    EXPECT_EQ(log->Configure(-1), 5000u);
    log->SetEnabled(1);
    for (int i = 0; i < 5; ++i) log->LogNow5(static_cast<uint32_t>(i));
    uint32_t lo[16], hi[16], ev[16];
    uint32_t count = 16;  // more than is held: clipped
    log->ReadOut7(count, lo, hi, ev, 0);
    EXPECT_EQ(count, 5u);
    count = 0;  // restarts the log
    log->ReadOut7(count, lo, hi, ev, 0);
    count = 16;
    log->ReadOut7(count, lo, hi, ev, 0);
    EXPECT_EQ(count, 0u);
    delete log;
}

}  // namespace
