// Microsecond waits and the clock-rate queries.
//
// The same plain sleeps as the clock waits, with times in microseconds of the
// monotonic clock. Units are converted by the engine's own conversion slots,
// so that a microsecond value here means exactly what it means to a runtime
// that converts through the engine itself.
#include <time.h>

#include "engine/ClockTimeOps.h"
#include "engine/ClockWaits.h"
#include "engine/HandOff.h"
#include "engine/LibraryFrame.h"
#include "engine/U64Arith.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"

namespace quelta {

namespace {

// Past tolerance of the absolute microsecond wait: 1 ms, whatever the clock
// rate (unlike the clock wait's, which scales with gCpuSpeed).
constexpr uint32_t kPastToleranceUs = 1000;

// Now in microseconds: one recorded monotonic read, converted by the engine.
// Without an engine (the library failed to start) the kernel clock is read
// directly and divided plainly, so that the waits still work.
ClockTime NowMicroseconds() {
    tKPusTimingEngine* engine = Published<StdAtomics>(gEngine);
    if (engine != nullptr) {
        ClockTime now{0, 0};
        engine->ReadMonotonic4(now);
        return engine->ClocksToMicroseconds64Fwd(now);
    }
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return FromU64(static_cast<uint64_t>(static_cast<int64_t>(ts.tv_sec)) * 1000000ull +
                   static_cast<uint64_t>(static_cast<int64_t>(ts.tv_nsec)) / 1000u);
}

ClockTime MicrosecondsToClocks(const ClockTime& us) {
    tKPusTimingEngine* engine = Published<StdAtomics>(gEngine);
    if (engine != nullptr) return engine->MicrosecondsToClocks64Fwd(us);
    ClockTime clocks = us;
    U64MulU32(clocks, 1000);
    return clocks;
}

}  // namespace

}  // namespace quelta

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_GetCPUSpeed_C(void) {
    const uint32_t speed = quelta::gCpuSpeed.load(std::memory_order_relaxed);
    return speed != 0 ? speed : 1u;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_GetCPUTicksPerMS_C(void) {
    // Falls back on its own: clocks per millisecond at the nominal rate, not
    // 1000 times the other query's fallback.
    const uint32_t speed = quelta::gCpuSpeed.load(std::memory_order_relaxed);
    return speed != 0 ? 1000u * speed : 1000000u;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitMicroSeconds_C(uint32_t duration) {
    if (duration != 0) {
        // Full 64-bit product: the longest wait (about 4295 s) does not wrap.
        quelta::SleepClocks(quelta::FromU64(static_cast<uint64_t>(duration) * 1000u));
    }
    return quelta::NowMicroseconds().low;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilMicroSeconds_C(uint32_t target) {
    if (target == 0) return quelta::NowMicroseconds().low;

    const ClockTime now = quelta::NowMicroseconds();
    ClockTime when;
    if (target > now.low) {
        when = ClockTime{target, now.high};
    } else {
        if (now.low - target < quelta::kPastToleranceUs) return now.low;
        when = ClockTime{target, now.high + 1};  // after the low word wraps
    }
    // A deadline already passed returns at once from the sleep itself.
    quelta::SleepUntilClocks(quelta::MicrosecondsToClocks(when));
    return quelta::NowMicroseconds().low;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C(uint32_t period) {
    if (period == 0) return quelta::NowMicroseconds().low;

    const ClockTime multiple = quelta::NextMultiple(quelta::NowMicroseconds(), period);
    quelta::SleepUntilClocks(quelta::MicrosecondsToClocks(multiple));
    return quelta::NowMicroseconds().low;
}
