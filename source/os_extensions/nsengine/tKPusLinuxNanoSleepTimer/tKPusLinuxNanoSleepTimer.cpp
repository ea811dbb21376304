// The nanosleep timer: one absolute CLOCK_MONOTONIC deadline at a time, turned
// into a call of the expiry callback on a SCHED_FIFO thread.
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"

#include <errno.h>
#include <sched.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>

#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"
#include "tLinux/PalWake.h"

namespace quelta {

std::atomic<int32_t> gWakeSyscallNr{0};
std::atomic<uint8_t> gWakeWarningShown{0};

namespace {

constexpr int32_t kNoSyscall = ENOSYS;  // 38: neither the kernel call nor the stand-in
constexpr uint64_t kNsPerSecond = 1000000000ull;
constexpr long kStartWaitStepNs = 200 * 1000;  // 200 us
constexpr int kStartWaitSteps = 5000;          // 1 s in all
constexpr long kJoinPollNs = 100 * 1000;       // 100 us
constexpr int kJoinPollsPerKick = 10;          // SIGALRM to a plain sleep every 1 ms

// The SIGALRM action that was installed before the first live timer, put
// back when the last one is gone if ours is still the one installed.
// Guarded by gAlarmMutex.
pthread_mutex_t gAlarmMutex = PTHREAD_MUTEX_INITIALIZER;
struct sigaction gSavedAlarmAction;
uint32_t gAlarmUsers = 0;

// The timer whose thread this is, on a timer thread; null elsewhere. Lets
// SetExpiry see that it is called from the callback without asking the
// kernel for the thread id on every re-arm.
thread_local const TimerThreadState* tCurrentTimerState = nullptr;

// This thread's deferred wakes (see BeginDeferringTimerWakes): whether it
// defers now, and the wakes it owes (to one timer: the library has one).
thread_local bool tDeferring = false;
thread_local tKPusLinuxNanoSleepTimer* tOwedTimer = nullptr;
thread_local uint32_t tOwedWakes = 0;

void SleepNs(long ns) {
    timespec ts{0, ns};
    nanosleep(&ts, nullptr);
}

int32_t StatusOf(const TimerThreadState& state) { return state.status.load(); }

void SetStatus(TimerThreadState& state, TimerThreadStatus status) {
    state.status.store(static_cast<int32_t>(status));
}

void SetSleepKind(TimerThreadState& state, TimerSleepKind kind) {
    state.sleepKind.store(static_cast<int32_t>(kind));
}

bool StopRequested(void* state) { return static_cast<TimerThreadState*>(state)->stopRequested.load() != 0; }

// A plain absolute clock_nanosleep. Result 0 is the deadline; a signal
// resumes the same sleep (only a stop ends it, so that the destructor can
// release a thread parked on the far deadline); with the kernel's wake-up
// call configured, any other result means "woken: take the new expiry".
PalSleepResult NanosleepUntil(TimerThreadState& state, const timespec& deadline, bool kernelWake) {
    for (;;) {
        const int rc = clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &deadline, nullptr);
        if (rc == 0) return PalSleepResult::kDeadline;
        if (rc == EINTR) {
            if (StopRequested(&state)) return PalSleepResult::kWoken;
            continue;
        }
        return kernelWake ? PalSleepResult::kWoken : PalSleepResult::kFailed;
    }
}

// True when an expiry was set after the take that `takenCount` belongs to,
// or the thread is to stop.
bool ExpirySetSince(TimerThreadState& state, uint32_t takenCount) {
    pthread_mutex_lock(&state.expiryLock);
    const bool set = state.setCount != takenCount;
    pthread_mutex_unlock(&state.expiryLock);
    return set || StopRequested(&state);
}

timespec Earliest(const timespec& a, const timespec& b) {
    if (a.tv_sec != b.tv_sec) return a.tv_sec < b.tv_sec ? a : b;
    return a.tv_nsec <= b.tv_nsec ? a : b;
}

// A clock_nanosleep until `deadline`, blind for one tick at most (see
// kBlindSleepNs): at each bound short of the deadline, an expiry set since
// the take ends the sleep as a wake would have.
PalSleepResult BoundedNanosleepUntil(TimerThreadState& state, uint32_t takenCount, const timespec& deadline,
                                     bool kernelWake) {
    for (;;) {
        timespec bound{};
        clock_gettime(CLOCK_MONOTONIC, &bound);
        bound.tv_nsec += static_cast<long>(kBlindSleepNs);
        if (bound.tv_nsec >= 1000000000L) {
            bound.tv_nsec -= 1000000000L;
            bound.tv_sec += 1;
        }
        const timespec until = Earliest(deadline, bound);
        const PalSleepResult result = NanosleepUntil(state, until, kernelWake);
        if (result == PalSleepResult::kWoken) {
            // A wake made after its expiry was taken (or not meant for us)
            // brings nothing new: sleep on to the same deadline.
            if (ExpirySetSince(state, takenCount)) return result;
            continue;
        }
        if (result != PalSleepResult::kDeadline) return result;
        if (until.tv_sec == deadline.tv_sec && until.tv_nsec == deadline.tv_nsec) return result;
        if (ExpirySetSince(state, takenCount)) return PalSleepResult::kWoken;
    }
}

// One sleep of the timer thread until `deadline`, by the means that its
// wakers use right now.
PalSleepResult SleepUntil(TimerThreadState& state, uint32_t snapshot, uint32_t takenCount,
                          const timespec& deadline) {
    PalSleepResult result;
    if (gWakeSyscallNr.load(std::memory_order_relaxed) >= 1) {
        SetSleepKind(state, TimerSleepKind::kNanosleep);
        result = BoundedNanosleepUntil(state, takenCount, deadline, true);
    } else if (gPalWakeStandInEnabled.load(std::memory_order_relaxed)) {
        SetSleepKind(state, TimerSleepKind::kWakeWord);
        result = PalWakeableSleepUntil(state.wakeWord, snapshot, deadline, &StopRequested, &state);
    } else {
        SetSleepKind(state, TimerSleepKind::kNanosleep);
        result = BoundedNanosleepUntil(state, takenCount, deadline, false);
    }
    SetSleepKind(state, TimerSleepKind::kAwake);
    return result;
}

// The stack the passes and their callbacks use is faulted in before the first
// expiry, so that no expiry waits for the kernel to map a page.
constexpr size_t kStackPrefaultBytes = 64 * 1024;

__attribute__((noinline)) void PrefaultStack() {
    char area[kStackPrefaultBytes];
    for (size_t i = 0; i < kStackPrefaultBytes; i += 1024) area[i] = 0;
    asm volatile("" : : "r"(area) : "memory");  // the stores must happen
}

void* TimerThreadStart(void* arg) {
    return tKPusLinuxNanoSleepTimer::isrthread(static_cast<TimerThreadState*>(arg));
}

}  // namespace

