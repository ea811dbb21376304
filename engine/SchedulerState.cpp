// The tick scheduler's library-wide state (see SchedulerState.h).
#include "engine/SchedulerState.h"

#include "engine/LibraryFrame.h"
#include "engine/WaitList.h"

namespace quelta {

AtomicClockTime gNextTick(kNeverTime64);
AtomicClockTime gTickPeriod(0);
AtomicClockTime gNextDeadline(kNeverTime64);
AtomicClockTime gMonotonicCallbackTime(kNeverTime64);
AtomicClockTime gGlobalCallbackTime(kNeverTime64);
std::atomic<QueltaCallbackFn> gCallbackFn{nullptr};
std::atomic<void*> gCallbackArg{nullptr};
std::atomic<QueltaTickCallbackFn> gTickCallback{nullptr};
std::atomic<uint32_t> gGeneration{0};
std::atomic<WaitNode*> gWaitNodePool{nullptr};
std::atomic<WaitNode*> gFreeList{nullptr};
std::atomic<WaitNode*> gWaitList{nullptr};
std::atomic<uint32_t> gEventSystemReady{0};
std::atomic<uint32_t> gWaitListVersion{0};
std::atomic<uint32_t> gControlFlag{0};

void SetLoadTimeSchedulerState() {
    gTickPeriod.Store(0);
    gNextDeadline.Store(kNeverTime64);
    gGlobalCallbackTime.Store(kNeverTime64);
    gMonotonicCallbackTime.Store(kNeverTime64);
    gNextTick.Store(kNeverTime64);
}

}  // namespace quelta
