// Start-up and unload with the kernel extension's sysfs files: each file is
// read once per start-up, only a number above 0 is used, and an unload with
// the wake call configured ends promptly.
#include <dlfcn.h>

#include <algorithm>
#include <memory>

#include "KextSandbox.h"
#include "KextTestSupport.h"

namespace kext {
namespace {

using testsupport::CT;
using testsupport::LoadedLibrary;
using testsupport::MonoNowNs;
using testsupport::U64;

struct FileCase {
    const char* name;
    const char* wake;  // the files' contents; nullptr: no file
    const char* convert;
    bool used;
};

// In this order: a load after an unload is a new start-up, so a file that
// held no usable number (0 among them) is read again at the next one.
constexpr FileCase kFileCases[] = {
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
            // A callback between ticks, armed from this thread: a wake of the timer thread.
            std::atomic<uint64_t> firedAt{0};
            lib.api().SetCallback(StampMonotonic, &firedAt);
            const ClockTime when = CT(MonoNowNs() + 300 * kUs);
            lib.api().SetCallbackTime(&when, 0);
            EXPECT_NE(testsupport::AwaitNonZero(firedAt, 2 * kSec), 0u) << "the callback never ran";
            lib.api().SetCallback(nullptr, nullptr);
            const uint64_t m = MonoNowNs();
            shiftSeen = static_cast<int64_t>(U64(lib.engine()->MonotonicToGlobal(CT(m))) - m);
            epoch = EpochOffsetNs(lib.engine());
            d = Since(before, Page().Snapshot());
        }
        void* still = dlopen(QUELTA_SO_PATH, RTLD_NOW | RTLD_NOLOAD);
        EXPECT_EQ(still, nullptr) << "the unload left the library mapped: no new start-up follows";
        if (still != nullptr) dlclose(still);
        EXPECT_EQ(d[kOpensWakeFile], 1);
        EXPECT_EQ(d[kOpensConvertFile], 1);
        const int64_t viaCall = Page().realOffsetNs.load() + 7 * static_cast<int64_t>(kSec) + epoch;
        if (c.used) {
            EXPECT_GT(d[kWakesDelivered], 0) << "the wake call was not used";
            EXPECT_EQ(shiftSeen, viaCall) << "slot 15 did not convert through the call";
        } else {
            EXPECT_EQ(d[kWakeCalls], 0);
            EXPECT_EQ(d[kTimerSleeps], 0) << "the timer thread left the stand-in's wake word";
            EXPECT_EQ(d[kConvertMonoToReal] + d[kConvertRealToMono] + d[kConvertOther] + d[kConvertRefused], 0);
            EXPECT_NEAR(shiftSeen, viaCall - 7 * static_cast<int64_t>(kSec), 1e6) << "not the stand-in's conversion";
        }
    }
}

// Every other cycle loses every wake, so the stop cannot count on its wake
// call arriving; a sleep between ticks is pending at each unload.
TEST_F(KextStartup, TwentyLoadUnloadCyclesEndPromptly) {
    Watchdog dog("20 load/unload cycles with the files present", 30 * kSec);
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
    std::printf("slowest of 20 unloads: %.2f ms\n", worst / 1e6);
    EXPECT_LT(worst, 500 * kMs);
}

}  // namespace
}  // namespace kext
