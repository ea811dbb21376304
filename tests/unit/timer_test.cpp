// The timer's parts that need no real-time privilege: the wake stand-in on a
// plain thread, the wake dispatch, the slots that need no thread, and a timer
// whose thread is refused SCHED_FIFO (in a child process without the right).
#include <gtest/gtest.h>

#include <linux/capability.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalWake.h"

namespace quelta {
namespace {

using testsupport::MonoNowNs;
using Timer = tKPusLinuxNanoSleepTimer;

constexpr uint64_t kMs = 1000000ull;

int32_t Tid() { return static_cast<int32_t>(syscall(SYS_gettid)); }

// The stand-in relies on the timer's SIGALRM handler: installed for each test
// and put back afterwards, with the dispatch settings.
class WakeFixture : public ::testing::Test {
protected:
    void SetUp() override {
        struct sigaction sa {};
        sa.sa_handler = &Timer::AlarmHandler;
        sigemptyset(&sa.sa_mask);
        sigaction(SIGALRM, &sa, &saved_);
    }
    void TearDown() override {
        gPalWakeStandInEnabled.store(true);
        gWakeSyscallNr.store(savedNr_);
        sigaction(SIGALRM, &saved_, nullptr);
    }
    struct sigaction saved_ {};
    int32_t savedNr_ = gWakeSyscallNr.load();
};

// A registered thread that sleeps once per round (Go) until `deadline`, or
// ten seconds ahead when it is 0, and reports each result.
struct Sleeper {
    std::atomic<int32_t> tid{0};
    std::atomic<int> go{0}, started{0}, done{0};
    std::atomic<PalSleepResult> last{PalSleepResult::kFailed};
    std::atomic<uint64_t> deadline{0}, returnedAt{0};
    std::atomic<bool> clearFirst{true};  // drop a stale wake before sleeping
    std::atomic<bool> quit{false};
    std::thread thread{[this] {
        PalWakeSlot* slot = PalWakeRegister();
        tid.store(slot ? Tid() : -1);
        for (;;) {
            while (go.load() == started.load() && !quit.load()) std::this_thread::yield();
            if (quit.load()) break;
            if (clearFirst.load()) PalWakeClear(slot);
            const uint64_t d = deadline.load() ? deadline.load() : MonoNowNs() + 10000 * kMs;
            started.fetch_add(1);
            const timespec ts{static_cast<time_t>(d / 1000000000ull), static_cast<long>(d % 1000000000ull)};
            last.store(PalWakeableSleepUntil(slot, ts));
            returnedAt.store(MonoNowNs());
            done.fetch_add(1);
        }
        PalWakeUnregister(slot);
    }};

