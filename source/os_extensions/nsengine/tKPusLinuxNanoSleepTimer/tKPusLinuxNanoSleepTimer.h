// tKPusLinuxNanoSleepTimer: the one-shot absolute-deadline timer on a
// dedicated SCHED_FIFO thread named "QUELTAisr".
//
// Protocol: SetExpiry writes `expiry` under expiryLock and wakes the thread;
// the thread takes `expiry` (and resets it to the far value) under the same
// lock, so each deadline is taken exactly once. The lock is a
// priority-inheriting mutex, not a reader-writer lock: a setter of low
// priority preempted while it holds the lock is then boosted for as long as
// the top-priority timer thread waits for it, instead of holding it up
// without bound. A setter holds it for a few stores (the stand-in's system
// call is made after it lets go).
// The thread sleeps on absolute CLOCK_MONOTONIC deadlines: with
// clock_nanosleep when the kernel's wake-up call is configured (which ends
// such a sleep), otherwise on the timer's wake word (tLinux/PalWake.h), whose
// snapshot it takes together with the expiry, so that no setting made after
// the take can miss the sleep that follows it.
#ifndef QUELTA_NSENGINE_TKPUSLINUXNANOSLEEPTIMER_H
#define QUELTA_NSENGINE_TKPUSLINUXNANOSLEEPTIMER_H

#include <pthread.h>
#include <signal.h>
#include <time.h>

#include <atomic>
#include <cstdint>

#include "quelta/iKPusLinuxTimer.h"
#include "tLinux/PalWake.h"

namespace quelta {


// The far deadline that stands for an unarmed timer (about 68 years after the
// monotonic clock's zero).
constexpr int32_t kParkedSeconds = 0x7FFFFFFE;

// A clock_nanosleep cannot be told "sleep unless the expiry moved since I
// took it": a wake (the kernel's call, or SIGALRM) that lands between the
// take and the kernel's sleep finds no sleep to end and is lost. Such a sleep
// is therefore never blind for longer than one tick: this long after it
// began, the thread looks whether a new expiry was set meanwhile and takes
// it. The tick service arms at most one tick ahead, so while it runs the
// bound never ends a sleep early; it counts when the thread is parked (the
// first arming at start-up) or a wake was lost. The wake word's sleep closes
// the window in the kernel and needs no bound.
constexpr int32_t kBlindSleepNs = 1000000;  // 1 ms, one tick (under a second)

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

// How the timer thread sleeps right now; the destructor kicks a plain
// clock_nanosleep with SIGALRM, which a wake-word sleep does not need.
enum class TimerSleepKind : int32_t {
    kAwake = 0,
    kWakeWord = 1,   // the wake stand-in: ended by the wake word
    kNanosleep = 2,  // clock_nanosleep: ended by the kernel call or, on stop, SIGALRM
};

struct TimerThreadState {
    std::atomic<int32_t> threadId{-1};      // gettid of the timer thread; written once
    TimerTimespec expiry{kParkedSeconds, 0}; // guarded by expiryLock
    pthread_mutex_t expiryLock;              // priority-inheriting once Initialize ran
    std::atomic<uint8_t> stopRequested{0};  // written once, by the destructor
    std::atomic<QueltaExpiryCallbackFn> expiryCallback{nullptr};
    // Beyond the record proper. Counts the expiries set (guarded by
    // expiryLock): a clock_nanosleep that reaches its bound (see
    // kBlindSleepNs) asks it whether a new expiry came since the take, whose
    // wake may have been lost.
    uint32_t setCount = 0;
    // Beyond the record proper. The wake word moves, under expiryLock,
    // whenever SetExpiry hands the thread a new expiry through the stand-in
    // (and once more on stop); the thread snapshots it under the lock with
    // each take.
    PalWakeWord wakeWord;
    std::atomic<int32_t> sleepKind{static_cast<int32_t>(TimerSleepKind::kAwake)};  // timer thread writes
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

    // True on this timer's own thread (in its callback), without a system call.
    bool OnTimerThread() const;

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
    friend void EndDeferringTimerWakes();

    // Stores `when` as the next expiry; true when another thread than the
    // timer's own must wake it. expiryLock held.
    bool StoreExpiryLocked(ClockTime when);
    // Ends the thread's sleep by the kernel's call, or by SIGALRM (with the
    // warning, once) when the call is unavailable.
    void WakeByCallOrSignal();
    // Makes one wake that a SetExpiry deferred.
    void WakeDeferred();

    bool actionInstalled_ = false;
    // Wakes deferred and not yet made; the timer is not destroyed while any
    // is owed.
    std::atomic<uint32_t> deferredWakes_{0};
};

// A thread that holds a lock the timer thread needs (the scheduler's)
// brackets the hold with these: a SetExpiry it makes meanwhile stores the
// expiry at once but leaves the wake (a system call) until the End, made
// after the lock is released, so that the timer thread never waits on that
// lock for it. A late wake, one that finds its expiry already taken, ends
// nothing: the thread sleeps on (see isrthread). Not nested.
void BeginDeferringTimerWakes();
void EndDeferringTimerWakes();

// Number of the wake-up system call: 0 not read yet, -1 none.
extern std::atomic<int32_t> gWakeSyscallNr;
extern std::atomic<uint8_t> gWakeWarningShown;

// Ends the timer thread's current sleep: the kernel call with the thread's id
// when its number is 1 or more (its result), otherwise the wake-word stand-in
// (0); 38 (ENOSYS) when neither serves (the stand-in switched off through its
// seam), which SetExpiry answers with SIGALRM.
int32_t WakeTimerThread(TimerThreadState& state);

}  // namespace quelta

#endif
