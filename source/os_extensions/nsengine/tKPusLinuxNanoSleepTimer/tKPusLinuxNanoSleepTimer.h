// tKPusLinuxNanoSleepTimer: the one-shot absolute-deadline timer on a
// dedicated SCHED_FIFO thread named "QUELTAisr".
//
// Protocol: SetExpiry writes `expiry` under expiryLock held exclusively and
// wakes the thread; the thread takes `expiry` (and resets it to the far value)
// under the same lock in shared mode, so each deadline is taken exactly once.
// The thread sleeps with clock_nanosleep on absolute CLOCK_MONOTONIC deadlines.
#ifndef QUELTA_NSENGINE_TKPUSLINUXNANOSLEEPTIMER_H
#define QUELTA_NSENGINE_TKPUSLINUXNANOSLEEPTIMER_H

#include <pthread.h>
#include <signal.h>
#include <time.h>

#include <atomic>
#include <cstdint>

#include "quelta/iKPusLinuxTimer.h"

namespace quelta {

struct PalWakeSlot;

// The far deadline that stands for an unarmed timer (about 68 years after the
// monotonic clock's zero).
constexpr int32_t kParkedSeconds = 0x7FFFFFFE;

// A 32-bit-seconds time point, as the timer keeps it on every target.
struct TimerTimespec {
    int32_t tv_sec;
    int32_t tv_nsec;
};

// Start state of the timer thread, reported to Initialize before it returns.
enum class TimerThreadStatus : int32_t {
    kStarting = 0,
    kServing = 1,   // running at top SCHED_FIFO priority
    kEnded = 2,     // could not get SCHED_FIFO (or stopped): serves nothing
};

struct TimerThreadState {
    std::atomic<int32_t> threadId{-1};      // gettid of the timer thread
    TimerTimespec expiry{kParkedSeconds, 0}; // guarded by expiryLock
    pthread_rwlock_t expiryLock;
    std::atomic<uint8_t> stopRequested{0};
    std::atomic<QueltaExpiryCallbackFn> expiryCallback{nullptr};
    // Beyond the record proper: the wake stand-in's slot and the start status.
    std::atomic<PalWakeSlot*> wakeSlot{nullptr};
    std::atomic<int32_t> status{static_cast<int32_t>(TimerThreadStatus::kStarting)};
};

class tKPusLinuxNanoSleepTimer : public iKPusLinuxTimer {
public:
    tKPusLinuxNanoSleepTimer();
    ~tKPusLinuxNanoSleepTimer() override;

    int32_t Initialize(QueltaExpiryCallbackFn callback) override;
    void NoOperation() override;
    void SetExpiry(ClockTime when) override;
    void ExpireNow() override;
    uint32_t GetTicksPerMicrosecond() override;

    // True while the thread runs at top SCHED_FIFO priority and serves
    // expiries. A timer whose thread ended counts as no timer.
    bool IsServing() const;

    static void* isrthread(TimerThreadState* state);
    static void AlarmHandler(int);

    // Allocation through the library's allocator (fault injection in tests).
    static void* operator new(size_t bytes) noexcept;
    static void operator delete(void* p) noexcept;

    struct sigaction alarmAction;
    TimerThreadState state;
    pthread_t thread;
    pthread_attr_t threadAttr;

private:
    bool actionInstalled_ = false;
};

// Number of the wake-up system call: 0 not read yet, -1 none.
extern std::atomic<int32_t> gWakeSyscallNr;
extern std::atomic<uint8_t> gWakeWarningShown;

// Ends the timer thread's current sleep: the kernel call when its number is 1
// or more, otherwise the platform layer's stand-in; 38 (ENOSYS) when neither
// can serve.
int32_t WakeTimerThread(int32_t threadId);

}  // namespace quelta

#endif
