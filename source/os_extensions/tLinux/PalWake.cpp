// The futex behind the wakeable sleep (see PalWake.h).
#include "tLinux/PalWake.h"

#include <errno.h>
#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace quelta {

std::atomic<bool> gPalWakeStandInEnabled{true};

namespace {

constexpr int kWaitOp = FUTEX_WAIT_BITSET | FUTEX_PRIVATE_FLAG;  // absolute, CLOCK_MONOTONIC
constexpr int kWakeOp = FUTEX_WAKE | FUTEX_PRIVATE_FLAG;

uint32_t* Address(PalWakeWord& word) { return reinterpret_cast<uint32_t*>(&word.sequence); }

// The kernel's time point layouts: the 64-bit one of the time64 calls (and of
// every call on a 64-bit kernel ABI), and the 32-bit one of the original
// calls on 32-bit targets. They are spelled out here because the C library's
// struct timespec follows the build's time_t, which need not match either.
struct KernelTimespec64 {
    int64_t tv_sec;
    int64_t tv_nsec;
};
struct KernelTimespec32 {
    int32_t tv_sec;
    int32_t tv_nsec;
};

// One futex wait; returns 0 or an errno value.
int FutexWaitUntil(PalWakeWord& word, uint32_t expected, const timespec& deadline) {
#if defined(__LP64__)
    const KernelTimespec64 ts{static_cast<int64_t>(deadline.tv_sec), static_cast<int64_t>(deadline.tv_nsec)};
    if (syscall(SYS_futex, Address(word), kWaitOp, expected, &ts, nullptr, FUTEX_BITSET_MATCH_ANY) == 0) return 0;
    return errno;
#else
#if defined(__NR_futex_time64)
    // The time64 call where the kernel has it (5.1 and later); the original
    // call, with 32-bit seconds, otherwise.
    static std::atomic<bool> sNoTime64{false};
    if (!sNoTime64.load(std::memory_order_relaxed)) {
        const KernelTimespec64 ts{static_cast<int64_t>(deadline.tv_sec), static_cast<int64_t>(deadline.tv_nsec)};
        if (syscall(__NR_futex_time64, Address(word), kWaitOp, expected, &ts, nullptr, FUTEX_BITSET_MATCH_ANY) == 0) {
            return 0;
        }
        const int err = errno;
        if (err != ENOSYS) return err;
        sNoTime64.store(true, std::memory_order_relaxed);
    }
#endif
    const KernelTimespec32 ts{static_cast<int32_t>(deadline.tv_sec), static_cast<int32_t>(deadline.tv_nsec)};
    if (syscall(__NR_futex, Address(word), kWaitOp, expected, &ts, nullptr, FUTEX_BITSET_MATCH_ANY) == 0) return 0;
    return errno;
#endif
}

// The kernel side of WakeableSleep (PalWake.h).
struct FutexKernel {
    static int Wait(PalWakeWord& word, uint32_t expected, const timespec& deadline) {
        return FutexWaitUntil(word, expected, deadline);
    }
    static bool Reached(const timespec& deadline) {
        timespec now{};
        clock_gettime(CLOCK_MONOTONIC, &now);
        if (now.tv_sec != deadline.tv_sec) return now.tv_sec > deadline.tv_sec;
        return now.tv_nsec >= deadline.tv_nsec;
    }
};

}  // namespace

PalSleepResult PalWakeableSleepUntil(PalWakeWord& word, uint32_t snapshot, const timespec& deadline,
                                     bool (*interrupted)(void*), void* context) {
    return WakeableSleep<FutexKernel>(word, snapshot, deadline, interrupted, context);
}

void PalWakeNotify(PalWakeWord& word) {
    syscall(SYS_futex, Address(word), kWakeOp, INT32_MAX, nullptr, nullptr, 0);
}

void PalWake(PalWakeWord& word) {
    PalWakeMove(word);
    PalWakeNotify(word);
}

}  // namespace quelta
