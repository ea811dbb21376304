// Callers inside the library and the stop's way of getting them out (see
// LibraryUse.h).
#include "engine/LibraryUse.h"

#include "engine/HandOff.h"
#include "engine/WaitList.h"
#include "quelta/RuntimeSemaphore.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {

std::atomic<bool> gStopping{false};
std::atomic<int32_t> gCallersInside{0};

namespace {

// Semaphores that callers block on inside the library, guarded by
// gSchedLock: a waiter lists its semaphore before it blocks and takes it off
// before it returns, so the stop (which broadcasts under the same lock) never
// touches a semaphore that its owner may already have destroyed. Room for
// every node-using wait plus as many waits without a node; a waiter that
// finds no room waits in short slices and looks for the stop between them.
constexpr uint32_t kMaxBlocked = 2 * kWaitNodeCount;
PalSemaphore* gBlocked[kMaxBlocked];

int32_t List(PalSemaphore* semaphore) {
    SchedLockGuard lock;
    for (uint32_t i = 0; i < kMaxBlocked; ++i) {
        if (gBlocked[i] == nullptr) {
            gBlocked[i] = semaphore;
            return static_cast<int32_t>(i);
        }
    }
    return -1;
}

void Unlist(int32_t slot) {
    if (slot < 0) return;
    SchedLockGuard lock;
    gBlocked[slot] = nullptr;
}

bool Stopping() { return StopBegun<StdAtomics>(gStopping); }

// A waiter the stop cannot wake (no room in the list) waits at most
// kUnlistedSliceMs at a time, so that it finds the stop well inside the
// stop's grace period and leaves before the library is gone.
constexpr int32_t kUnlistedSliceMs = 5;

uint32_t WaitInSlices(PalSemaphore* semaphore, const timespec* deadline) {
    for (;;) {
        const timespec slice = quelta_runtime::DeadlineAfterMs(CLOCK_MONOTONIC, kUnlistedSliceMs);
        const bool last = deadline != nullptr && (deadline->tv_sec < slice.tv_sec ||
                                                  (deadline->tv_sec == slice.tv_sec && deadline->tv_nsec <= slice.tv_nsec));
        const uint32_t r = PalSemaphoreWaitUntilUnless(semaphore, last ? deadline : &slice, &Stopping);
        if (r != 1 || last) return r;  // taken, stopped, failed, or the caller's own deadline
    }
}

}  // namespace

CallerInside::CallerInside() : entered_(EnterUnlessStopping<StdAtomics>(gCallersInside, gStopping)) {}

CallerInside::~CallerInside() {
    if (entered_) LeaveInside<StdAtomics>(gCallersInside);
}

BlockResult BlockOn(PalSemaphore* semaphore, const timespec* deadline) {
    const int32_t slot = List(semaphore);
    uint32_t r;
    if (slot >= 0) {
        r = PalSemaphoreWaitUntilUnless(semaphore, deadline, &Stopping);
        Unlist(slot);
    } else {
        r = WaitInSlices(semaphore, deadline);
    }
    switch (r) {
        case 0: return BlockResult::kTaken;
        case 1: return BlockResult::kTimedOut;
        case 3: return BlockResult::kStopped;
        default: return BlockResult::kFailed;
    }
}

void WakeBlockedWaiters() {
    SchedLockGuard lock;
    for (PalSemaphore* semaphore : gBlocked) {
        if (semaphore != nullptr) PalSemaphoreWakeAll(semaphore);
    }
}

bool WaitForCallersToLeave(uint32_t graceMs) {
    for (uint32_t ms = 0; ms < graceMs; ++ms) {
        if (NobodyInside<StdAtomics>(gCallersInside)) return true;
        PalSleepMilliseconds(1);
    }
    return NobodyInside<StdAtomics>(gCallersInside);
}

}  // namespace quelta
