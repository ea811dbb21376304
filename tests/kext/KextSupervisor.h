// The emulated kernel extension: a separate process holding the seccomp
// listener of the test process. It serves the two extra system calls with the
// harshest semantics a kernel could plausibly have, and emulates the timer
// thread's clock_nanosleep so that sched_wake_up can end it:
//
// - sched_wake_up(tid) ends that thread's current emulated sleep with -EAGAIN
//   (neither 0 nor EINTR). A wake for a timer thread that is not asleep in
//   the emulated sleep at that moment is lost, as a kernel's would be.
// - clock_converttime(from, to, ts) converts in place, the CLOCK_REALTIME
//   view moved by the skew knob, in the caller's own timespec layout; an
//   unknown clock, a bad pointer or a result the layout cannot hold fails
//   and leaves the timespec as it was.
// - A timer thread's clock_nanosleep on CLOCK_MONOTONIC is answered 0 at its
//   deadline (a timerfd) or -EAGAIN on a wake; every other thread's sleep is
//   let through to the real kernel. A sleep whose thread took a signal is
//   dropped (its notification is no longer valid; the thread sees EINTR).
// - Read-only opens of the two sysfs files are counted and let through.
//
// Single-threaded, and after fork it calls only system calls and snprintf.
#ifndef QUELTA_TESTS_KEXT_KEXTSUPERVISOR_H
#define QUELTA_TESTS_KEXT_KEXTSUPERVISOR_H

#include <errno.h>
#include <fcntl.h>
#include <linux/audit.h>
#include <linux/seccomp.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/timerfd.h>
#include <sys/uio.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "KextShared.h"

