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
constexpr long kStartWaitStepNs = 200 * 1000;               // 200 us
constexpr int kStartWaitSteps = 5000;                       // 1 s in all
constexpr long kSlotlessKickNs = 1000 * 1000;               // 1 ms

// The SIGALRM action that was installed before the first live timer, restored
// when the last one is gone. Guarded by gAlarmMutex.
pthread_mutex_t gAlarmMutex = PTHREAD_MUTEX_INITIALIZER;
struct sigaction gSavedAlarmAction;
uint32_t gAlarmUsers = 0;

void SleepNs(long ns) {
    timespec ts{0, ns};
    nanosleep(&ts, nullptr);
}

int32_t StatusOf(const TimerThreadState& state) { return state.status.load(); }

void SetStatus(TimerThreadState& state, TimerThreadStatus status) {
    state.status.store(static_cast<int32_t>(status));
}

// A sleep for a thread that found no wake slot: nothing but a signal can end
// it early, so an interrupted sleep looks at stopRequested before it resumes
// (otherwise the destructor could not release a parked thread).
PalSleepResult SleepWithoutSlot(TimerThreadState& state, const timespec& deadline) {
    for (;;) {
        const int rc = clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &deadline, nullptr);
        if (rc == 0) return PalSleepResult::kDeadline;
        if (rc != EINTR) return PalSleepResult::kFailed;
        if (state.stopRequested.load() != 0) return PalSleepResult::kWoken;
    }
}

void* TimerThreadStart(void* arg) {
    return tKPusLinuxNanoSleepTimer::isrthread(static_cast<TimerThreadState*>(arg));
}

}  // namespace

int32_t WakeTimerThread(int32_t threadId) {
    const int32_t nr = gWakeSyscallNr.load(std::memory_order_relaxed);
    if (nr >= 1) return static_cast<int32_t>(syscall(nr, threadId));
    return PalWakeThreadId(threadId);
}

tKPusLinuxNanoSleepTimer::tKPusLinuxNanoSleepTimer() : alarmAction(), thread(0), threadAttr() {
    state.expiryLock = PTHREAD_RWLOCK_INITIALIZER;
}

void* tKPusLinuxNanoSleepTimer::operator new(size_t bytes) noexcept { return PalMemAlloc(bytes); }

void tKPusLinuxNanoSleepTimer::operator delete(void* p) noexcept { PalMemFree(p); }

