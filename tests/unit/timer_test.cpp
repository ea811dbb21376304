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

// The dispatch settings are put back after each test.
class WakeFixture : public ::testing::Test {
protected:
    void TearDown() override {
        gPalWakeStandInEnabled.store(true);
        gWakeSyscallNr.store(savedNr_);
    }
    int32_t savedNr_ = gWakeSyscallNr.load();
};

timespec At(uint64_t ns) { return timespec{static_cast<time_t>(ns / 1000000000ull), static_cast<long>(ns % 1000000000ull)}; }

// A thread that sleeps once per round (Go) on a wake word until `deadline`,
// or ten seconds ahead when it is 0, and reports each result. The snapshot is
// taken when the round starts, as the timer takes it with its expiry.
struct Sleeper {
    PalWakeWord word;
    std::atomic<int> go{0}, started{0}, done{0};
    std::atomic<PalSleepResult> last{PalSleepResult::kFailed};
    std::atomic<uint64_t> deadline{0}, returnedAt{0};
    std::atomic<bool> quit{false};
    std::thread thread{[this] {
        for (;;) {
            while (go.load() == started.load() && !quit.load()) std::this_thread::yield();
            if (quit.load()) break;
            const uint32_t snapshot = PalWakeSnapshot(word);
            const uint64_t d = deadline.load() ? deadline.load() : MonoNowNs() + 10000 * kMs;
            started.fetch_add(1);
            last.store(PalWakeableSleepUntil(word, snapshot, At(d)));
            returnedAt.store(MonoNowNs());
            done.fetch_add(1);
        }
    }};