int32_t WakeTimerThread(TimerThreadState& state) {
    const int32_t nr = gWakeSyscallNr.load(std::memory_order_relaxed);
    if (nr >= 1) return static_cast<int32_t>(syscall(nr, state.threadId.load()));
    if (!gPalWakeStandInEnabled.load(std::memory_order_relaxed)) return kNoSyscall;
    PalWake(state.wakeWord);
    return 0;
}

tKPusLinuxNanoSleepTimer::tKPusLinuxNanoSleepTimer() : alarmAction(), thread(0), threadAttr() {
    state.expiryLock = PTHREAD_MUTEX_INITIALIZER;
}

void* tKPusLinuxNanoSleepTimer::operator new(size_t bytes) noexcept { return PalMemAlloc(bytes); }

void tKPusLinuxNanoSleepTimer::operator delete(void* p) noexcept { PalMemFree(p); }

int32_t tKPusLinuxNanoSleepTimer::Initialize(QueltaExpiryCallbackFn callback) {
    state.expiryCallback.store(callback);
    state.stopRequested.store(0);

    pthread_mutexattr_t attr;
    pthread_mutexattr_init(&attr);
    pthread_mutexattr_setprotocol(&attr, PTHREAD_PRIO_INHERIT);
    const int lockResult = pthread_mutex_init(&state.expiryLock, &attr);
    pthread_mutexattr_destroy(&attr);
    if (lockResult != 0) return 1;

    if (gWakeSyscallNr.load() == 0) {
        FILE* file = std::fopen("/sys/kernel/zq_syscall_sched_wake_up", "r");
        gWakeSyscallNr.store(-1);
        if (file != nullptr) {
            int nr = -1;
            if (std::fscanf(file, "%d", &nr) == 1) gWakeSyscallNr.store(nr);
            std::fclose(file);
        }
    }

    sigemptyset(&alarmAction.sa_mask);
    alarmAction.sa_flags = 0;
    alarmAction.sa_handler = &tKPusLinuxNanoSleepTimer::AlarmHandler;
    if (!actionInstalled_) {
        pthread_mutex_lock(&gAlarmMutex);
        const bool first = gAlarmUsers == 0;
        const int rc = sigaction(SIGALRM, &alarmAction, first ? &gSavedAlarmAction : nullptr);
        if (rc == 0) ++gAlarmUsers;
        pthread_mutex_unlock(&gAlarmMutex);
        if (rc == -1) return 1;
        actionInstalled_ = true;
    }

    if (pthread_attr_init(&threadAttr) != 0) return 1;
    if (pthread_create(&thread, &threadAttr, &TimerThreadStart, &state) != 0) {
        thread = 0;
        return 1;
    }

    // Let the thread settle (real-time priority or not) so that IsServing is
    // accurate when we return.
    for (int i = 0; i < kStartWaitSteps; ++i) {
        if (StatusOf(state) != static_cast<int32_t>(TimerThreadStatus::kStarting)) break;
        SleepNs(kStartWaitStepNs);
    }
    return 0;
}

