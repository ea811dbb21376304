// A semaphore's mutex lends a blocked higher-priority poster's priority to its holder.
#include <gtest/gtest.h>

#include <atomic>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {
namespace {

// A thread's effective priority (/proc stat field 18): -1 - its real-time
// priority, inherited priority included.
int EffectivePriority(int32_t tid) {
    std::ifstream in("/proc/self/task/" + std::to_string(tid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>()), field;
    std::istringstream fields(text.substr(text.rfind(')') + 2));  // from field 3
    for (int i = 3; i <= 18 && (fields >> field); ++i) {}
    return std::stoi(field);
}

TEST(PalRealtime, SemaphoreMutexLendsPriorityToItsHolder) {
    if (!testsupport::CanUseRealtime()) GTEST_SKIP() << "no real-time privilege";
    ASSERT_EQ(PalInitialize(), 1u);
    PalSemaphore* sem = nullptr;
    ASSERT_EQ(PalSemaphoreCreate(&sem), 0);
    std::atomic<int32_t> holderTid{0};
    std::atomic<bool> release{false};
    std::thread holder([&] {
        ASSERT_EQ(PalSetThreadPriority(pthread_self(), 10), 0);
        EXPECT_EQ(sched_getscheduler(0), SCHED_RR);
        EXPECT_EQ(PalGetThreadPriority(pthread_self()), 10);
        pthread_mutex_lock(&sem->mutex);
        holderTid = PalGetThreadId();
        while (!release) PalSleepMilliseconds(1);
        pthread_mutex_unlock(&sem->mutex);
    });
    ASSERT_TRUE(testsupport::Eventually([&] { return holderTid != 0; }));
    const bool visible = EffectivePriority(holderTid) == -11;
    std::thread poster([&] { PalSetThreadPriority(pthread_self(), 30), PalSemaphorePost(sem); });  // blocks on the mutex
    const bool inherited = visible && testsupport::Eventually([&] { return EffectivePriority(holderTid) == -31; });
    release = true;
    holder.join();
    poster.join();
    EXPECT_TRUE(inherited || !visible) << "the holder did not inherit the poster's priority";
    EXPECT_EQ(PalSemaphoreWait(sem, 0), 0u);
    EXPECT_EQ(PalSemaphoreDestroy(sem), 0);
    if (!visible) GTEST_SKIP() << "thread priorities are not visible in /proc here";
}

}  // namespace
}  // namespace quelta