    ~Sleeper() {
        quit.store(true);
        thread.join();
    }
    void Go(int round) {  // returns once the snapshot is taken
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

void IgnoreAlarm(int) {}

// --- the wake stand-in ------------------------------------------------------

// A deadline is served, never early, and signals (another user of SIGALRM)
// do not end the sleep; a wake ends a ten-second sleep promptly; a wake that
// lands after the snapshot but before the sleep begins is not lost: that
// sleep does not start.
TEST_F(WakeFixture, DeadlineWakeAndAWakeBeforeTheSleep) {
    struct sigaction ignore {}, saved {};
    ignore.sa_handler = &IgnoreAlarm;
    sigemptyset(&ignore.sa_mask);
    sigaction(SIGALRM, &ignore, &saved);
    Sleeper s;
    const uint64_t deadline = MonoNowNs() + 80 * kMs;
    s.deadline.store(deadline);
    s.Go(1);
    for (int i = 0; i < 5 && s.done.load() == 0; ++i) {
        pthread_kill(s.thread.native_handle(), SIGALRM);
        usleep(5000);
    }
    ASSERT_TRUE(s.WaitDone(1));
    sigaction(SIGALRM, &saved, nullptr);
    EXPECT_EQ(s.last.load(), PalSleepResult::kDeadline);
    EXPECT_GE(s.returnedAt.load(), deadline);
    EXPECT_LT(s.returnedAt.load() - deadline, 50 * kMs);

    s.deadline.store(0);
    s.Go(2);
    usleep(20000);
    const uint64_t woke = MonoNowNs();
    PalWake(s.word);
    ASSERT_TRUE(s.WaitDone(2));
    EXPECT_EQ(s.last.load(), PalSleepResult::kWoken);
    printf("stand-in wake latency: %.1f us\n", (s.returnedAt.load() - woke) / 1e3);

    // The snapshot predates the wake: the sleep returns at once, whatever the
    // thread did in between.
    PalWakeWord word;
    const uint32_t snapshot = PalWakeSnapshot(word);
    PalWake(word);
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(PalWakeableSleepUntil(word, snapshot, At(t0 + 10000 * kMs)), PalSleepResult::kWoken);
    EXPECT_LT(MonoNowNs() - t0, 50 * kMs);
    // A deadline already past is served at once.
    EXPECT_EQ(PalWakeableSleepUntil(word, PalWakeSnapshot(word), At(t0)), PalSleepResult::kDeadline);
}

// Wakes fired at every moment around the start of a sleep: no sleep may run
// on to its ten-second deadline.
TEST_F(WakeFixture, WakesRacingTheStartOfASleepAreNeverLost) {
    Sleeper s;
    uint32_t spin = 0;
    for (int r = 1; r <= 2000; ++r) {
        s.Go(r);
        spin = spin * 1103515245u + 12345u;
        for (volatile uint32_t i = 0, n = (spin >> 16) % 4000; i < n; ++i) {
        }
        PalWake(s.word);
        ASSERT_TRUE(s.WaitDone(r, 3000 * kMs)) << "round " << r << " missed its wake";
        ASSERT_EQ(s.last.load(), PalSleepResult::kWoken) << "round " << r;
    }
}

// The dispatch: a wake number below 1 means no kernel call, so the stand-in
// serves (or refuses with 38 when switched off); otherwise that system call
// gets the timer thread's id.
TEST_F(WakeFixture, DispatchAndWhatTheStandInRefuses) {
    TimerThreadState state;
    state.threadId.store(12345);
    for (int32_t nr : {-1, 0, -17}) {
        gWakeSyscallNr.store(nr);
        const uint32_t before = PalWakeSnapshot(state.wakeWord);
        EXPECT_EQ(WakeTimerThread(state), 0) << nr;
        EXPECT_NE(PalWakeSnapshot(state.wakeWord), before) << "the stand-in did not move the word";
        gPalWakeStandInEnabled.store(false);
        EXPECT_EQ(WakeTimerThread(state), 38) << nr;
        gPalWakeStandInEnabled.store(true);
    }
    gWakeSyscallNr.store(SYS_getppid);  // ignores its argument and is harmless
    const uint32_t before = PalWakeSnapshot(state.wakeWord);
    EXPECT_EQ(WakeTimerThread(state), static_cast<int32_t>(getppid()));
    EXPECT_EQ(PalWakeSnapshot(state.wakeWord), before) << "the kernel call serves alone";
}

// --- slots without a thread ---------------------------------------------------

std::atomic<int> gAlarms{0};
void CountAlarm(int) { gAlarms.fetch_add(1); }

// A timer that was never initialised has no thread: SetExpiry and ExpireNow
// only store the expiry (32-bit seconds and nanoseconds) and wake nobody, and
// destroying it is prompt and quiet: no thread started or joined, no signal
// sent, the process's SIGALRM action left as it was.
TEST(TimerSlots, WithoutAThreadSetExpiryOnlyStoresAndDestructionIsQuiet) {
    struct sigaction counting {}, saved {}, after {};
    counting.sa_handler = &CountAlarm;
    sigemptyset(&counting.sa_mask);
    sigaction(SIGALRM, &counting, &saved);
    gAlarms.store(0);
    const int threads = testsupport::CountThreads();

    Timer* timer = new Timer();
    EXPECT_EQ(timer->GetTicksPerMicrosecond(), 1000u);
    const uint32_t word = PalWakeSnapshot(timer->state.wakeWord);
    const uint64_t when = 0x123456789ABCDEFull;
    timer->SetExpiry(ClockTime{static_cast<uint32_t>(when), static_cast<uint32_t>(when >> 32)});
    EXPECT_EQ(timer->state.expiry.tv_sec, static_cast<int32_t>(static_cast<uint32_t>(when / 1000000000ull)));
    EXPECT_EQ(timer->state.expiry.tv_nsec, static_cast<int32_t>(when % 1000000000ull));
    timer->ExpireNow();
    EXPECT_EQ(timer->state.expiry.tv_sec, 0);
    EXPECT_EQ(timer->state.expiry.tv_nsec, 0);
    EXPECT_EQ(PalWakeSnapshot(timer->state.wakeWord), word) << "woke a thread that does not exist";
    EXPECT_EQ(testsupport::CountThreads(), threads);

    const uint64_t t0 = MonoNowNs();
    delete timer;
    EXPECT_LT(MonoNowNs() - t0, 50 * kMs);
    EXPECT_EQ(gAlarms.load(), 0);
    sigaction(SIGALRM, &saved, &after);
    EXPECT_EQ(after.sa_handler, &CountAlarm) << "the destruction changed the SIGALRM action";
    EXPECT_EQ(testsupport::CountThreads(), threads);
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