    Sleeper() {
        while (tid.load() == 0) std::this_thread::yield();
    }
    ~Sleeper() {
        quit.store(true);
        thread.join();
    }
    void Go(int round) {  // returns as the thread is about to sleep
        go.store(round);
        while (started.load() < round) std::this_thread::yield();
    }
    bool WaitDone(int n, uint64_t timeoutNs = 2000 * kMs) {
        for (const uint64_t end = MonoNowNs() + timeoutNs; done.load() < n; std::this_thread::yield()) {
            if (MonoNowNs() > end) return false;
        }
        return true;
    }
};

// --- the wake stand-in ------------------------------------------------------

// One sleeper through three rounds: a deadline is never served early, and
// plain SIGALRMs (another user of the signal) do not end the sleep; a wake
// ends a ten-second sleep promptly; a wake requested while the thread is not
// sleeping is not lost, the next sleep (not clearing it first) ends at once.
TEST_F(WakeFixture, DeadlineWakeAndPendingWake) {
    Sleeper s;
    ASSERT_GT(s.tid.load(), 0);
    const uint64_t deadline = MonoNowNs() + 80 * kMs;
    s.deadline.store(deadline);
    s.Go(1);
    for (int i = 0; i < 5 && s.done.load() == 0; ++i) {
        pthread_kill(s.thread.native_handle(), SIGALRM);
        usleep(5000);
    }
    ASSERT_TRUE(s.WaitDone(1));
    EXPECT_EQ(s.last.load(), PalSleepResult::kDeadline);
    EXPECT_GE(s.returnedAt.load(), deadline);
    EXPECT_LT(s.returnedAt.load() - deadline, 50 * kMs);

    s.deadline.store(0);
    s.Go(2);
    usleep(20000);
    const uint64_t woke = MonoNowNs();
    EXPECT_EQ(PalWakeThreadId(s.tid.load()), 0);
    ASSERT_TRUE(s.WaitDone(2));
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
    printf("stand-in wake latency: %.1f us\n", (s.returnedAt.load() - woke) / 1e3);

    s.clearFirst.store(false);
    EXPECT_EQ(PalWakeThreadId(s.tid.load()), 0);
    usleep(5000);
    s.Go(3);
    ASSERT_TRUE(s.WaitDone(3));
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
}

// Wakes fired at every moment around the start of a sleep, including between
// the sleeper's flag check and its system call: no sleep may run on to its
// ten-second deadline. Under TSan a signal handler runs only at the next call
// TSan intercepts, and clock_nanosleep is not one, so a wake landing just
// before the system call waits for the sleep to end: there the rounds sleep
// 20 ms and only the race detection applies.
TEST_F(WakeFixture, WakesRacingTheStartOfASleepAreNeverLost) {
#if defined(__SANITIZE_THREAD__)
    constexpr bool kDeferredSignals = true;
#else
    constexpr bool kDeferredSignals = false;
#endif
    Sleeper s;
    uint32_t spin = 0;
    for (int r = 1; r <= 400; ++r) {
        if (kDeferredSignals) s.deadline.store(MonoNowNs() + 20 * kMs);
        s.Go(r);
        spin = spin * 1103515245u + 12345u;
        for (volatile uint32_t i = 0, n = (spin >> 16) % 4000; i < n; ++i) {
        }
        ASSERT_EQ(PalWakeThreadId(s.tid.load()), 0);
        ASSERT_TRUE(s.WaitDone(r, 3000 * kMs)) << "round " << r << " missed its wake";
        ASSERT_TRUE(kDeferredSignals || s.last.load() == PalSleepResult::kWoken) << "round " << r;
    }
}

// The same window hit on purpose: the wake (flag and signal) lands after the
// sleeper's last check, right before its system call. The signal to oneself
// is taken before pthread_kill returns, so only the handler's zeroing of the
// pending request keeps the thread from sleeping to the old deadline.
std::atomic<int32_t> gWindowTid{0};
std::atomic<int> gWindowHits{0};
void WakeInWindow() {
    if (Tid() != gWindowTid.load()) return;
    gWindowHits.fetch_add(1);
    PalWakeThreadId(gWindowTid.load());
}

TEST_F(WakeFixture, WakeBetweenLastCheckAndSystemCallEndsTheSleep) {
    Sleeper s;
    gWindowTid.store(s.tid.load());
    gWindowHits.store(0);
    gPalWakeWindowHook.store(&WakeInWindow);
    s.Go(1);
    const bool done = s.WaitDone(1, 3000 * kMs);
    gPalWakeWindowHook.store(nullptr);
    if (!done) PalWakeThreadId(s.tid.load());  // release it so the test can end
    ASSERT_TRUE(done) << "the wake in the window was lost";
    EXPECT_EQ(gWindowHits.load(), 1);
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
}

// The dispatch: a wake number below 1 means no kernel call, so the stand-in
// serves (or refuses with 38 when switched off, unless forced as for a
// timer's own shutdown); otherwise that system call gets the thread id.
TEST_F(WakeFixture, DispatchAndWhatTheStandInRefuses) {
    EXPECT_EQ(PalWakeThreadId(Tid()), 38) << "not a registered thread";
    EXPECT_EQ(PalWakeThreadId(-1, true), 38);
    int32_t tid = 0;
    {
        Sleeper s;
        tid = s.tid.load();
        for (int32_t nr : {-1, 0, -17}) {
            gWakeSyscallNr.store(nr);
            EXPECT_EQ(WakeTimerThread(tid), 0) << nr;
            gPalWakeStandInEnabled.store(false);
            EXPECT_EQ(WakeTimerThread(tid), 38) << nr;
            EXPECT_EQ(PalWakeThreadId(tid, true), 0) << nr;
            gPalWakeStandInEnabled.store(true);
        }
        gWakeSyscallNr.store(SYS_getppid);  // ignores its argument and is harmless
        EXPECT_EQ(WakeTimerThread(12345), static_cast<int32_t>(getppid()));
    }
    EXPECT_EQ(PalWakeThreadId(tid, true), 38) << "an unregistered thread can no longer be named";

    // The slot table is bounded and its slots are reused.
    std::vector<PalWakeSlot*> taken;
    while (PalWakeSlot* slot = PalWakeRegister()) {
        taken.push_back(slot);
        ASSERT_LE(taken.size(), 1024u);
    }
    EXPECT_GE(taken.size(), 1u);
    for (PalWakeSlot* slot : taken) PalWakeUnregister(slot);
    PalWakeSlot* again = PalWakeRegister();
    EXPECT_NE(again, nullptr);
    PalWakeUnregister(again);
}

// --- slots without a thread ---------------------------------------------------

TEST(TimerSlots, WithoutAThreadSetExpiryOnlyStoresAndDestructionJoinsNothing) {
    std::unique_ptr<Timer> timer(new Timer());
    EXPECT_EQ(timer->GetTicksPerMicrosecond(), 1000u);
    // 32-bit seconds and nanoseconds.
    const uint64_t when = 0x123456789ABCDEFull;
    timer->SetExpiry(ClockTime{static_cast<uint32_t>(when), static_cast<uint32_t>(when >> 32)});
    EXPECT_EQ(timer->state.expiry.tv_sec, static_cast<int32_t>(static_cast<uint32_t>(when / 1000000000ull)));
    EXPECT_EQ(timer->state.expiry.tv_nsec, static_cast<int32_t>(when % 1000000000ull));
    timer->ExpireNow();
    EXPECT_EQ(timer->state.expiry.tv_sec, 0);
    EXPECT_EQ(timer->state.expiry.tv_nsec, 0);
}

// --- a timer without real-time privilege ------------------------------------

void NoCallback() {}

// Runs in a forked child: drops the right to SCHED_FIFO, starts a timer and
// reports through the exit code; stderr goes to the given descriptor.
int ChildWithoutPrivilege(int stderrFd) {
    dup2(stderrFd, 2);
    __user_cap_header_struct header{};
    header.version = _LINUX_CAPABILITY_VERSION_3;
    __user_cap_data_struct data[2]{};
    if (syscall(SYS_capget, &header, data) != 0) return 10;
    data[0].effective &= ~(1u << CAP_SYS_NICE);
    data[0].permitted &= ~(1u << CAP_SYS_NICE);
    if (syscall(SYS_capset, &header, data) != 0) return 11;
    const rlimit none{0, 0};
    if (setrlimit(RLIMIT_RTPRIO, &none) != 0) return 12;

    struct sigaction before {}, after {};
    sigaction(SIGALRM, nullptr, &before);
    const int threadsBefore = testsupport::CountThreads();
    Timer* timer = new Timer();
    if (timer->Initialize(&NoCallback) != 0) return 13;
    if (timer->IsServing()) return 14;
    timer->SetExpiry(ClockTime{0, 0});  // no thread to wake: must not signal anyone
    const uint64_t t0 = MonoNowNs();
    delete timer;
    if (MonoNowNs() - t0 > 50 * kMs) return 15;
    sigaction(SIGALRM, nullptr, &after);
    if (after.sa_handler != before.sa_handler) return 16;
    // A joined thread can linger in /proc for a moment (under an emulator).
    for (int i = 0; i < 200 && testsupport::CountThreads() != threadsBefore; ++i) usleep(5000);
    return testsupport::CountThreads() == threadsBefore ? 0 : 17;
}

TEST(TimerWithoutPrivilege, ReportsOnceServesNothingAndEndsPromptly) {
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    fflush(nullptr);
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        close(fds[0]);
        _exit(ChildWithoutPrivilege(fds[1]));
    }
    close(fds[1]);
    std::string err;
    char buf[512];
    for (ssize_t n; (n = read(fds[0], buf, sizeof buf)) > 0;) err.append(buf, static_cast<size_t>(n));
    close(fds[0]);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0) << "child stderr: " << err;
    EXPECT_EQ(std::count(err.begin(), err.end(), '\n'), 1) << err;
    EXPECT_NE(err.find("real-time priority"), std::string::npos) << err;
}

}  // namespace
}  // namespace quelta
