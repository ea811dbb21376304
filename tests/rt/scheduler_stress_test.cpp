// Many caller threads against the live timer thread: every kind of node use
// (own semaphore, caller semaphore, callback, held and cancelled nodes, event
// waits with posts from other threads, global-clock waits) at once. Afterwards
// every node must be back on the free list, and no wait may have ended early.
#include <gtest/gtest.h>

#include <atomic>
#include <random>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"
#include "tLinux/PalSemaphoreOps.h"

using namespace quelta;

namespace {

constexpr uint64_t kUs = 1000;

std::atomic<uint64_t> gEarly{0};
std::atomic<uint64_t> gOps{0};
std::atomic<int> gCallbacksInFlight{0};

struct CallbackTicket {
    uint64_t deadline;
    uint32_t release;
};

uint32_t CheckedCallback(void* arg) {
    auto* ticket = static_cast<CallbackTicket*>(arg);
    if (testsupport::MonoNowNs() < ticket->deadline) gEarly.fetch_add(1);
    uint32_t release = ticket->release;
    delete ticket;
    gCallbacksInFlight.fetch_sub(1);
    return release;
}

uint32_t KeepCallback(void* arg) {
    auto* ticket = static_cast<CallbackTicket*>(arg);
    if (testsupport::MonoNowNs() < ticket->deadline) gEarly.fetch_add(1);
    return 0;
}

uint64_t MonoNow(iKPusTimingEngine* e) {
    ClockTime t;
    e->ReadMonotonic0(t);
    return ToU64(t);
}

void Worker(int id, std::atomic<bool>* stop, std::vector<PalSemaphore*>* shared) {
    std::mt19937 rng(1234 + id);
    iKPusTimingEngine* e = gEngine.load();
    PalSemaphore* mine = nullptr;
    PalSemaphoreCreate(&mine);
    while (!stop->load()) {
        const uint64_t delay = rng() % (3000 * kUs);
        const ClockTime deadline = FromU64(MonoNow(e) + delay);
        switch (rng() % 7) {
            case 0: {  // own semaphore: blocks until the deadline
                if (quelta_iTSCEvent_Wait_Callback_C(nullptr, &deadline, nullptr, nullptr, 0, nullptr) == 0 &&
                    testsupport::MonoNowNs() < ToU64(deadline)) {
                    gEarly.fetch_add(1);
                }
                break;
            }
            case 1: {  // caller semaphore, node held; cancelled early or released after the post
                WaitNode* node = nullptr;
                if (quelta_iTSCEvent_Wait_Callback_C(mine, &deadline, nullptr, nullptr, 0, &node) != 0) break;
                if (rng() % 2) {
                    e->ReleaseWait(node);  // cancel
                    PalSemaphoreWait(mine, 0);
                } else {
                    PalSemaphoreWait(mine, -1);
                    if (testsupport::MonoNowNs() < ToU64(deadline)) gEarly.fetch_add(1);
                    e->ReleaseWait(node);
                }
                break;
            }
            case 2: {  // callback only: the tick service gives the node back itself
                auto* ticket = new CallbackTicket{ToU64(deadline), 1};
                gCallbacksInFlight.fetch_add(1);
                if (quelta_iTSCEvent_Wait_Callback_C(nullptr, &deadline, CheckedCallback, ticket, 0, nullptr) != 0) {
                    delete ticket;
                    gCallbacksInFlight.fetch_sub(1);
                }
                break;
            }
            case 3: {  // callback keeps the node; the holder releases it, maybe while it fires
                // The ticket lives on this stack: once ReleaseWait has returned
                // the library must no longer call the callback with it.
                CallbackTicket ticket{ToU64(deadline), 0};
                WaitNode* node = nullptr;
                if (quelta_iTSCEvent_Wait_Callback_C(nullptr, &deadline, KeepCallback, &ticket, 0, &node) != 0) {
                    break;
                }
                timespec ts{0, static_cast<long>(rng() % (4000 * kUs))};
                nanosleep(&ts, nullptr);
                e->ReleaseWait(node);
                ticket.deadline = ~0ull;  // a late call would now count as early
                break;
            }
            case 4: {  // event wait with a timeout; other threads post at random
                const uint32_t timeout = static_cast<uint32_t>(rng() % 3000);
                const uint64_t start = testsupport::MonoNowNs();
                PalSemaphore* s = (*shared)[rng() % shared->size()];
                if (quelta_iTSCEvent_Wait_C(s, timeout) == 1 &&
                    testsupport::MonoNowNs() < start + timeout * kUs) {
                    gEarly.fetch_add(1);
                }
                break;
            }
            case 5: {  // post somebody's semaphore
                PalSemaphorePost((*shared)[rng() % shared->size()]);
                break;
            }
            case 6: {  // global-clock wait
                ClockTime g;
                uint32_t generation = 0;
                e->ReadGlobalWithGeneration(g, generation);
                const ClockTime target = FromU64(ToU64(g) + delay);
                ClockTime after{};
                uint32_t abortFlag = 0;
                quelta_iTSC_WaitUntilGlobalClocks64_C(&target, &abortFlag, &after, generation);
                if (abortFlag == 0 && Earlier(after, target)) gEarly.fetch_add(1);
                break;
            }
        }
        gOps.fetch_add(1);
    }
    PalSemaphoreDestroy(mine);
}

TEST(SchedulerStress, NodesStayWholeUnderManyCallersAndTheTimerThread) {
    ASSERT_EQ(LibraryControl(0, 1, 0), 1u);
    ASSERT_TRUE(TimerServing()) << "the timer thread needs SCHED_FIFO";
    std::vector<PalSemaphore*> shared(8, nullptr);
    for (auto*& s : shared) PalSemaphoreCreate(&s);
    std::atomic<bool> stop{false};
    std::vector<std::thread> threads;
    for (int i = 0; i < 16; ++i) threads.emplace_back(Worker, i, &stop, &shared);
    const uint64_t start = testsupport::MonoNowNs();
    while (testsupport::MonoNowNs() - start < 4000000000ull) {
        timespec ts{0, 50000000};
        nanosleep(&ts, nullptr);
    }
    stop = true;
    for (auto& s : shared) PalSemaphorePost(s);
    for (auto& t : threads) t.join();
    // Let the queued callback nodes (deadlines at most 3 ms ahead) fire.
    for (int i = 0; i < 200 && gCallbacksInFlight.load() > 0; ++i) {
        timespec ts{0, 5000000};
        nanosleep(&ts, nullptr);
    }
    EXPECT_EQ(gCallbacksInFlight.load(), 0);
    uint32_t freeCount = 0, queued = 0, held = 0;
    EXPECT_TRUE(AuditWaitNodes(&freeCount, &queued, &held));
    EXPECT_EQ(freeCount, kWaitNodeCount);
    EXPECT_EQ(queued, 0u);
    EXPECT_EQ(held, 0u);
    EXPECT_EQ(gEarly.load(), 0u);
    std::printf("operations: %llu\n", static_cast<unsigned long long>(gOps.load()));
    EXPECT_GT(gOps.load(), 1000u);
    LibraryControl(0, 0, 0);
    for (auto* s : shared) PalSemaphoreDestroy(s);
}

}  // namespace
