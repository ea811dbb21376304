// The global clock through the kernel's clock_converttime call, whose view
// of CLOCK_REALTIME the emulation moves 7 s ahead of the real one, or behind:
// the conversion slots follow the call exactly, and every global deadline
// ends at its converted time without spinning on the call.
#include <memory>
#include <thread>

#include "KextSandbox.h"
#include "KextTestSupport.h"

namespace kext {
namespace {

using testsupport::AwaitNonZero;
using testsupport::CT;
using testsupport::LoadedLibrary;
using testsupport::MonoNowNs;
using testsupport::U64;

constexpr uint64_t kLoose = 100 * kMs;
constexpr int64_t kHandful = 8;  // conversions a caller may make for one wait

class KextGlobal : public KextTest, public ::testing::WithParamInterface<int64_t> {
protected:
    void SetUp() override {
        KextTest::SetUp();
        if (!IsSkipped()) Page().skewNs.store(GetParam());
    }
};

TEST_P(KextGlobal, ConversionSlotsFollowTheCallExactly) {
    LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    iKPusTimingEngine* e = lib.engine();
    // global = monotonic + the emulated REALTIME offset + the epoch offset
    const uint64_t shift = static_cast<uint64_t>(Page().realOffsetNs.load() + GetParam() + EpochOffsetNs(e));
    const Counts before = Page().Snapshot();
    const uint64_t now = MonoNowNs();
    for (uint64_t m : {now, now + 20 * kMs + 1, uint64_t{999999999}, uint64_t{123456789012345}}) {
        SCOPED_TRACE(m);
        const ClockTime g = e->MonotonicToGlobal(CT(m));  // slot 15
        EXPECT_EQ(U64(g), m + shift);
        EXPECT_EQ(U64(e->GlobalToMonotonic(g)), m);  // slot 17
    }
    const Counts d = Since(before, Page().Snapshot());
    EXPECT_GE(d[kConvertMonoToReal], 4);
    EXPECT_GE(d[kConvertRealToMono], 4);
}

// A global wait, a global node waited for on its own semaphore, and a global
// callback time, each 20 ms ahead on the monotonic clock as the call converts
// it. A wait still running 2 s after its deadline is ended by the unload.
TEST_P(KextGlobal, GlobalDeadlinesEndAtTheConvertedTimeWithoutSpinning) {
    const char* const kinds[] = {"global wait", "global node", "global callback"};
    for (int k = 0; k < 3; ++k) {
        SCOPED_TRACE(kinds[k]);
        auto lib = std::make_unique<LoadedLibrary>();
        ASSERT_TRUE(lib->ok()) << lib->error();
        const testsupport::QueltaApi api = lib->api();
        iKPusTimingEngine* e = lib->engine();
        const uint64_t due = MonoNowNs() + 20 * kMs;
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
        const Counts d = Since(before, Page().Snapshot());
        lib.reset();
        if (waiter.joinable()) waiter.join();
        if (end == 0) {
            ADD_FAILURE() << "still waiting 2 s after its deadline, having made " << d[kConvertByCallers]
                          << " conversions";
            continue;
        }
        std::printf("%s, skew %+lld s: ended %.0f us after its deadline, %lld conversions by the caller\n", kinds[k],
                    static_cast<long long>(GetParam() / static_cast<int64_t>(kSec)),
                    (static_cast<double>(end) - static_cast<double>(due)) / 1e3,
                    static_cast<long long>(d[kConvertByCallers]));
        if (end < due) {
            ADD_FAILURE() << "ended " << (due - end) / kUs << " us before its deadline";
        } else {
            EXPECT_LT(end - due, kLoose);
        }
        EXPECT_LE(d[kConvertByCallers], kHandful) << "the caller spins on the conversion";
        if (k == 0) {
            EXPECT_EQ(abortFlag, 0u);
        }
    }
}

INSTANTIATE_TEST_SUITE_P(Skew, KextGlobal, ::testing::Values(7 * static_cast<int64_t>(kSec), -7 * static_cast<int64_t>(kSec)),
                         [](const ::testing::TestParamInfo<int64_t>& p) { return p.param > 0 ? "Ahead" : "Behind"; });

}  // namespace
}  // namespace kext
