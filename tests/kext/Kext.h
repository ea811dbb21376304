// The emulated kernel extension the kext tests run on. Before any thread, the
// process takes a private mount namespace (a tmpfs over /sys/kernel for the two
// sysfs files), forks a supervisor and installs a seccomp filter whose listener
// it holds; where the machine refuses, every test skips with one line. The
// supervisor (single-threaded: only system calls and snprintf after fork) is as
// harsh as a kernel could plausibly be:
// - sched_wake_up(tid) ends that timer thread's sleep with -EAGAIN; a wake that
//   finds it not asleep is lost.
// - clock_converttime converts in the caller's own timespec layout, the wall
//   clock moved by the skew knob; another clock (MONOTONIC_RAW too) or overflow fails.
// - A timer thread's monotonic clock_nanosleep ends at its deadline or on a
//   wake; other sleeps go to the kernel; a signalled thread sees EINTR.
// - Read-only opens of the sysfs files, and SIGALRMs to a timer thread, are
//   counted and let through.
#ifndef QUELTA_TESTS_KEXT_KEXT_H
#define QUELTA_TESTS_KEXT_KEXT_H

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <sys/uio.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstdio>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "LibraryFixture.h"
#include "TestSupport.h"

namespace kext {

constexpr uint64_t kUs = 1000, kMs = 1000 * kUs, kSec = 1000 * kMs;
constexpr int64_t kNs = 1000000000;
// Numbers neither x86-64 nor i386 has: a stray call without the emulation fails with ENOSYS.
constexpr int32_t kWakeNr = 917, kConvertNr = 918;
constexpr const char* kWakeFile = "/sys/kernel/zq_syscall_sched_wake_up";
constexpr const char* kConvertFile = "/sys/kernel/zq_syscall_clock_converttime";

enum Counter : int {
    kWakeCalls, kWakesDelivered, kWakesLost,  // lost: the timer thread was not asleep (or a knob said so)
    kWakesUnknownTid, kWakesEchoed,           // echoed: a delivered wake that also ended the next sleep
    kConvertCalls,                            // every conversion call, served or refused
    kConvertByCallers,                        // served for threads other than a timer thread
    kOpensWakeFile, kOpensConvertFile,        // read-only opens of the sysfs files
    kTimerSleeps, kSleepsInterrupted,         // a timer thread's emulated sleeps; those a signal ended
    kAlarmsToTimer, kCounterCount             // SIGALRMs sent to a timer thread
};
using Counts = std::array<int64_t, kCounterCount>;

// One MAP_SHARED page between the test process and the supervisor; every word
// relaxed. Knobs are set by the tests between calls, counters by the supervisor.
struct SharedPage {
    std::atomic<int64_t> skewNs{0};            // the emulated CLOCK_REALTIME minus the real one
    std::atomic<int32_t> loseEveryWake{0};     // the wake call does nothing
    std::atomic<int32_t> widenWindowUs{0};     // a sleep counts as asleep this long after it arrived
    std::atomic<int32_t> wakeReturnsEnosys{0};  // the wake call answers 38
    std::atomic<int32_t> echoWakes{0};         // a delivered wake ends the next sleep too, as a late one would
    // REALTIME minus MONOTONIC, measured once: conversions are exact functions (the tests convert
    // only between these two; any other clock, MONOTONIC_RAW too, is refused, not guessed).
    std::atomic<int64_t> realOffsetNs{0};
    std::atomic<int64_t> counters[kCounterCount] = {};

