// The timer's parts that need no real-time privilege: the wake stand-in on a
// plain thread, the wake dispatch, the timer's trivial slots, and a timer
// whose thread is refused SCHED_FIFO (in a child process without the right).
#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/capability.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
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

timespec At(uint64_t ns) {
    timespec ts;
    ts.tv_sec = static_cast<time_t>(ns / 1000000000ull);
    ts.tv_nsec = static_cast<long>(ns % 1000000000ull);
    return ts;
}

int32_t Tid() { return static_cast<int32_t>(syscall(SYS_gettid)); }

// The stand-in relies on the timer's SIGALRM handler; install it for the
// duration of a test and put back what was there.
class WakeFixture : public ::testing::Test {
protected:
    void SetUp() override {
        struct sigaction sa {};
        sa.sa_handler = &Timer::AlarmHandler;
        sigemptyset(&sa.sa_mask);
        sigaction(SIGALRM, &sa, &saved_);
        gPalWakeStandInEnabled.store(true);
    }
    void TearDown() override {
        gPalWakeStandInEnabled.store(true);
        sigaction(SIGALRM, &saved_, nullptr);
    }
    struct sigaction saved_ {};
};

// A thread that registers, then sleeps once per round until a deadline far
// ahead (or the one given), reporting each result.
struct Sleeper {
    std::atomic<int32_t> tid{0};
    std::atomic<int> round{0};          // rounds started
    std::atomic<int> done{0};           // rounds finished
    std::atomic<int> go{0};             // rounds allowed to start
    std::atomic<PalSleepResult> last{PalSleepResult::kFailed};
    std::atomic<uint64_t> returnedAt{0};
    std::atomic<uint64_t> deadline{0};  // 0: ten seconds from the round's start
    std::atomic<bool> clearEachRound{true};  // drop a stale wake before sleeping
    std::atomic<bool> quit{false};
    std::thread thread;

    void Start() {
        thread = std::thread([this] {
            PalWakeSlot* slot = PalWakeRegister();
            tid.store(slot ? Tid() : -1);
            for (;;) {
                while (go.load() == round.load() && !quit.load()) std::this_thread::yield();
                if (quit.load()) break;
                if (clearEachRound.load()) PalWakeClear(slot);
                const uint64_t d = deadline.load() ? deadline.load() : MonoNowNs() + 10000 * kMs;
                round.fetch_add(1);
                const PalSleepResult r = PalWakeableSleepUntil(slot, At(d));
                returnedAt.store(MonoNowNs());
                last.store(r);
                done.fetch_add(1);
            }
            PalWakeUnregister(slot);
        });
        while (tid.load() == 0) std::this_thread::yield();
    }
    void Stop() {
        quit.store(true);
        thread.join();
    }
    bool WaitDone(int n, uint64_t timeoutNs) {
        const uint64_t end = MonoNowNs() + timeoutNs;
        while (done.load() < n) {
            if (MonoNowNs() > end) return false;
            std::this_thread::yield();
        }
        return true;
    }
};

// --- the wake stand-in ------------------------------------------------------

TEST_F(WakeFixture, WakeEndsSleepPromptlyAndPendingWakeEndsNextAtOnce) {
    Sleeper s;
    s.Start();
    ASSERT_GT(s.tid.load(), 0);

    s.go.store(1);
    while (s.round.load() < 1) std::this_thread::yield();
    usleep(20000);  // well inside the ten-second sleep
    const uint64_t woke = MonoNowNs();
    EXPECT_EQ(PalWakeThreadId(s.tid.load()), 0);
    ASSERT_TRUE(s.WaitDone(1, 2000 * kMs));
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
    printf("stand-in wake latency: %.1f us\n", (s.returnedAt.load() - woke) / 1e3);

    // A wake requested while the thread is not sleeping is not lost: the next
    // sleep (which does not clear it first here) ends at once.
    s.clearEachRound.store(false);
    s.deadline.store(MonoNowNs() + 10000 * kMs);
    EXPECT_EQ(PalWakeThreadId(s.tid.load()), 0);
    usleep(5000);
    s.go.store(2);
    ASSERT_TRUE(s.WaitDone(2, 2000 * kMs));
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
    s.Stop();
}

