// A scheduler under the test's control: a fake timer that records its arming, an engine whose global
// clock is the monotonic one plus its epoch offset (0), the node pool alone, and a settable "now".
#ifndef QUELTA_TESTS_SCHEDULERHARNESS_H
#define QUELTA_TESTS_SCHEDULERHARNESS_H

#include <cstdint>
#include <cstdlib>
#include <vector>
#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TickService.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace testsupport {

struct FakeTimer : quelta::tKPusLinuxNanoSleepTimer {
    FakeTimer() { state.status.store(static_cast<int32_t>(quelta::TimerThreadStatus::kServing)); }
    // A scheduler re-arming without end (a fault) ends the process, not the machine's memory.
    void SetExpiry(ClockTime when) override { armed.size() < 1000000 ? armed.push_back(when) : std::abort(); }
    void ExpireNow() override { expireNowCalls++; }
    uint64_t LastArmed() const { return armed.empty() ? quelta::kNeverTime64 : quelta::ToU64(armed.back()); }
    std::vector<ClockTime> armed;
    int expireNowCalls = 0;
};

class SchedulerHarness {
public:
    SchedulerHarness() {  // now = 1 s, the next tick one period later
        using namespace quelta;
        now_ = 1000000000ull;
        gConvertSyscallNr.store(-1), gConvertStandInEnabled.store(false);
        gEngine.store(new tKPusTimingEngine()), gEngine.load()->SetEpochOffset(0);
        gTimer.store(timer = new FakeTimer());
        InitWaitNodePool(pool, kWaitNodeCount), gEventSystemReady.store(1);
        gTickPeriod.Store(kTickPeriodClocks), gNextTick.Store(now_ + kTickPeriodClocks), gNextDeadline.Store(now_ + kTickPeriodClocks);
        gMonotonicCallbackTime.Store(kNeverTime64), gGlobalCallbackTime.Store(kNeverTime64);
        gCallbackFn.store(nullptr), gCallbackArg.store(nullptr), gTickCallback.store(nullptr);
        ResetTickServiceState();
        gTickNowOverride = [] { return now_; };
    }
    ~SchedulerHarness() {  // everything back to its load-time state
        using namespace quelta;
        gTickNowOverride = nullptr;
        for (WaitNode& n : pool) if (PalSemaphore* s = n.ownSemaphore.exchange(nullptr)) PalSemaphoreDestroy(s);
        gEventSystemReady.store(0), gWaitNodePool.store(nullptr), gFreeList.store(nullptr), gWaitList.store(nullptr);
        RemoveTimer(), delete gEngine.exchange(nullptr);
        gCallbackFn.store(nullptr), gCallbackArg.store(nullptr), gTickCallback.store(nullptr);
        gConvertStandInEnabled.store(true), SetLoadTimeSchedulerState();
    }
    void SetNow(uint64_t ns) { now_ = ns; }  uint64_t Now() const { return now_; }
    void Pass() { quelta::TickServiceRoutine(); }  // one tick service pass at Now()
    void RemoveTimer() { delete quelta::gTimer.exchange(nullptr), timer = nullptr; }
    void GiveNodesSemaphores() {  // as start-up does; the waits that block on a node need one
        quelta::PalInitialize();
        for (WaitNode& n : pool) {
            PalSemaphore* s = nullptr;
            quelta::PalSemaphoreCreate(&s), n.ownSemaphore.store(s);
        }
    }
    WaitNode* Take(uint32_t isGlobal = 0, uint32_t autoRelease = 1, uint8_t abortable = 0, uint64_t selfWake = 0) {
        WaitNode* n = quelta::TakeFreeNode();  // as the event waits take it
        if (n != nullptr) n->fireCount.store(0), n->prev.store(nullptr), n->semaphore.store(nullptr), n->isGlobal.store(isGlobal),
            n->autoRelease.store(autoRelease), n->abortable.store(abortable), n->selfWakeAt.store(selfWake);
        return n;
    }
    std::vector<WaitNode*> ListOrder() const {
        std::vector<WaitNode*> out;
        for (WaitNode* n = quelta::gWaitList.load(); n != nullptr; n = n->next.load()) out.push_back(n);
        return out;
    }
    uint32_t FreeNodes() const { uint32_t n = 0; return quelta::AuditWaitNodes(&n, nullptr, nullptr) ? n : 0; }  // 0: lists broken
    FakeTimer* timer = nullptr;
    WaitNode pool[quelta::kWaitNodeCount];

private:
    static inline uint64_t now_ = 0;
};

}  // namespace testsupport

#endif
