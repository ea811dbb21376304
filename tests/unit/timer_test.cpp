// The timer's parts that need no real-time privilege: the wake stand-in on a
// plain thread and the slots of a timer without a thread. (The dispatch to
// the kernel call and its fallback: tests/kext and tests/rt.)
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "TestSupport.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalWake.h"

namespace quelta {
namespace {

using testsupport::MonoNowNs;
constexpr uint64_t kMs = 1000000ull;

timespec At(uint64_t ns) { return timespec{static_cast<time_t>(ns / 1000000000ull), static_cast<long>(ns % 1000000000ull)}; }
std::atomic<int> gAlarms{0};
void CountAlarm(int) { gAlarms.fetch_add(1); }

// The stand-in: a deadline is served, never early, and signals (another user
// of SIGALRM) do not end the sleep; a wake does; a wake made after the
// snapshot but before the sleep starts is not lost: that sleep returns at once.
TEST(WakeStandIn, DeadlinesSignalsAndWakes) {
    PalWakeWord word;
    std::atomic<PalSleepResult> result{PalSleepResult::kFailed};
    std::atomic<uint64_t> returned{0};
    const uint64_t deadline = MonoNowNs() + 80 * kMs;
    {
        testsupport::ScopedAlarmHandler counting(&CountAlarm);
        std::thread sleeper([&] {
            result = PalWakeableSleepUntil(word, PalWakeSnapshot(word), At(deadline));
            returned = MonoNowNs();
        });
        while (returned == 0) pthread_kill(sleeper.native_handle(), SIGALRM), usleep(5000);
        sleeper.join();
    }
    EXPECT_TRUE(result.load() == PalSleepResult::kDeadline && returned.exchange(0) >= deadline);
    std::thread woken([&] {
        result = PalWakeableSleepUntil(word, PalWakeSnapshot(word), At(MonoNowNs() + 10000 * kMs));
        returned = MonoNowNs();
    });
    while (returned == 0) PalWake(word), usleep(2000);  // one wake may land before its snapshot
    woken.join();
    EXPECT_EQ(result.load(), PalSleepResult::kWoken);
    const uint32_t snapshot = PalWakeSnapshot(word);
    PalWake(word);
    const uint64_t t0 = MonoNowNs();
    EXPECT_EQ(PalWakeableSleepUntil(word, snapshot, At(t0 + 10000 * kMs)), PalSleepResult::kWoken);
    EXPECT_LT(MonoNowNs() - t0, 3000 * kMs);
    EXPECT_EQ(PalWakeableSleepUntil(word, PalWakeSnapshot(word), At(t0)), PalSleepResult::kDeadline);  // past: at once
}

// A timer never initialised has no thread: SetExpiry and ExpireNow only store
// the expiry (32-bit seconds and nanoseconds) and wake nobody; destroying it
// starts or joins no thread, sends no signal, leaves SIGALRM's action alone.
TEST(TimerSlots, WithoutAThreadSetExpiryOnlyStoresAndDestructionIsQuiet) {
    testsupport::ScopedAlarmHandler counting(&CountAlarm);
    gAlarms.store(0);
    const int threads = testsupport::CountThreads();
    auto* timer = new tKPusLinuxNanoSleepTimer();
    EXPECT_EQ(timer->GetTicksPerMicrosecond(), 1000u);
    const uint32_t word = PalWakeSnapshot(timer->state.wakeWord);
    const uint64_t when = 0x123456789ABCDEFull;
    timer->SetExpiry(ClockTime{static_cast<uint32_t>(when), static_cast<uint32_t>(when >> 32)});
    EXPECT_TRUE(timer->state.expiry.tv_sec == static_cast<int32_t>(static_cast<uint32_t>(when / 1000000000ull)) &&
                timer->state.expiry.tv_nsec == static_cast<int32_t>(when % 1000000000ull));
    timer->ExpireNow();
    EXPECT_TRUE(timer->state.expiry.tv_sec == 0 && timer->state.expiry.tv_nsec == 0);
    EXPECT_EQ(PalWakeSnapshot(timer->state.wakeWord), word) << "woke a thread that does not exist";
    delete timer;
    struct sigaction after {};
    sigaction(SIGALRM, nullptr, &after);
    EXPECT_TRUE(gAlarms.load() == 0 && after.sa_handler == &CountAlarm && testsupport::CountThreads() == threads);
}

}  // namespace
}  // namespace quelta