TEST_F(WakeFixture, DeadlineIsNeverEarlyAndPlainSignalsResumeTheSleep) {
    Sleeper s;
    s.Start();
    const uint64_t deadline = MonoNowNs() + 80 * kMs;
    s.deadline.store(deadline);
    s.go.store(1);
    while (s.round.load() < 1) std::this_thread::yield();
    // SIGALRM without a wake request (another user of the signal) must not
    // end the sleep.
    for (int i = 0; i < 5 && s.done.load() == 0; ++i) {
        pthread_kill(s.thread.native_handle(), SIGALRM);
        usleep(5000);
    }
    ASSERT_TRUE(s.WaitDone(1, 2000 * kMs));
    EXPECT_EQ(s.last.load(), PalSleepResult::kDeadline);
    EXPECT_GE(s.returnedAt.load(), deadline);
    EXPECT_LT(s.returnedAt.load() - deadline, 50 * kMs);
    s.Stop();
}

// Wakes fired at every moment around the start of a sleep, including between
// the sleeper's flag check and its system call: no sleep may run on to its
// ten-second deadline.
TEST_F(WakeFixture, WakesRacingTheStartOfASleepAreNeverLost) {
    Sleeper s;
    s.Start();
    const int rounds = 400;
    uint32_t spin = 0;
    for (int r = 1; r <= rounds; ++r) {
        s.go.store(r);
        while (s.round.load() < r) {
        }
        spin = spin * 1103515245u + 12345u;
        for (volatile uint32_t i = 0, n = (spin >> 16) % 4000; i < n; ++i) {
        }
        ASSERT_EQ(PalWakeThreadId(s.tid.load()), 0);
        ASSERT_TRUE(s.WaitDone(r, 3000 * kMs)) << "round " << r << " missed its wake";
        ASSERT_EQ(s.last.load(), PalSleepResult::kWoken);
    }
    s.Stop();
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
    s.Start();
    gWindowTid.store(s.tid.load());
    gWindowHits.store(0);
    gPalWakeWindowHook.store(&WakeInWindow);
    s.go.store(1);
    const bool done = s.WaitDone(1, 3000 * kMs);
    gPalWakeWindowHook.store(nullptr);
    if (!done) PalWakeThreadId(s.tid.load());  // release it so the test can end
    s.Stop();
    ASSERT_TRUE(done) << "the wake in the window was lost";
    EXPECT_EQ(gWindowHits.load(), 1);
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
}

TEST_F(WakeFixture, StandInRefusesWhatItCannotServe) {
    // Not a registered thread.
    EXPECT_EQ(PalWakeThreadId(Tid()), 38);
    EXPECT_EQ(PalWakeThreadId(-1, true), 38);

    Sleeper s;
    s.Start();
    gPalWakeStandInEnabled.store(false);
    EXPECT_EQ(PalWakeThreadId(s.tid.load()), 38);
    // Forced (a timer's own shutdown) it still serves.
    EXPECT_EQ(PalWakeThreadId(s.tid.load(), true), 0);
    gPalWakeStandInEnabled.store(true);
    s.Stop();
    // Once the thread has unregistered it can no longer be named.
    EXPECT_EQ(PalWakeThreadId(s.tid.load(), true), 38);
}