    Counts Snapshot() const {
        Counts c{};
        for (int i = 0; i < kCounterCount; ++i) c[i] = counters[i].load(std::memory_order_relaxed);
        return c;
    }
    Counts Since(const Counts& before) const {
        Counts d = Snapshot();
        for (int i = 0; i < kCounterCount; ++i) d[i] -= before[i];
        return d;
    }
    void Add(Counter c) { counters[c].fetch_add(1, std::memory_order_relaxed); }
};
static_assert(std::atomic<int64_t>::is_always_lock_free, "the page is shared between processes");

// The calls the filter hands over, per architecture.
struct ArchCalls {
    uint32_t arch;
    int nanosleep32, nanosleep64, openat, tgkill;  // nanosleep32: with a 32-bit timespec (-1: none)
    bool narrowLong;                       // the conversion's timespec has 32-bit fields
};
constexpr ArchCalls kArchs[] = {{AUDIT_ARCH_X86_64, -1, 230, 257, 234, false}, {AUDIT_ARCH_I386, 267, 407, 295, 270, true}};

inline int64_t NowNs(clockid_t clock) {
    timespec ts{};
    clock_gettime(clock, &ts);
    return static_cast<int64_t>(ts.tv_sec) * kNs + ts.tv_nsec;
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
    Supervisor(int listener, SharedPage* page) : fd_(listener), page_(page) {}

    [[noreturn]] void Run() {  // until the test process is gone (the listener hangs up)
        for (;;) {
            pollfd fds[2] = {{fd_, POLLIN, 0}, {timer_, POLLIN, 0}};
            if (ppoll(fds, 2, nullptr, nullptr) < 0) continue;
            if (fds[1].revents & POLLIN) ExpireSleeps();
            if (fds[0].revents & POLLIN) HandleOne();
            if (fds[0].revents & (POLLHUP | POLLERR | POLLNVAL)) _exit(0);
        }
    }

private:
    struct Sleep { int tid = 0; uint64_t id = 0; int64_t deadline = 0, arrived = 0; };  // tid 0: slot free

    bool Reply(uint64_t id, int64_t val, int32_t error, uint32_t flags = 0) {
        seccomp_notif_resp r{id, val, error, flags};
        return ioctl(fd_, SECCOMP_IOCTL_NOTIF_SEND, &r) == 0;
    }
    void Continue(uint64_t id) { Reply(id, 0, 0, SECCOMP_USER_NOTIF_FLAG_CONTINUE); }
    bool Valid(uint64_t id) { return ioctl(fd_, SECCOMP_IOCTL_NOTIF_ID_VALID, &id) == 0; }

    static bool Transfer(int pid, uint64_t addr, void* buffer, size_t n, bool write) {
        iovec local{buffer, n}, remote{reinterpret_cast<void*>(static_cast<uintptr_t>(addr)), n};
        const ssize_t done = write ? process_vm_writev(pid, &local, 1, &remote, 1, 0)
                                   : process_vm_readv(pid, &local, 1, &remote, 1, 0);
        return done == static_cast<ssize_t>(n);
    }
    // 32-bit fields, or 64-bit ones (of which the kernel reads only the low
    // half of tv_nsec for a 32-bit caller: `compat`).
    static bool ReadTimespec(int pid, uint64_t addr, bool narrow, bool compat, int64_t& sec, int64_t& nsec) {
        int32_t t32[2];
        int64_t t64[2];
        if (narrow ? !Transfer(pid, addr, t32, sizeof t32, false) : !Transfer(pid, addr, t64, sizeof t64, false)) {
            return false;
        }
        sec = narrow ? t32[0] : t64[0];
        nsec = narrow ? t32[1] : compat ? static_cast<int32_t>(t64[1]) : t64[1];
        return nsec >= 0 && nsec < kNs && sec > -(int64_t{1} << 32) && sec < (int64_t{1} << 33);
    }

    // Named "QUELTAisr", remembered once seen (a stale entry after an id is
    // reused only emulates an ordinary thread's sleep, faithfully).
    bool IsTimer(int tid, bool lookUp = true) {
        for (int t : timers_) {
            if (t == tid) return true;
        }
        char path[64], comm[32] = {};
        std::snprintf(path, sizeof path, "/proc/%d/comm", tid);
        const int f = lookUp ? open(path, O_RDONLY | O_CLOEXEC) : -1;
        if (f < 0) return false;
        const ssize_t n = read(f, comm, sizeof comm - 1);
        close(f);
        if (n <= 0 || std::strcmp(comm, "QUELTAisr\n") != 0) return false;
        timers_[nextTimer_++ % kMaxTimers] = tid;
        return true;
    }

    Sleep* SleepOf(int tid) {
        for (Sleep& s : sleeps_) {
            if (s.tid == tid) return &s;
        }
        return nullptr;
    }
    void End(Sleep& s, bool answered) {  // answered, or found ended by a signal
        if (!answered) page_->Add(kSleepsInterrupted);
        s = Sleep{};
        Arm();
    }
    void Arm() {
        int64_t earliest = 0;
        for (const Sleep& o : sleeps_) {
            if (o.tid != 0 && (earliest == 0 || o.deadline < earliest)) earliest = o.deadline;
        }
        itimerspec it{};  // 0: disarmed
        it.it_value = timespec{static_cast<time_t>(earliest / kNs), static_cast<long>(earliest % kNs)};
        timerfd_settime(timer_, TFD_TIMER_ABSTIME, &it, nullptr);
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
        if (!IsTimer(tid) || static_cast<int32_t>(n.data.args[0]) != CLOCK_MONOTONIC ||
            !ReadTimespec(tid, n.data.args[2], int(n.data.nr) == a.nanosleep32, a.narrowLong, sec, nsec) || sec < 0) {
            return Continue(n.id);  // the real kernel sleeps it, or refuses the request
        }
        page_->Add(kTimerSleeps);
        const int64_t now = NowNs(CLOCK_MONOTONIC);
        const int64_t deadline = sec * kNs + nsec + ((n.data.args[1] & TIMER_ABSTIME) ? 0 : now);
        // One call at a time per thread: an earlier sleep still listed was ended by a signal.
        if (Sleep* old = SleepOf(tid)) End(*old, false);
        if (tid == echoTid_) {  // the echo of a wake made before this sleep began
            echoTid_ = 0;
            page_->Add(kWakesEchoed);
            return (void)Reply(n.id, -1, -EAGAIN);
        }
        if (deadline <= now) return (void)Reply(n.id, 0, 0);
        Sleep* slot = SleepOf(0);
        if (slot == nullptr) return Continue(n.id);  // more timers than slots: a real sleep
        *slot = Sleep{tid, n.id, deadline, now};
        Arm();
    }

    void HandleWake(const seccomp_notif& n) {
        page_->Add(kWakeCalls);
        const int tid = static_cast<int32_t>(n.data.args[0]);
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

    int64_t OffsetOf(int64_t clock) const {
        return clock == CLOCK_REALTIME ? realOffset_ + page_->skewNs.load(std::memory_order_relaxed) : 0;
    }
    int32_t Convert(const seccomp_notif& n, const ArchCalls& a) {
        const int pid = static_cast<int>(n.pid);
        const int64_t from = static_cast<int32_t>(n.data.args[0]), to = static_cast<int32_t>(n.data.args[1]);
        for (int64_t c : {from, to}) {
            if (c != CLOCK_REALTIME && c != CLOCK_MONOTONIC) return EINVAL;
        }
        int64_t sec, nsec;
        if (!ReadTimespec(pid, n.data.args[2], a.narrowLong, false, sec, nsec)) return EINVAL;  // out of range (the library's pointers are good)
        const int64_t ns = sec * kNs + nsec - OffsetOf(from) + OffsetOf(to);
        const int64_t outSec = ns / kNs - (ns % kNs < 0), outNsec = ns % kNs + (ns % kNs < 0 ? kNs : 0);
        if (a.narrowLong && outSec != static_cast<int32_t>(outSec)) return EOVERFLOW;
        int64_t wide[2] = {outSec, outNsec};
        int32_t narrow[2] = {static_cast<int32_t>(outSec), static_cast<int32_t>(outNsec)};
        void* out = a.narrowLong ? static_cast<void*>(narrow) : static_cast<void*>(wide);
        if (!Valid(n.id) || !Transfer(pid, n.data.args[2], out, a.narrowLong ? sizeof narrow : sizeof wide, true)) {
            return EFAULT;
        }
        if (!IsTimer(pid, false)) page_->Add(kConvertByCallers);
        return 0;
    }

    void CountOpen(const seccomp_notif& n) {
        if ((n.data.args[2] & O_ACCMODE) != O_RDONLY) return;
        // Two pieces split at the page's end, so that a path near an unmapped page is still read.
        char path[64] = {};
        const uint64_t addr = n.data.args[1];
        const size_t first = std::min<uint64_t>(4096 - addr % 4096, sizeof path - 1);
        iovec local{path, sizeof path - 1}, remote[2] = {{reinterpret_cast<void*>(uintptr_t(addr)), first},
                                                         {reinterpret_cast<void*>(uintptr_t(addr + first)), sizeof path - 1 - first}};
        process_vm_readv(static_cast<int>(n.pid), &local, 1, remote, first < sizeof path - 1 ? 2 : 1, 0);
        if (std::strcmp(path, kWakeFile) == 0) page_->Add(kOpensWakeFile);
        if (std::strcmp(path, kConvertFile) == 0) page_->Add(kOpensConvertFile);
    }

    void HandleOne() {
        seccomp_notif n{};  // zeroed, as the kernel requires
        if (ioctl(fd_, SECCOMP_IOCTL_NOTIF_RECV, &n) != 0) return;  // the target was interrupted
        const ArchCalls* a = n.data.arch == kArchs[0].arch ? &kArchs[0] : n.data.arch == kArchs[1].arch ? &kArchs[1] : nullptr;
        const int nr = n.data.nr;
        if (a == nullptr) return Continue(n.id);
        if (nr == kWakeNr) return HandleWake(n);
        if (nr == kConvertNr) {
            page_->Add(kConvertCalls);
            const int32_t error = Convert(n, *a);
            return (void)Reply(n.id, error == 0 ? 0 : -1, -error);
        }
        if (nr == a->nanosleep32 || nr == a->nanosleep64) return HandleSleep(n, *a);
        if (nr == a->openat) CountOpen(n);
        if (nr == a->tgkill && n.data.args[2] == SIGALRM && IsTimer(static_cast<int>(n.data.args[1]))) {
            page_->Add(kAlarmsToTimer);
        }
        Continue(n.id);
    }

    static constexpr int kMaxTimers = 8;
    int fd_, timer_ = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC);
    SharedPage* page_;
    int64_t realOffset_ = page_->realOffsetNs.load();
    Sleep sleeps_[8];
    int timers_[kMaxTimers] = {};
    unsigned nextTimer_ = 0;
    int echoTid_ = 0;  // the thread whose next sleep a wake's echo ends
};

// Traps, per architecture, the two extra calls, clock_nanosleep, openat and tgkill.
inline std::vector<sock_filter> FilterProgram() {
    std::vector<sock_filter> p = {BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)),
                                  BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArchs[0].arch, 2, 0),
                                  BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArchs[1].arch, 0, 0),
                                  BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW)};
    for (const ArchCalls& a : kArchs) {
        if (&a == &kArchs[1]) p[2].jt = static_cast<uint8_t>(p.size() - 3);
        std::vector<uint32_t> nrs = {uint32_t(kWakeNr), uint32_t(kConvertNr), uint32_t(a.nanosleep64), uint32_t(a.openat),
                                      uint32_t(a.tgkill)};
        if (a.nanosleep32 >= 0) nrs.push_back(uint32_t(a.nanosleep32));
        const uint8_t n = static_cast<uint8_t>(nrs.size());
        p.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)));
        for (uint8_t i = 0; i < n; ++i) p.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, nrs[i], uint8_t(n - i), 0));
        p.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
        p.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_USER_NOTIF));
    }
    return p;
}