void tKPusLinuxNanoSleepTimer::NoOperation() {}

bool tKPusLinuxNanoSleepTimer::StoreExpiryLocked(ClockTime when) {
    const uint64_t ns = (static_cast<uint64_t>(when.high) << 32) | when.low;
    const uint64_t seconds = ns / kNsPerSecond;
    ++state.setCount;
    state.expiry.tv_sec = static_cast<int32_t>(static_cast<uint32_t>(seconds));
    state.expiry.tv_nsec = static_cast<int32_t>(ns - seconds * kNsPerSecond);
    return state.threadId.load() >= 0 && !OnTimerThread();
}

namespace {

// The thread sleeps on its wake word (the stand-in for the kernel's call).
bool UsesWakeWord() {
    return gWakeSyscallNr.load(std::memory_order_relaxed) < 1 &&
           gPalWakeStandInEnabled.load(std::memory_order_relaxed);
}

}  // namespace

void tKPusLinuxNanoSleepTimer::WakeByCallOrSignal() {
    if (WakeTimerThread(state) != kNoSyscall) return;
    if (gWakeWarningShown.exchange(1) == 0) {
        std::printf(
            "Warning: using sched_wake_up system call %d failed!\n"
            "This could lead to degraded nanosecond engine performance.\n",
            static_cast<int>(gWakeSyscallNr.load()));
        std::fflush(stdout);
    }
    pthread_kill(thread, SIGALRM);
}

void tKPusLinuxNanoSleepTimer::SetExpiry(ClockTime when) {
    // Wake the thread while still holding the lock: it cannot take the new
    // value without also seeing the wake. The stand-in's wake word moves
    // here (the thread snapshots it under this lock) and its sleepers are
    // notified once the lock is free; the kernel call and the signal act on
    // the sleep itself, so they are made here.
    // A thread deferring its wakes only moves the wake word here (a sleep
    // begun from now on is refused) and makes the rest of the wake later.
    pthread_mutex_lock(&state.expiryLock);
    bool notify = false;
    if (StoreExpiryLocked(when)) {
        if (tDeferring) {
            if (UsesWakeWord()) PalWakeMove(state.wakeWord);
            deferredWakes_.fetch_add(1, std::memory_order_relaxed);
            tOwedTimer = this;
            ++tOwedWakes;
        } else if (UsesWakeWord()) {
            PalWakeMove(state.wakeWord);
            notify = true;
        } else {
            WakeByCallOrSignal();
        }
    }
    pthread_mutex_unlock(&state.expiryLock);
    if (notify) PalWakeNotify(state.wakeWord);
}

void tKPusLinuxNanoSleepTimer::WakeDeferred() {
    if (UsesWakeWord()) {
        PalWakeNotify(state.wakeWord);
    } else {
        WakeByCallOrSignal();
    }
    deferredWakes_.fetch_sub(1, std::memory_order_release);
}

void BeginDeferringTimerWakes() { tDeferring = true; }

void EndDeferringTimerWakes() {
    tDeferring = false;
    for (; tOwedWakes != 0; --tOwedWakes) tOwedTimer->WakeDeferred();
    tOwedTimer = nullptr;
}

void tKPusLinuxNanoSleepTimer::ExpireNow() { SetExpiry(ClockTime{0, 0}); }

uint32_t tKPusLinuxNanoSleepTimer::GetTicksPerMicrosecond() { return 1000; }

bool tKPusLinuxNanoSleepTimer::IsServing() const {
    return StatusOf(state) == static_cast<int32_t>(TimerThreadStatus::kServing);
}

bool tKPusLinuxNanoSleepTimer::OnTimerThread() const { return tCurrentTimerState == &state; }

