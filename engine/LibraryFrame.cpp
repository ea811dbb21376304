// Start-up, shutdown and the accessors.
//
// Start-up order: log engine, clock-conversion call number, timer (its thread
// parked), timing engine, platform attributes, event system (pool, first tick
// 1 ms ahead, epoch offset). The stop goes the other way: timer (thread
// joined), pool and engine, log engine. Whatever a failed start leaves behind
// is released by the stop, which checks each pointer.
#include "engine/LibraryFrame.h"

#include <cstdio>
#include <new>

#include "engine/ClockTimeOps.h"
#include "engine/EpochOffset.h"
#include "engine/HandOff.h"
#include "engine/LibraryUse.h"
#include "engine/SchedulerState.h"
#include "engine/TickService.h"
#include "engine/TimerArming.h"
#include "engine/WaitList.h"
#include "engine/tKPusTimingEngine.h"
#include "log/tKPLogEngine.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "quelta/quelta.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {

std::atomic<tKPLogEngine*> gLogEngine{nullptr};
std::atomic<tKPusLinuxNanoSleepTimer*> gTimer{nullptr};
std::atomic<tKPusTimingEngine*> gEngine{nullptr};
std::atomic<uint32_t> gCpuSpeed{0};

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;
constexpr const char* kConvertSyscallFile = "/sys/kernel/zq_syscall_clock_converttime";
constexpr const char* kInitFailed = "iTSCEvent_Initialize_C FAILED!";

void DeleteLogEngine() {
    iKPLogEngine* log = Withdraw<StdAtomics>(gLogEngine);
    delete log;  // through the virtual deleting destructor
}

// Every use of gTimer by a caller (arming, the serving question) is made
// under gSchedLock, so once it is null under that lock nobody is inside the
// timer any more but its own thread, which the deletion joins.
void DeleteTimer() {
    iKPusLinuxTimer* timer;
    {
        SchedLockGuard lock;
        timer = Withdraw<StdAtomics>(gTimer);
    }
    delete timer;  // stops and joins its thread
}

void ReadConvertSyscallNumber() {
    if (gConvertSyscallNr.load(kRelaxed) != 0) return;
    FILE* f = std::fopen(kConvertSyscallFile, "r");
    gConvertSyscallNr.store(-1, kRelaxed);
    if (f == nullptr) return;
    int number = -1;
    if (std::fscanf(f, "%d", &number) == 1) gConvertSyscallNr.store(number, kRelaxed);
    std::fclose(f);
}

}  // namespace

uint32_t LibraryControl(uintptr_t, uintptr_t command, uintptr_t) {
    if (command == 1) return LibraryStart();
    if (command != 0) return 1;
    // From here no caller enters node-using code, and any that is inside and
    // blocks gives up (see LibraryUse.h).
    BeginStop<StdAtomics>(gStopping);
    DeleteTimer();
    EventSystemStop();
    DeleteLogEngine();
    return 1;
}

uint32_t LibraryStart() {
    gStopping.store(false, std::memory_order_seq_cst);
    tKPLogEngine* log = tKPLogEngine::Create();
    if (log == nullptr) {
        std::puts("Log engine initialization FAILED!");
        return 0;
    }
    Publish<StdAtomics>(gLogEngine, log);

    ReadConvertSyscallNumber();

    tKPusLinuxNanoSleepTimer* timer = new tKPusLinuxNanoSleepTimer();
    if (timer != nullptr) Publish<StdAtomics>(gTimer, timer);
    if (timer == nullptr || static_cast<iKPusLinuxTimer*>(timer)->Initialize(TickServiceRoutine) != 0) {
        std::puts(kInitFailed);
        DeleteLogEngine();
        return 0;  // the timer (no thread) stays for the stop
    }

    tKPusTimingEngine* engine = new tKPusTimingEngine();
    if (engine == nullptr) {
        std::puts(kInitFailed);
        DeleteLogEngine();
        DeleteTimer();
        return 0;
    }
    engine->serviceMode.store(0, kRelaxed);  // waits go through the tick service
    Publish<StdAtomics>(gEngine, engine);

    gCpuSpeed.store(static_cast<iKPusLinuxTimer*>(timer)->GetTicksPerMicrosecond(), kRelaxed);

    if (PalInitialize() == 0) return 0;

    if (EventSystemStart() == 0) return 1;

    std::puts(kInitFailed);
    DeleteLogEngine();
    DeleteTimer();
    return 0;  // the engine, the pool and its semaphores stay for the stop
}