TEST_F(WakeFixture, SlotTableIsBoundedAndSlotsAreReused) {
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

// --- the timer's dispatch and trivial slots ---------------------------------

class WakeNumber : public ::testing::Test {
protected:
    void SetUp() override { saved_ = gWakeSyscallNr.load(); }
    void TearDown() override {
        gWakeSyscallNr.store(saved_);
        gPalWakeStandInEnabled.store(true);
    }
    int32_t saved_ = 0;
};

TEST_F(WakeNumber, NumberBelowOneMeansNoKernelCall) {
    for (int32_t nr : {-1, 0, -17}) {
        gWakeSyscallNr.store(nr);
        gPalWakeStandInEnabled.store(false);
        EXPECT_EQ(WakeTimerThread(Tid()), 38) << nr;
        gPalWakeStandInEnabled.store(true);
        // Still nothing to wake: this thread never registered.
        EXPECT_EQ(WakeTimerThread(Tid()), 38) << nr;
    }
}

TEST_F(WakeNumber, NumberOfOneOrMoreIsCalledWithTheThreadId) {
    // getppid ignores its argument and is harmless to call.
    gWakeSyscallNr.store(SYS_getppid);
    EXPECT_EQ(WakeTimerThread(12345), static_cast<int32_t>(getppid()));
}

TEST(TimerSlots, TrivialSlotsAndUninitialisedDestruction) {
    std::unique_ptr<Timer> timer(new Timer());
    ASSERT_NE(timer, nullptr);
    EXPECT_EQ(timer->GetTicksPerMicrosecond(), 1000u);
    timer->NoOperation();
    EXPECT_FALSE(timer->IsServing());
    EXPECT_EQ(timer->state.threadId.load(), -1);
    EXPECT_EQ(timer->state.expiry.tv_sec, kParkedSeconds);
    EXPECT_EQ(timer->state.expiry.tv_nsec, 0);

    // With no thread, SetExpiry only stores, splitting into 32-bit seconds
    // and nanoseconds.
    const uint64_t when = 0x123456789ABCDEFull;
    timer->SetExpiry(ClockTime{static_cast<uint32_t>(when), static_cast<uint32_t>(when >> 32)});
    EXPECT_EQ(timer->state.expiry.tv_sec,
              static_cast<int32_t>(static_cast<uint32_t>(when / 1000000000ull)));
    EXPECT_EQ(timer->state.expiry.tv_nsec, static_cast<int32_t>(when % 1000000000ull));
    timer->ExpireNow();
    EXPECT_EQ(timer->state.expiry.tv_sec, 0);
    EXPECT_EQ(timer->state.expiry.tv_nsec, 0);
    timer.reset();  // never initialised: nothing to join
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
    rlimit none{0, 0};
    if (setrlimit(RLIMIT_RTPRIO, &none) != 0) return 12;

    struct sigaction before {};
    sigaction(SIGALRM, nullptr, &before);
    const int threadsBefore = testsupport::CountThreads();

    Timer* timer = new Timer();
    if (timer == nullptr) return 13;
    if (timer->Initialize(&NoCallback) != 0) return 14;
    if (timer->IsServing()) return 15;
    timer->SetExpiry(ClockTime{0, 0});  // no thread to wake: must not signal anyone
    const uint64_t t0 = MonoNowNs();
    delete timer;
    if (MonoNowNs() - t0 > 50 * kMs) return 16;

    struct sigaction after {};
    sigaction(SIGALRM, nullptr, &after);
    if (after.sa_handler != before.sa_handler) return 17;
    // A joined thread can linger in /proc for a moment (under an emulator).
    for (int i = 0; i < 200 && testsupport::CountThreads() != threadsBefore; ++i) usleep(5000);
    if (testsupport::CountThreads() != threadsBefore) return 18;
    return 0;
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
    ssize_t n;
    while ((n = read(fds[0], buf, sizeof buf)) > 0) err.append(buf, static_cast<size_t>(n));
    close(fds[0]);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0) << "child stderr: " << err;

    size_t lines = 0;
    for (char c : err) lines += c == '\n';
    EXPECT_EQ(lines, 1u) << err;
    EXPECT_NE(err.find("real-time priority"), std::string::npos) << err;
}

}  // namespace
}  // namespace quelta