int32_t tKPusLinuxNanoSleepTimer::Initialize(QueltaExpiryCallbackFn callback) {
    state.expiryCallback.store(callback);
    state.stopRequested.store(0);

    if (pthread_rwlock_init(&state.expiryLock, nullptr) != 0) return 1;

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

void tKPusLinuxNanoSleepTimer::SetExpiry(ClockTime when) {
    const uint64_t ns = (static_cast<uint64_t>(when.high) << 32) | when.low;
    const uint64_t seconds = ns / kNsPerSecond;

    pthread_rwlock_wrlock(&state.expiryLock);
    state.expiry.tv_sec = static_cast<int32_t>(static_cast<uint32_t>(seconds));
    state.expiry.tv_nsec = static_cast<int32_t>(ns - seconds * kNsPerSecond);

    // Wake the thread while still holding the lock: it cannot take the new
    // value before the wake request is in place.
    const int32_t tid = state.threadId.load();
    if (tid >= 0 && tid != PalGetThreadId()) {
        if (WakeTimerThread(tid) == kNoSyscall) {
            if (gWakeWarningShown.exchange(1) == 0) {
                std::printf(
                    "Warning: using sched_wake_up system call %d failed!\n"
                    "This could lead to degraded nanosecond engine performance.\n",
                    static_cast<int>(gWakeSyscallNr.load()));
                std::fflush(stdout);
            }
            pthread_kill(thread, SIGALRM);
        }
    }
    pthread_rwlock_unlock(&state.expiryLock);
}

void tKPusLinuxNanoSleepTimer::ExpireNow() { SetExpiry(ClockTime{0, 0}); }

uint32_t tKPusLinuxNanoSleepTimer::GetTicksPerMicrosecond() { return 1000; }

bool tKPusLinuxNanoSleepTimer::IsServing() const {
    return StatusOf(state) == static_cast<int32_t>(TimerThreadStatus::kServing);
}

tKPusLinuxNanoSleepTimer::~tKPusLinuxNanoSleepTimer() {
    if (thread != 0) {
        state.stopRequested.store(1);
        // A thread parked on the far deadline would otherwise keep the join
        // waiting for decades. The wake ignores the stand-in's switch: it is
        // the timer's own shutdown, not a deadline change.
        bool joined = false;
        const int32_t tid = state.threadId.load();
        if (tid >= 0 && PalWakeThreadId(tid, true) != 0 &&
            state.wakeSlot.load() == nullptr) {
            // No wake slot: the thread checks stopRequested after every
            // interrupted sleep, so keep interrupting until it has gone.
            while (pthread_tryjoin_np(thread, nullptr) == EBUSY) {
                pthread_kill(thread, SIGALRM);
                SleepNs(kSlotlessKickNs);
            }
            joined = true;
        }
        if (!joined) pthread_join(thread, nullptr);
        thread = 0;
    }
    if (actionInstalled_) {
        pthread_mutex_lock(&gAlarmMutex);
        if (--gAlarmUsers == 0) sigaction(SIGALRM, &gSavedAlarmAction, nullptr);
        pthread_mutex_unlock(&gAlarmMutex);
        actionInstalled_ = false;
    }
    pthread_rwlock_destroy(&state.expiryLock);
}

void tKPusLinuxNanoSleepTimer::AlarmHandler(int) {
    const int savedErrno = errno;
    PalWakeOnSignal();
    errno = savedErrno;
}

void* tKPusLinuxNanoSleepTimer::isrthread(TimerThreadState* state) {
    if (state == nullptr) return nullptr;
    if (state->expiryCallback.load() == nullptr) {
        SetStatus(*state, TimerThreadStatus::kEnded);
        return nullptr;
    }

    char name[16] = "QUELTAisr";
    PalSetThreadName(name);

    // Registered before the id is published, so that no SetExpiry can find
    // the id without finding the thread wakeable.
    PalWakeSlot* slot = PalWakeRegister();
    state->wakeSlot.store(slot);

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
        state->wakeSlot.store(nullptr);
        PalWakeUnregister(slot);
        SetStatus(*state, TimerThreadStatus::kEnded);
        return nullptr;
    }

    state->threadId.store(PalGetThreadId());
    SetStatus(*state, TimerThreadStatus::kServing);

    for (;;) {
        if (state->stopRequested.load() != 0) break;

        // Take the deadline exactly once: whoever sets the next one wakes us.
        pthread_rwlock_rdlock(&state->expiryLock);
        const TimerTimespec taken = state->expiry;
        state->expiry = TimerTimespec{kParkedSeconds, 0};
        PalWakeClear(slot);
        pthread_rwlock_unlock(&state->expiryLock);
        // A stop whose wake request was just cleared above must still be seen.
        if (state->stopRequested.load() != 0) break;

        timespec deadline;
        deadline.tv_sec = taken.tv_sec;
        deadline.tv_nsec = taken.tv_nsec;
        const PalSleepResult result = slot != nullptr ? PalWakeableSleepUntil(slot, deadline)
                                                      : SleepWithoutSlot(*state, deadline);
        if (result == PalSleepResult::kDeadline) {
            state->expiryCallback.load()();
        }
        // Woken or failed: go and take whatever expiry now holds (after the
        // stop check at the top).
    }

    SetStatus(*state, TimerThreadStatus::kEnded);
    state->wakeSlot.store(nullptr);
    PalWakeUnregister(slot);
    return nullptr;
}

}  // namespace quelta
