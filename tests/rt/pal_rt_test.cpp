// Needs real-time scheduling: SCHED_RR priorities, and priority inheritance
// on the semaphore's mutex.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {
namespace {

// A thread's effective priority (/proc/self/task/<tid>/stat, field 18):
// -1 - its real-time priority, including any priority it inherited.
int EffectivePriority(int32_t tid) {
    std::ifstream in("/proc/self/task/" + std::to_string(tid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::istringstream fields(text.substr(text.rfind(')') + 2));  // from field 3
    std::string field;
    for (int i = 3; i <= 18 && (fields >> field); ++i) continue;
    return std::stoi(field);
}

// A SCHED_RR holder of the semaphore's mutex runs at the priority of a
// higher thread that blocks posting to it, and the post goes through after.
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
        while (!release) std::this_thread::sleep_for(std::chrono::milliseconds(1));
        pthread_mutex_unlock(&sem->mutex);
    });
    while (holderTid == 0) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    const bool visible = EffectivePriority(holderTid) == -11;
    std::thread poster([&] {
        PalSetThreadPriority(pthread_self(), 30);
        PalSemaphorePost(sem);  // blocks on the held mutex
    });
    int seen = 0;
    for (int i = 0; visible && i < 2000 && seen != -31; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
        seen = EffectivePriority(holderTid);
    }
    release = true;
    holder.join();
    poster.join();
    if (visible) {
        EXPECT_EQ(seen, -31) << "the holder did not inherit the poster's priority";
    }
    EXPECT_EQ(PalSemaphoreWait(sem, 0), 0u);
    EXPECT_EQ(PalSemaphoreDestroy(sem), 0);
    if (!visible) GTEST_SKIP() << "thread priorities are not visible in /proc here";
}

}  // namespace
}  // namespace quelta