// The process-wide sandbox, set up once by the test environment.
class Sandbox : public ::testing::Environment {
public:
    static Sandbox& Get() {
        static Sandbox* s = static_cast<Sandbox*>(::testing::AddGlobalTestEnvironment(new Sandbox));
        return *s;
    }
    bool Ready() const { return page_ != nullptr && why_.empty(); }
    const std::string& Why() const { return why_; }
    SharedPage& Page() { return *page_; }

    static void WriteFile(const char* path, const char* content) {  // nullptr removes the file
        unlink(path);
        const int f = content ? open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0444) : -1;
        if (f >= 0) (void)!write(f, content, std::strlen(content)), close(f);
    }
    void Reset() {  // both files with the emulated numbers, every knob at rest
        WriteFile(kWakeFile, "917\n");
        WriteFile(kConvertFile, "918\n");
        for (auto* knob : {&page_->loseEveryWake, &page_->widenWindowUs, &page_->echoWakes, &page_->wakeReturnsEnosys})
            knob->store(0);
        page_->skewNs.store(0);
    }

    void SetUp() override {
#if !defined(__x86_64__) && !defined(__i386__)
        why_ = "it traps x86-64 and i386 system calls (under qemu the filter would apply to the emulator)";
#else
        if (geteuid() != 0) return Fail("it needs root (a mount namespace and a tmpfs over /sys/kernel)", 0);
        if (!testsupport::CanUseRealtime()) return Fail("the library's timer thread needs SCHED_FIFO", 0);
        if (unshare(CLONE_NEWNS) != 0) return Fail("unshare(CLONE_NEWNS)", errno);
        if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return Fail("private mounts", errno);
        if (mount("kext", "/sys/kernel", "tmpfs", MS_NOSUID | MS_NODEV | MS_NOEXEC, "size=64k,mode=0755") != 0) {
            return Fail("a tmpfs over /sys/kernel", errno);
        }
        void* shared = mmap(nullptr, sizeof(SharedPage), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
        if (shared == MAP_FAILED) return Fail("a shared page", errno);
        page_ = new (shared) SharedPage;
        page_->realOffsetNs.store(MeasureOffset(CLOCK_REALTIME));
        int sv[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0) return Fail("socketpair", errno);
        const pid_t parent = getpid(), child = fork();
        if (child < 0) return Fail("fork", errno);
        if (child == 0) RunSupervisor(sv[1], parent);
        close(sv[1]);
        prctl(PR_SET_PTRACER, child);  // lets it read and write this process's memory under Yama
        std::vector<sock_filter> filter = FilterProgram();
        sock_fprog prog{static_cast<unsigned short>(filter.size()), filter.data()};
        prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0);  // else only with CAP_SYS_ADMIN
        const int listener = int(syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_NEW_LISTENER, &prog));
        if (listener < 0) {
            kill(child, SIGKILL);
            return Fail("a seccomp user-notification filter", errno);
        }
        char ack = 0;  // the supervisor takes the listener with pidfd_getfd, then answers
        const bool served = write(sv[0], &listener, sizeof listener) == sizeof listener && read(sv[0], &ack, 1) == 1;
        close(listener);
        close(sv[0]);
        if (!served) return Fail("the supervisor did not start", 0);
        Reset();
