// Nothing on a timing path page-faults once the library is up: the wait-node
// pool, the semaphores and the timer thread's stack are faulted in at
// start-up. The first call of each kind may still fault (the code it runs,
// the caller's own stack); the few hundred after it must not.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <atomic>

#include "LibraryFixture.h"
#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"

using testsupport::CT;
using testsupport::U64;

namespace {

constexpr uint64_t kUs = 1000;

long MinorFaults() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_minflt;
}

void Nothing(void*) {}
std::atomic<int> gFired{0};
uint32_t CountFire(void*) {
    gFired.fetch_add(1);
    return 1;
}

using PageFaults = testsupport::LibraryFixture;

TEST_F(PageFaults, WaitsOfEveryKindDoNotFaultAfterTheirFirstCall) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer faults pages in for its own trace of every access";
#endif
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no SCHED_FIFO: the tick service cannot serve";
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    api().SetCallback(&Nothing, nullptr);
    uint32_t generation = 0;
    ClockTime g;
    engine()->ReadGlobalWithGeneration(g, generation);
    auto round = [&](int i) {
        const uint64_t ahead = (100 + (i % 7) * 50) * kUs;
        api().EventWait(s, static_cast<uint32_t>(ahead / kUs));
        const ClockTime mono = CT(MonoNow() + ahead);
        api().EventWaitCallback(nullptr, &mono, nullptr, nullptr, 0, nullptr);
        const ClockTime global = CT(GlobalNow() + ahead);
        uint32_t abortFlag = 0;
        ClockTime after{};
        api().WaitUntilGlobalClocks64(&global, &abortFlag, &after, generation);
        api().EventWaitCallback(nullptr, &global, nullptr, nullptr, 1, nullptr);
        api().EventWaitCallback(nullptr, &mono, &CountFire, nullptr, 0, nullptr);
        api().SetCallbackTime(&mono, 0);
        api().WaitUntilClocks64(&mono);
    };
    for (int i = 0; i < 7; ++i) round(i);  // first calls, every timeout once
    const long before = MinorFaults();
    for (int i = 0; i < 300; ++i) round(i);
    const long faults = MinorFaults() - before;
    api().SetCallback(nullptr, nullptr);
    printf("%ld minor faults over 300 rounds of every wait\n", faults);
    EXPECT_EQ(faults, 0);
    EXPECT_GT(gFired.load(), 0);
    testsupport::DeleteRuntimeSemaphore(s);
}

}  // namespace
