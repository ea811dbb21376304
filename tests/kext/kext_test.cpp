// The library on the emulated kernel extension: sysfs read once per start-up,
// wakes through sched_wake_up (38: SIGALRM and one warning; a lost wake costs
// at most a tick), conversions under a wall clock skewed 7 s either way.
#include <dlfcn.h>

#include <algorithm>
#include <memory>
#include <thread>

#include "Kext.h"

namespace kext {
namespace {

using namespace testsupport;

constexpr uint64_t kLoose = 100 * kMs;  // lateness is benchmarked, not asserted tightly

// A callback `delay` from now (its deadline stored); the time it ran, or 0 when not within 2 s.
uint64_t CallbackAfter(LoadedLibrary& lib, uint64_t delay, uint64_t& deadline) {
    std::atomic<uint64_t> firedAt{0};
    lib.api().SetCallback(StampMonotonic, &firedAt);
    deadline = MonoNowNs() + delay;
    const ClockTime when = CT(deadline);
    lib.api().SetCallbackTime(&when, 0);
    const uint64_t end = AwaitNonZero(firedAt, 2 * kSec);
    lib.api().SetCallback(nullptr, nullptr);
    return end;
}

// In this order: a load after an unload is a new start-up, so a file that held
// no usable number (0 among them) is read again at the next one.
struct FileCase {
    const char *name, *wake, *convert;  // the files' contents; nullptr: no file
    bool used;
} const kFileCases[] = {
    {"missing", nullptr, nullptr, false},
    {"numbers", "917\n", "918\n", true},
    {"zero", "0\n", "0\n", false},
    {"numbers after zero", "917", "918", true},
    {"negative", "-917\n", "-918\n", false},
    {"empty", "", "", false},
    {"garbage", "zq917\n", "x918\n", false},
};

using KextStartup = KextTest;

TEST_F(KextStartup, EachFileIsReadOncePerStartUpAndOnlyANumberAboveZeroIsUsed) {
    Page().skewNs.store(7 * kSec);  // the call's conversions stand out from the stand-in's
    for (const FileCase& c : kFileCases) {
        SCOPED_TRACE(c.name);
        Sandbox::WriteFile(kWakeFile, c.wake);
        Sandbox::WriteFile(kConvertFile, c.convert);
        const Counts before = Page().Snapshot();
        int64_t shiftSeen = 0, epoch = 0;
        Counts d{};  // up to the unload, whose own wake call is left out
        {
            LoadedLibrary lib;
            ASSERT_TRUE(lib.ok()) << lib.error();
            uint64_t deadline;  // a callback between ticks, armed from this thread: a wake of the timer thread
            // (lost when it finds the thread awake, so a few tries)
            for (int k = 0; k < 5 && (k == 0 || Page().Since(before)[kWakesDelivered] == 0); ++k)
                EXPECT_NE(CallbackAfter(lib, 300 * kUs, deadline), 0u) << "the callback never ran";
            const uint64_t m = MonoNowNs();
            shiftSeen = static_cast<int64_t>(U64(lib.engine()->MonotonicToGlobal(CT(m))) - m);
            epoch = EpochOffsetNs(lib.engine());
            d = Page().Since(before);
        }
        void* still = dlopen(QUELTA_SO_PATH, RTLD_NOW | RTLD_NOLOAD);
        EXPECT_EQ(still, nullptr) << "the unload left the library mapped: no new start-up follows";
        if (still != nullptr) dlclose(still);
        EXPECT_EQ(d[kOpensWakeFile], 1);
        EXPECT_EQ(d[kOpensConvertFile], 1);
        const int64_t viaCall = Page().realOffsetNs.load() + 7 * kNs + epoch;
        if (c.used) {
            EXPECT_GT(d[kWakesDelivered], 0) << "the wake call was not used";
            EXPECT_EQ(shiftSeen, viaCall) << "slot 15 did not convert through the call";
        } else {
            EXPECT_EQ(d[kWakeCalls], 0);
            EXPECT_EQ(d[kTimerSleeps], 0) << "the timer thread left the stand-in's wake word";
            EXPECT_EQ(d[kConvertCalls], 0);
            EXPECT_NEAR(shiftSeen, viaCall - 7 * kNs, 1e6) << "not the stand-in's conversion";
        }
    }
}

// Every other cycle loses every wake, so the stop cannot count on its wake
// call arriving; a sleep between ticks is pending at each unload.
TEST_F(KextStartup, TwentyLoadUnloadCyclesEndPromptly) {
    uint64_t worst = 0;
    for (int i = 0; i < 20; ++i) {
        Page().loseEveryWake.store(i % 2);
        auto lib = std::make_unique<LoadedLibrary>();
        ASSERT_TRUE(lib->ok()) << lib->error();
        const ClockTime when = CT(MonoNowNs() + 500 * kUs);
        lib->api().SetCallbackTime(&when, 0);
        const uint64_t start = MonoNowNs();
        lib.reset();
        worst = std::max(worst, MonoNowNs() - start);
    }
    EXPECT_LT(worst, 500 * kMs);
}


// The call either works (no warning, no signal) or answers 38: then the
// warning, exactly once, and SIGALRM on every wake, which ends the timer
// thread's sleep with EINTR.
class KextWakeFallback : public KextTest, public ::testing::WithParamInterface<bool> {};

TEST_P(KextWakeFallback, WarningOnceAndSigalrmOnEachWakeOnlyWhenTheCallAnswers38) {
    const bool answers38 = GetParam();
    Page().wakeReturnsEnosys.store(answers38 ? 1 : 0);
    testing::internal::CaptureStdout();  // nothing may fail an assertion until it is taken
    const Counts before = Page().Snapshot();
    Counts d{};
    int served = 0;
    uint64_t worst = 0;
    {
        LoadedLibrary lib;
        for (uint64_t deadline, end; lib.ok() && served < 30; ++served) {
            if ((end = CallbackAfter(lib, 100 * kUs + (served * 23 % 200) * kUs, deadline)) == 0) break;
            worst = std::max(worst, end - deadline);
        }
        d = Page().Since(before);  // the unload's own wake call left out
    }
    const std::string text = testing::internal::GetCapturedStdout();
    EXPECT_EQ(served, 30) << "callbacks between ticks stopped being served";
    EXPECT_LT(worst, kLoose);
    if (answers38) {
        EXPECT_EQ(text,
                  "Warning: using sched_wake_up system call 917 failed!\n"
                  "This could lead to degraded nanosecond engine performance.\n");
        EXPECT_GE(d[kWakeCalls], 10);
        EXPECT_EQ(d[kAlarmsToTimer], d[kWakeCalls]) << "SIGALRM was not sent on each wake";
        EXPECT_GT(d[kSleepsInterrupted], 0) << "no signal ended a sleep";  // one that lands outside a sleep ends none
    } else {
        EXPECT_EQ(text, "");
        EXPECT_EQ(d[kAlarmsToTimer], 0) << "SIGALRM sent although the call works";
        EXPECT_GT(d[kWakesDelivered], 0);
        EXPECT_EQ(d[kWakesUnknownTid], 0) << "wakes sent to a thread that is no timer thread";
    }
}
INSTANTIATE_TEST_SUITE_P(Call, KextWakeFallback, ::testing::Bool(),
                         [](const testing::TestParamInfo<bool>& p) { return p.param ? "Answers38" : "Works"; });

// A wake that lands between the timer thread's take of its expiry and its
// sleep finds no sleep to end. The knobs make that window as wide as a kernel
// could. Each load arms the first tick from the loading thread: the first
// arming at start-up is swept along.
struct WindowCase {
    const char* name;
    int loseEveryWake, widenUs, echoWakes;  // echo: each wake comes again, late, and must end nothing
    Counter hit;                            // what shows that the sweep met the case
};
void PrintTo(const WindowCase& c, std::ostream* os) { *os << c.name; }
class KextWindow : public KextTest, public ::testing::WithParamInterface<WindowCase> {};

TEST_P(KextWindow, ADeadlineSetInTheWindowIsServedWithinATick) {
    const WindowCase& c = GetParam();
    Page().loseEveryWake.store(c.loseEveryWake);
    Page().widenWindowUs.store(c.widenUs);
    Page().echoWakes.store(c.echoWakes);
    Counts d{};
    std::vector<uint64_t> late;
    for (int load = 0; load < 3; ++load) {
        const Counts before = Page().Snapshot();
        LoadedLibrary lib;
        ASSERT_TRUE(lib.ok()) << lib.error();
        for (int i = 0; i < 100; ++i) {
            lib.api().WaitMicroSeconds(static_cast<uint32_t>(i * 37 % 1000));  // the phase against the tick
            uint64_t deadline;
            const uint64_t end = CallbackAfter(lib, 200 * kUs, deadline);
            ASSERT_NE(end, 0u) << "callback " << i << " after start-up never ran: the timer thread stays parked";
            EXPECT_GE(end, deadline);
            late.push_back(end - deadline);
        }
        const Counts part = Page().Since(before);  // the unload's wake left out
        for (int i = 0; i < kCounterCount; ++i) d[i] += part[i];
    }
    std::sort(late.begin(), late.end());
    const uint64_t median = late[late.size() / 2], worst = late.back();
    EXPECT_GT(d[c.hit], 0) << "the sweep never met the case";
    // A lost wake costs a tick: the worst with a loose margin for the machine's spikes, typically within two.
    EXPECT_LT(worst, 1 * kMs + 50 * kMs);
    EXPECT_LT(median, 2 * kMs);
}
INSTANTIATE_TEST_SUITE_P(Knobs, KextWindow,
                         ::testing::Values(WindowCase{"EveryWakeLost", 1, 0, 0, kWakesLost},
                                           WindowCase{"Widened", 0, 500, 0, kWakesLost},  // lost within 500 us of a sleep
                                           WindowCase{"LateWakes", 0, 0, 1, kWakesEchoed}),
                         [](const testing::TestParamInfo<WindowCase>& p) { return p.param.name; });


class KextGlobal : public KextTest, public ::testing::WithParamInterface<int64_t> {};

// The conversion slots follow the call exactly. A global wait, a global node
// waited for on its own semaphore, and a global callback time, each 20 ms ahead
// on the monotonic clock as the call converts it, end then without the caller
// spinning on the call (a handful of conversions). A wait still running 2 s
// after its deadline is ended by the unload.
TEST_P(KextGlobal, GlobalDeadlinesEndAtTheConvertedTimeWithoutSpinning) {
    Page().skewNs.store(GetParam());
    const char* const kinds[] = {"global wait", "global node", "global callback"};
    for (int k = 0; k < 3; ++k) {
        SCOPED_TRACE(kinds[k]);
        auto lib = std::make_unique<LoadedLibrary>();
        ASSERT_TRUE(lib->ok()) << lib->error();
        const QueltaApi api = lib->api();
        iKPusTimingEngine* e = lib->engine();
        const uint64_t due = MonoNowNs() + 20 * kMs;
        // Slots 15 and 17 follow the call exactly: global = monotonic + its REALTIME offset + the epoch offset.
        const uint64_t shift = static_cast<uint64_t>(Page().realOffsetNs.load() + GetParam() + EpochOffsetNs(e));
        for (uint64_t m : {due, uint64_t{999999999}, uint64_t{123456789012345}}) {
            EXPECT_EQ(U64(e->MonotonicToGlobal(CT(m))), m + shift) << m;
            EXPECT_EQ(U64(e->GlobalToMonotonic(CT(m + shift))), m) << m;
        }
        const ClockTime target = e->MonotonicToGlobal(CT(due));
        ClockTime unused;
        uint32_t generation = 0, abortFlag = 7;
        e->ReadGlobalWithGeneration(unused, generation);
        std::atomic<uint64_t> endedAt{0};
        const Counts before = Page().Snapshot();
        std::thread waiter;
        if (k == 0) {
            waiter = std::thread([&] {
                api.WaitUntilGlobalClocks64(&target, &abortFlag, nullptr, generation);
                endedAt.store(MonoNowNs());
            });
        } else if (k == 1) {
            waiter = std::thread([&] {
                api.EventWaitCallback(nullptr, &target, nullptr, nullptr, 1, nullptr);
                endedAt.store(MonoNowNs());
            });
        } else {
            api.SetCallback(StampMonotonic, &endedAt);
            api.SetCallbackTime(&target, -1);
        }
        const uint64_t end = AwaitNonZero(endedAt, 20 * kMs + 2 * kSec);
        const Counts d = Page().Since(before);
        lib.reset();
        if (waiter.joinable()) waiter.join();
        EXPECT_NE(end, 0u) << "still waiting 2 s after its deadline";
        EXPECT_GE(end, due) << "ended before its deadline";
        if (end >= due) {
            EXPECT_LT(end - due, kLoose);
        }
        EXPECT_LE(d[kConvertByCallers], 8) << "the caller spins on the conversion";
        EXPECT_TRUE(k != 0 || abortFlag == 0u) << "the global wait's abort flag was not cleared";
    }
}
INSTANTIATE_TEST_SUITE_P(Skew, KextGlobal, ::testing::Values(7 * kNs, -7 * kNs),
                         [](const testing::TestParamInfo<int64_t>& p) { return p.param > 0 ? "Ahead" : "Behind"; });

}  // namespace
}  // namespace kext