namespace kext {

// The calls the filter hands to the supervisor, per architecture.
struct ArchCalls {
    uint32_t arch;
    int nanosleep32;  // clock_nanosleep with a 32-bit timespec (-1: none)
    int nanosleep64;  // clock_nanosleep with a 64-bit timespec
    int openat;
    bool narrowLong;  // the conversion call's timespec has 32-bit fields
};
constexpr ArchCalls kArchs[] = {
    {AUDIT_ARCH_X86_64, -1, 230, 257, false},
    {AUDIT_ARCH_I386, 267, 407, 295, true},
};

inline int64_t NowNs(clockid_t clock) {
    timespec ts{};
    clock_gettime(clock, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000000000 + ts.tv_nsec;
}

// `clock` minus CLOCK_MONOTONIC, from the tightest of a few brackets.
inline int64_t MeasureOffset(clockid_t clock) {
    int64_t best = 0, span = INT64_MAX;
    for (int i = 0; i < 5; ++i) {
        const int64_t a = NowNs(CLOCK_MONOTONIC), c = NowNs(clock), b = NowNs(CLOCK_MONOTONIC);
        if (b - a < span) span = b - a, best = c - (a + (b - a) / 2);
    }
    return best;
}

class Supervisor {
public:
    Supervisor(int listener, SharedPage* page) : fd_(listener), page_(page) {
        timer_ = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC);
        offset_[CLOCK_REALTIME] = page->realOffsetNs.load();
        offset_[CLOCK_MONOTONIC_RAW] = page->rawOffsetNs.load();
    }

    // Serves until the test process is gone (the listener hangs up).
    [[noreturn]] void Run() {
        for (;;) {
            pollfd fds[2] = {{fd_, POLLIN, 0}, {timer_, POLLIN, 0}};
            if (ppoll(fds, 2, nullptr, nullptr) < 0) continue;
            if (fds[1].revents & POLLIN) ExpireSleeps();
            if (fds[0].revents & POLLIN) HandleOne();
            if (fds[0].revents & (POLLHUP | POLLERR | POLLNVAL)) _exit(0);
        }
    }

private:
    struct Sleep {
        int tid = 0;  // 0: slot free
        uint64_t id = 0;
        int64_t deadline = 0, arrived = 0;
    };

    // --- replies ---------------------------------------------------------------
    bool Reply(uint64_t id, int64_t val, int32_t error, uint32_t flags = 0) {
        seccomp_notif_resp r{id, val, error, flags};
        return ioctl(fd_, SECCOMP_IOCTL_NOTIF_SEND, &r) == 0;
    }
    void Continue(uint64_t id) { Reply(id, 0, 0, SECCOMP_USER_NOTIF_FLAG_CONTINUE); }
    bool Valid(uint64_t id) { return ioctl(fd_, SECCOMP_IOCTL_NOTIF_ID_VALID, &id) == 0; }

    // --- target memory -----------------------------------------------------------
    static bool Transfer(int pid, uint64_t addr, void* buffer, size_t n, bool write) {
        iovec local{buffer, n}, remote{reinterpret_cast<void*>(static_cast<uintptr_t>(addr)), n};
        const ssize_t done = write ? process_vm_writev(pid, &local, 1, &remote, 1, 0)
                                   : process_vm_readv(pid, &local, 1, &remote, 1, 0);
        return done == static_cast<ssize_t>(n);
    }
    static bool Read(int pid, uint64_t addr, void* out, size_t n) { return Transfer(pid, addr, out, n, false); }
    // A timespec of the target: 32-bit fields, or 64-bit ones (of which the
    // kernel reads only the low half of tv_nsec for a 32-bit caller).
    bool ReadTimespec(int pid, uint64_t addr, bool narrow, bool compat, int64_t& sec, int64_t& nsec) {
        if (narrow) {
            int32_t t[2];
            if (!Read(pid, addr, t, sizeof t)) return false;
            sec = t[0], nsec = t[1];
        } else {
            int64_t t[2];
            if (!Read(pid, addr, t, sizeof t)) return false;
            sec = t[0], nsec = compat ? static_cast<int32_t>(t[1]) : t[1];
        }
        return true;
    }
    static bool InRange(int64_t sec, int64_t nsec) {
        return nsec >= 0 && nsec < 1000000000 && sec > -(int64_t{1} << 32) && sec < (int64_t{1} << 33);
    }

    // --- who is the timer thread ----------------------------------------------------
    bool IsKnownTimer(int tid) const {
        for (int t : timers_) {
            if (t == tid) return true;
        }
        return false;
    }
    // Named "QUELTAisr" (remembered once seen: the thread names itself before
    // it first sleeps; a stale entry after an id is reused would only emulate
    // an ordinary thread's sleep, which the emulation does faithfully).
    bool IsTimer(int tid) {
        if (IsKnownTimer(tid)) return true;
        char path[64], comm[32] = {};
        std::snprintf(path, sizeof path, "/proc/%d/comm", tid);
        const int f = open(path, O_RDONLY | O_CLOEXEC);
        if (f < 0) return false;
        const ssize_t n = read(f, comm, sizeof comm - 1);
        close(f);
        if (n <= 0 || std::strcmp(comm, "QUELTAisr\n") != 0) return false;
        timers_[nextTimer_++ % kMaxTimers] = tid;
        return true;
    }

    // --- emulated sleeps ---------------------------------------------------------------
    Sleep* SleepOf(int tid) {
        for (Sleep& s : sleeps_) {
            if (s.tid == tid) return &s;
        }
        return nullptr;
    }
    void ArmTimerFd() {
        int64_t earliest = 0;
        for (const Sleep& s : sleeps_) {
            if (s.tid != 0 && (earliest == 0 || s.deadline < earliest)) earliest = s.deadline;
        }
        itimerspec it{};
        it.it_value.tv_sec = static_cast<time_t>(earliest / 1000000000);
        it.it_value.tv_nsec = static_cast<long>(earliest % 1000000000);
        timerfd_settime(timer_, TFD_TIMER_ABSTIME, &it, nullptr);  // 0: disarmed
    }
    // Ends a listed sleep: answered, or found ended by a signal.
    void End(Sleep& s, bool answered) {
        if (!answered) page_->Add(kSleepsInterrupted);
        s = Sleep{};
        ArmTimerFd();
    }
    void ExpireSleeps() {
        uint64_t ticks;
        (void)!read(timer_, &ticks, sizeof ticks);
        const int64_t now = NowNs(CLOCK_MONOTONIC);
        for (Sleep& s : sleeps_) {
            if (s.tid != 0 && s.deadline <= now) End(s, Reply(s.id, 0, 0));
        }
    }

    void HandleSleep(const seccomp_notif& n, const ArchCalls& a) {
        const int tid = static_cast<int>(n.pid);
        int64_t sec, nsec;
        const bool narrow = n.data.nr == a.nanosleep32, compat = a.narrowLong;
        if (!IsTimer(tid) || static_cast<int32_t>(n.data.args[0]) != CLOCK_MONOTONIC ||
            !ReadTimespec(tid, n.data.args[2], narrow, compat, sec, nsec) || !InRange(sec, nsec) || sec < 0) {
            return Continue(n.id);  // the real kernel sleeps it, or refuses the request
        }
        page_->Add(kTimerSleeps);
        const int64_t now = NowNs(CLOCK_MONOTONIC);
        int64_t deadline = sec * 1000000000 + nsec;
        if ((n.data.args[1] & TIMER_ABSTIME) == 0) deadline += now;
        // A thread is in one call at a time: an earlier sleep of it that is
        // still listed was ended by a signal.
        if (Sleep* old = SleepOf(tid)) End(*old, false);
        if (tid == echoTid_) {  // the echo of a wake made before this sleep began
            echoTid_ = 0;
            page_->Add(kWakesEchoed);
            return (void)Reply(n.id, -1, -EAGAIN);
        }
        if (deadline <= now) return (void)Reply(n.id, 0, 0);
        Sleep* slot = SleepOf(0);
        if (slot == nullptr) return Continue(n.id);  // more timers than slots: let it sleep for real
        *slot = Sleep{tid, n.id, deadline, now};
        ArmTimerFd();
    }

    void HandleWake(const seccomp_notif& n) {
        page_->Add(kWakeCalls);
        const int tid = static_cast<int>(static_cast<int32_t>(n.data.args[0]));
        if (page_->wakeReturnsEnosys.load(std::memory_order_relaxed) != 0) return (void)Reply(n.id, ENOSYS, 0);
        Sleep* s = SleepOf(tid);
        if (s == nullptr && !IsTimer(tid)) {
            page_->Add(kWakesUnknownTid);
            return (void)Reply(n.id, -1, -ESRCH);
        }
        const int64_t widen = int64_t{page_->widenWindowUs.load(std::memory_order_relaxed)} * 1000;
        bool delivered = false;
        if (s != nullptr && page_->loseEveryWake.load(std::memory_order_relaxed) == 0 &&
            NowNs(CLOCK_MONOTONIC) - s->arrived >= widen) {
            delivered = Valid(s->id) && Reply(s->id, -1, -EAGAIN);
            End(*s, delivered);
            if (delivered && page_->echoWakes.load(std::memory_order_relaxed) != 0) echoTid_ = tid;
        }
        page_->Add(delivered ? kWakesDelivered : kWakesLost);
        Reply(n.id, 0, 0);
    }

    // --- clock_converttime -----------------------------------------------------------
    static bool KnownClock(int64_t c) {
        return c == CLOCK_REALTIME || c == CLOCK_MONOTONIC || c == CLOCK_MONOTONIC_RAW;
    }
    int64_t OffsetOf(int clock) const {
        if (clock == CLOCK_REALTIME) return offset_[CLOCK_REALTIME] + page_->skewNs.load(std::memory_order_relaxed);
        return clock == CLOCK_MONOTONIC ? 0 : offset_[CLOCK_MONOTONIC_RAW];
    }
    int32_t Convert(const seccomp_notif& n, const ArchCalls& a) {
        const int pid = static_cast<int>(n.pid);
        const int64_t from = static_cast<int32_t>(n.data.args[0]), to = static_cast<int32_t>(n.data.args[1]);
        int64_t sec, nsec;
        if (!KnownClock(from) || !KnownClock(to)) return EINVAL;
        if (!ReadTimespec(pid, n.data.args[2], a.narrowLong, false, sec, nsec)) return EFAULT;
        if (!InRange(sec, nsec)) return EINVAL;
        const int64_t ns = sec * 1000000000 + nsec - OffsetOf(static_cast<int>(from)) + OffsetOf(static_cast<int>(to));
        int64_t outSec = ns / 1000000000, outNsec = ns % 1000000000;
        if (outNsec < 0) outNsec += 1000000000, outSec -= 1;
        if (a.narrowLong && outSec != static_cast<int32_t>(outSec)) return EOVERFLOW;
        int64_t wide[2] = {outSec, outNsec};
        int32_t narrow[2] = {static_cast<int32_t>(outSec), static_cast<int32_t>(outNsec)};
        void* out = a.narrowLong ? static_cast<void*>(narrow) : static_cast<void*>(wide);
        if (!Valid(n.id) || !Transfer(pid, n.data.args[2], out, a.narrowLong ? sizeof narrow : sizeof wide, true)) {
            return EFAULT;
        }
        page_->Add(from == CLOCK_MONOTONIC && to == CLOCK_REALTIME   ? kConvertMonoToReal
                   : from == CLOCK_REALTIME && to == CLOCK_MONOTONIC ? kConvertRealToMono
                                                                     : kConvertOther);
        if (!IsKnownTimer(pid)) page_->Add(kConvertByCallers);
        return 0;
    }

    // --- sysfs opens -------------------------------------------------------------------
    void CountOpen(const seccomp_notif& n) {
        if ((n.data.args[2] & O_ACCMODE) != O_RDONLY) return;
        // Read up to the end of the path's page first, so that a path near an
        // unmapped page is still read.
        char path[64] = {};
        const uint64_t addr = n.data.args[1], pageEnd = (addr | 4095) + 1;
        const size_t first = pageEnd - addr < sizeof path - 1 ? pageEnd - addr : sizeof path - 1;
        if (!Read(static_cast<int>(n.pid), addr, path, first)) return;
        if (first < sizeof path - 1) Read(static_cast<int>(n.pid), pageEnd, path + first, sizeof path - 1 - first);
        if (std::strcmp(path, kWakeFile) == 0) page_->Add(kOpensWakeFile);
        if (std::strcmp(path, kConvertFile) == 0) page_->Add(kOpensConvertFile);
    }

    void HandleOne() {
        seccomp_notif n{};  // zeroed, as the kernel requires
        if (ioctl(fd_, SECCOMP_IOCTL_NOTIF_RECV, &n) != 0) return;  // the target was interrupted
        const ArchCalls* a = nullptr;
        for (const ArchCalls& c : kArchs) {
            if (c.arch == n.data.arch) a = &c;
        }
        const int nr = n.data.nr;
        if (a == nullptr) return Continue(n.id);
        if (nr == kWakeNr) return HandleWake(n);
        if (nr == kConvertNr) {
            const int32_t error = Convert(n, *a);
            if (error != 0) page_->Add(kConvertRefused);
            return (void)Reply(n.id, error == 0 ? 0 : -1, -error);
        }
        if (nr == a->nanosleep32 || nr == a->nanosleep64) return HandleSleep(n, *a);
        if (nr == a->openat) CountOpen(n);
        Continue(n.id);
    }

    static constexpr int kMaxSleeps = 8, kMaxTimers = 8;
    int fd_, timer_;
    SharedPage* page_;
    int64_t offset_[8] = {};
    Sleep sleeps_[kMaxSleeps];
    int timers_[kMaxTimers] = {};
    unsigned nextTimer_ = 0;
    int echoTid_ = 0;  // the thread whose next sleep a wake's echo ends
};

}  // namespace kext

#endif
