// User-space stand-in for the kernel's sched_wake_up call.
//
// A wake is a request flag plus SIGALRM. The flag alone cannot end a sleep
// that has already begun, and the signal alone cannot tell a wake from any
// other SIGALRM (a plain EINTR must resume the sleep). Together they still
// leave a window: a signal that lands after the sleeper checked the flag but
// before it entered clock_nanosleep would run its handler and then let the
// sleeper sleep to the old deadline. The handler closes that window by zeroing
// the sleeper's published request, so the system call finds a deadline that
// has long passed and returns at once. The sleeper keeps its own copy of the
// deadline, so a zeroed request never turns into an early "deadline came".
#include "tLinux/PalWake.h"

#include <errno.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace quelta {

// One registered sleeper. Free while owner is 0; -1 while being claimed.
struct PalWakeSlot {
    std::atomic<int32_t> owner{0};            // kernel thread id of the sleeper
    std::atomic<pthread_t> thread{};          // its pthread handle, for pthread_kill
    std::atomic<uint32_t> wakeRequested{0};   // set by a waker, cleared by the sleeper
    std::atomic<timespec*> request{nullptr};  // the sleeper's pending request, if any
};

static_assert(std::atomic<int32_t>::is_always_lock_free &&
                  std::atomic<uint32_t>::is_always_lock_free &&
                  std::atomic<timespec*>::is_always_lock_free,
              "the signal handler may only touch lock-free atomics");

namespace {

// Timers are few (one per loaded library, a handful in tests); a fixed table
// keeps registration allocation-free and lets the signal handler scan it.
constexpr int kWakeSlots = 32;
PalWakeSlot gWakeSlots[kWakeSlots];

int32_t CurrentTid() { return static_cast<int32_t>(syscall(SYS_gettid)); }

bool Before(const timespec& a, const timespec& b) {
    if (a.tv_sec != b.tv_sec) return a.tv_sec < b.tv_sec;
    return a.tv_nsec < b.tv_nsec;
}

PalWakeSlot* FindSlot(int32_t tid) {
    if (tid <= 0) return nullptr;
    for (PalWakeSlot& slot : gWakeSlots) {
        if (slot.owner.load(std::memory_order_acquire) == tid) return &slot;
    }
    return nullptr;
}

}  // namespace

std::atomic<bool> gPalWakeStandInEnabled{true};
std::atomic<void (*)()> gPalWakeWindowHook{nullptr};

PalWakeSlot* PalWakeRegister() {
    const int32_t tid = CurrentTid();
    for (PalWakeSlot& slot : gWakeSlots) {
        int32_t expected = 0;
        if (!slot.owner.compare_exchange_strong(expected, -1)) continue;
        slot.thread.store(pthread_self(), std::memory_order_relaxed);
        slot.wakeRequested.store(0, std::memory_order_relaxed);
        slot.request.store(nullptr, std::memory_order_relaxed);
        // Publishing the id makes the slot visible to wakers and the handler,
        // with its handle already in place.
        slot.owner.store(tid, std::memory_order_release);
        return &slot;
    }
    return nullptr;
}

void PalWakeUnregister(PalWakeSlot* slot) {
    if (slot == nullptr) return;
    slot->request.store(nullptr);
    slot->wakeRequested.store(0);
    slot->owner.store(0, std::memory_order_release);
}

void PalWakeClear(PalWakeSlot* slot) {
    if (slot != nullptr) slot->wakeRequested.store(0);
}

PalSleepResult PalWakeableSleepUntil(PalWakeSlot* slot, const timespec& deadline) {
    timespec req;
    for (;;) {
        req = deadline;
        int rc;
        if (slot != nullptr) {
            // Publish first, then look at the flag: a wake set after this
            // check either interrupts the system call or, landing before it,
            // has its handler zero `req`.
            slot->request.store(&req);
            if (slot->wakeRequested.load() != 0) {
                slot->request.store(nullptr);
                return PalSleepResult::kWoken;
            }
            if (void (*hook)() = gPalWakeWindowHook.load(std::memory_order_relaxed)) hook();
            rc = clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &req, nullptr);
            slot->request.store(nullptr);
        } else {
            rc = clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &req, nullptr);
        }
        const bool woken = slot != nullptr && slot->wakeRequested.load() != 0;
        if (rc == 0) {
            timespec now;
            clock_gettime(CLOCK_MONOTONIC, &now);
            if (!Before(now, deadline)) return PalSleepResult::kDeadline;
            if (woken) return PalSleepResult::kWoken;
            continue;  // request zeroed by a stale signal: the deadline stands
        }
        if (rc == EINTR) {
            if (woken) return PalSleepResult::kWoken;
            continue;  // any other signal: resume the same sleep
        }
        return PalSleepResult::kFailed;
    }
}

int32_t PalWakeThreadId(int32_t threadId, bool force) {
    if (!force && !gPalWakeStandInEnabled.load(std::memory_order_relaxed)) return ENOSYS;
    PalWakeSlot* slot = FindSlot(threadId);
    if (slot == nullptr) return ENOSYS;
    slot->wakeRequested.store(1);
    // The sleeper publishes its request before it looks at the flag, and we
    // set the flag before we look at the request: if we find none, the
    // sleeper is not sleeping and will see the flag before its next sleep, so
    // the signal (which would only interrupt whatever it is doing) is spared.
    if (slot->request.load() == nullptr) return 0;
    return pthread_kill(slot->thread.load(std::memory_order_relaxed), SIGALRM);
}

void PalWakeOnSignal() {
    PalWakeSlot* slot = FindSlot(CurrentTid());
    if (slot == nullptr || slot->wakeRequested.load() == 0) return;
    timespec* req = slot->request.load();
    if (req == nullptr) return;
    // The request lives on this very thread's stack (the handler interrupted
    // its owner), so plain stores are enough; volatile keeps them in place.
    volatile timespec* target = req;
    target->tv_sec = 0;
    target->tv_nsec = 0;
}

}  // namespace quelta