#endif
    }

private:
    void Fail(const char* what, int err) { why_ = std::string(what) + (err ? std::string(" failed: ") + std::strerror(err) : ""); }

    [[noreturn]] void RunSupervisor(int socket, pid_t parent) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
        int theirs = -1;
        if (read(socket, &theirs, sizeof theirs) != sizeof theirs) _exit(1);
        const int listener = static_cast<int>(syscall(SYS_pidfd_getfd, syscall(SYS_pidfd_open, parent, 0), theirs, 0));
        if (listener < 0) _exit(1);
        sched_param p{};
        p.sched_priority = sched_get_priority_max(SCHED_FIFO);
        sched_setscheduler(0, SCHED_FIFO, &p);  // when allowed: wakes and deadlines are served first
        Supervisor supervisor(listener, page_);
        (void)!write(socket, "A", 1);
        close(socket);
        supervisor.Run();
    }

    SharedPage* page_ = nullptr;
    std::string why_;
};
inline Sandbox& gSandbox = Sandbox::Get();  // registered before main runs the tests

// Every test: skipped where the emulation cannot run; both files present, every knob at rest.
class KextTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (!gSandbox.Ready()) GTEST_SKIP() << "no emulated kernel extension: " << gSandbox.Why();
        gSandbox.Reset();
    }
    SharedPage& Page() { return gSandbox.Page(); }
};

// A SetCallback function: stores CLOCK_MONOTONIC into its std::atomic<uint64_t>.
inline void StampMonotonic(void* word) { static_cast<std::atomic<uint64_t>*>(word)->store(testsupport::MonoNowNs()); }

// The library's epoch offset: its global clock reads CLOCK_REALTIME directly,
// so the difference is whole seconds plus the reading's own microseconds.
inline int64_t EpochOffsetNs(iKPusTimingEngine* engine) {
    ClockTime g;
    const int64_t real = static_cast<int64_t>(testsupport::RealNowNs());
    engine->ReadGlobal2(g);
    const int64_t d = static_cast<int64_t>(testsupport::U64(g)) - real;
    return (d + kNs / 2) / kNs * kNs;
}

}  // namespace kext

#endif