tKPusLinuxNanoSleepTimer::~tKPusLinuxNanoSleepTimer() {
    // Nobody can owe a new wake by now (the timer is unreachable); the
    // wakes owed already are made within moments.
    while (deferredWakes_.load(std::memory_order_acquire) != 0) SleepNs(kJoinPollNs);
    if (thread != 0) {
        state.stopRequested.store(1);
        // A thread parked on the far deadline would otherwise keep the join
        // waiting for decades. The wake word ends a stand-in sleep whatever
        // the seam says; the kernel call, when configured, ends its sleep; a
        // plain clock_nanosleep (the fallback) is kicked with SIGALRM until
        // the thread has seen the stop.
        PalWake(state.wakeWord);
        const int32_t nr = gWakeSyscallNr.load();
        const int32_t tid = state.threadId.load();
        if (nr >= 1 && tid > 0) syscall(nr, tid);
        for (int poll = 1; pthread_tryjoin_np(thread, nullptr) == EBUSY; ++poll) {
            if (poll % kJoinPollsPerKick == 0 &&
                state.sleepKind.load() == static_cast<int32_t>(TimerSleepKind::kNanosleep)) {
                pthread_kill(thread, SIGALRM);
            }
            SleepNs(kJoinPollNs);
        }
        thread = 0;
    }
    if (actionInstalled_) {
        pthread_mutex_lock(&gAlarmMutex);
        if (--gAlarmUsers == 0) {
            // Put back what was there before us, unless the application has
            // installed its own handler since: that one stays.
            struct sigaction current {};
            if (sigaction(SIGALRM, nullptr, &current) == 0 && (current.sa_flags & SA_SIGINFO) == 0 &&
                current.sa_handler == &tKPusLinuxNanoSleepTimer::AlarmHandler) {
                sigaction(SIGALRM, &gSavedAlarmAction, nullptr);
            }
        }
        pthread_mutex_unlock(&gAlarmMutex);
        actionInstalled_ = false;
    }
    pthread_mutex_destroy(&state.expiryLock);
}

// Does nothing: SIGALRM only has to end a plain clock_nanosleep with EINTR.
void tKPusLinuxNanoSleepTimer::AlarmHandler(int) {}

void* tKPusLinuxNanoSleepTimer::isrthread(TimerThreadState* state) {
    if (state == nullptr) return nullptr;
    if (state->expiryCallback.load() == nullptr) {
        SetStatus(*state, TimerThreadStatus::kEnded);
        return nullptr;
    }

    char name[16] = "QUELTAisr";
    PalSetThreadName(name);
    tCurrentTimerState = state;

    sched_param param{};
    param.sched_priority = sched_get_priority_max(SCHED_FIFO);
    if (sched_setscheduler(0, SCHED_FIFO, &param) != 0) {
        // Serving at a lower priority would break every latency promise the
        // callers rely on; refuse, say so once, and let callers see that no
        // timer serves. threadId stays -1, so nobody tries to wake us.
        const int err = errno;
        PAL_DEBUG_PRINT("timer thread cannot get real-time priority (SCHED_FIFO %d, errno %d); "
                        "it serves no expiries",
                        param.sched_priority, err);
        SetStatus(*state, TimerThreadStatus::kEnded);
        return nullptr;
    }

    PalSetExactTimers();
    PrefaultStack();
    state->threadId.store(PalGetThreadId());
    SetStatus(*state, TimerThreadStatus::kServing);

    for (;;) {
        if (state->stopRequested.load() != 0) break;

        // Take the deadline exactly once: whoever sets the next one moves
        // the wake word after this snapshot, or set it before this take.
        pthread_mutex_lock(&state->expiryLock);
        const uint32_t snapshot = PalWakeSnapshot(state->wakeWord);
        const TimerTimespec taken = state->expiry;
        const uint32_t takenCount = state->setCount;
        state->expiry = TimerTimespec{kParkedSeconds, 0};
        pthread_mutex_unlock(&state->expiryLock);
        if (state->stopRequested.load() != 0) break;

        timespec deadline{};
        deadline.tv_sec = taken.tv_sec;
        deadline.tv_nsec = taken.tv_nsec;
        if (SleepUntil(*state, snapshot, takenCount, deadline) == PalSleepResult::kDeadline) {
            state->expiryCallback.load()();
        }
        // Woken or failed: go and take whatever expiry now holds (after the
        // stop check at the top).
    }

    SetStatus(*state, TimerThreadStatus::kEnded);
    return nullptr;
}

}  // namespace quelta
