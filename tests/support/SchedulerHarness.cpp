#include "SchedulerHarness.h"

#include <cstdio>
#include <cstdlib>

#include "engine/LibraryFrame.h"
#include "engine/SchedulerState.h"
#include "engine/TickService.h"
#include "engine/tKPusTimingEngine.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace testsupport {

using namespace quelta;

uint64_t SchedulerHarness::now_ = 0;

namespace {
constexpr size_t kMaxArmings = 1000000;
}

FakeTimer::FakeTimer() {
    state.status.store(static_cast<int32_t>(TimerThreadStatus::kServing));
}

void FakeTimer::SetExpiry(ClockTime when) {
    if (armed.size() >= kMaxArmings) {
        std::fprintf(stderr, "the timer was armed %zu times: a runaway scheduler\n", armed.size());
        std::abort();
    }
    armed.push_back(when);
}

uint64_t FakeTimer::LastArmed() const {
    return armed.empty() ? kNeverTime64 : ToU64(armed.back());
}

SchedulerHarness::SchedulerHarness() {
    now_ = 1000000000ull;
    gConvertSyscallNr.store(-1);
    gConvertStandInEnabled.store(false);
    auto* engine = new tKPusTimingEngine();
    engine->SetEpochOffset(0);
    gEngine.store(engine);
    timer = new FakeTimer();
    gTimer.store(timer);
    InitWaitNodePool(pool, kWaitNodeCount);
    gEventSystemReady.store(1);
    gTickPeriod.Store(kTickPeriodClocks);
    gNextTick.Store(now_ + kTickPeriodClocks);
    gNextDeadline.Store(now_ + kTickPeriodClocks);
    gMonotonicCallbackTime.Store(kNeverTime64);
    gGlobalCallbackTime.Store(kNeverTime64);
    gCallbackFn.store(nullptr);
    gCallbackArg.store(nullptr);
    gTickCallback.store(nullptr);
    ResetTickServiceState();
    gTickNowOverride = &SchedulerHarness::NowHook;
}

SchedulerHarness::~SchedulerHarness() {
    gTickNowOverride = nullptr;
    for (WaitNode& n : pool) {
        if (PalSemaphore* s = n.ownSemaphore.exchange(nullptr)) PalSemaphoreDestroy(s);
    }
    gEventSystemReady.store(0);
    gWaitNodePool.store(nullptr);
    gFreeList.store(nullptr);
    gWaitList.store(nullptr);
    RemoveTimer();
    delete gEngine.exchange(nullptr);
    gCallbackFn.store(nullptr);
    gCallbackArg.store(nullptr);
    gTickCallback.store(nullptr);
    gConvertStandInEnabled.store(true);
    SetLoadTimeSchedulerState();
}

void SchedulerHarness::RemoveTimer() {
    delete gTimer.exchange(nullptr);
    timer = nullptr;
}

void SchedulerHarness::GiveNodesSemaphores() {
    PalInitialize();
    for (WaitNode& n : pool) {
        PalSemaphore* s = nullptr;
        PalSemaphoreCreate(&s);
        n.ownSemaphore.store(s);
    }
}

uint64_t SchedulerHarness::NowHook() { return now_; }

void SchedulerHarness::Pass() { TickServiceRoutine(); }

WaitNode* SchedulerHarness::Take() {
    WaitNode* node = TakeFreeNode();
    if (node != nullptr) {
        node->fireCount.store(0);
        node->prev.store(nullptr);
        node->abortable.store(0);
        node->isGlobal.store(0);
        node->semaphore.store(nullptr);
    }
    return node;
}

}  // namespace testsupport