uint32_t EventSystemStart() {
    gGlobalCallbackTime.Store(kNeverTime64);
    gNextDeadline.Store(kNeverTime64);
    gNextTick.Store(kNeverTime64);
    gMonotonicCallbackTime.Store(kNeverTime64);
    gTickPeriod.Store(kTickPeriodClocks);

    void* memory = PalMemAllocZeroed(kWaitNodeCount * sizeof(WaitNode));
    if (memory == nullptr) return 1;
    WaitNode* pool = static_cast<WaitNode*>(memory);
    for (uint32_t i = 0; i < kWaitNodeCount; ++i) new (&pool[i]) WaitNode();
    InitWaitNodePool(pool, kWaitNodeCount);  // linked, autoRelease 1, not-queued mark
    for (uint32_t i = 0; i < kWaitNodeCount; ++i) {
        PalSemaphore* semaphore = nullptr;
        PalSemaphoreCreate(&semaphore);
        if (semaphore == nullptr) return 1;  // the nodes before keep theirs
        PalSemaphoreWait(semaphore, 0);
        pool[i].ownSemaphore.store(semaphore, kRelaxed);
    }
    Publish<StdAtomics>(gEventSystemReady, 1u);

    // First tick, one period from now; from here the timer thread ticks.
    tKPusTimingEngine* engine = Published<StdAtomics>(gEngine);
    ClockTime now;
    static_cast<iKPusTimingEngine*>(engine)->ReadMonotonic5(now);
    {
        SchedLockGuard lock;
        const uint64_t first = ToU64(now) + gTickPeriod.Load();
        gNextTick.Store(first);
        gNextDeadline.Store(first);
        ArmTimer(FromU64(first));
    }

    engine->SetEpochOffset(ComputeEpochOffset());
    return 0;
}

void EventSystemStop() {
    WaitNode* pool = gWaitNodePool.load(std::memory_order_acquire);
    bool everyoneLeft = true;
    if (pool != nullptr) {
        // Nobody takes a node from here on; every queued node is fired (its
        // semaphore posted), every waiter blocked inside is woken and finds
        // the stop; then, bounded, everyone leaves before anything goes.
        CloseEventSystemForStop();
        WakeBlockedWaiters();
        everyoneLeft = WaitForCallersToLeave(kStopWaiterGraceMs);
        {
            SchedLockGuard lock;
            gWaitNodePool.store(nullptr, kRelaxed);
            gFreeList.store(nullptr, kRelaxed);
            gWaitList.store(nullptr, kRelaxed);
        }
        if (everyoneLeft) {
            for (uint32_t i = 0; i < kWaitNodeCount; ++i) {
                PalSemaphore* s = pool[i].ownSemaphore.exchange(nullptr, kRelaxed);
                if (s != nullptr) PalSemaphoreDestroy(s);
            }
            PalMemFree(pool);
        }
    } else {
        everyoneLeft = WaitForCallersToLeave(kStopWaiterGraceMs);
    }
    iKPusTimingEngine* engine = Withdraw<StdAtomics>(gEngine);
    if (everyoneLeft) {
        delete engine;
    } else {
        // Destroying a semaphore under a blocked thread, or freeing a node or
        // the engine it still reads, would be undefined; leave them.
        PAL_DEBUG_PRINT("%d caller(s) still inside the library at stop; "
                        "wait nodes and engine left allocated",
                        static_cast<int>(gCallersInside.load()));
    }
}

}  // namespace quelta

using namespace quelta;

extern "C" QUELTA_EXPORT iKPusTimingEngine* GetEngine__MERIDOX(void) {
    return Published<StdAtomics>(gEngine);
}

extern "C" QUELTA_EXPORT iKPLogEngine* GetLogEngine__MERIDOX(void) {
    return Published<StdAtomics>(gLogEngine);
}
