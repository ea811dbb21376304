// Clock waits: plain sleeps of the calling thread on CLOCK_MONOTONIC.
//
// These never touch the tick service, the wait list or the timer thread; the
// only shared write is the engine's last-monotonic cell, which every read of
// the time updates. Nothing here allocates or locks.
#include "engine/ClockWaits.h"

#include <errno.h>
#include <time.h>

#include "engine/ClockTimeOps.h"
#include "engine/HandOff.h"
#include "engine/LibraryFrame.h"
#include "engine/SystemClock.h"
#include "engine/U64Arith.h"
#include "engine/tKPusTimingEngine.h"
#include "quelta/quelta.h"

namespace quelta {

namespace {

constexpr uint64_t kClocksPerSecond = 1000000000ull;

// The current monotonic time, through the engine so that it is recorded as
// the last monotonic reading. Without an engine (the library failed to start)
// the waits still work on the kernel clock directly instead of faulting.
ClockTime ReadNow() {
    ClockTime now{0, 0};
    tKPusTimingEngine* engine = Published<StdAtomics>(gEngine);
    if (engine != nullptr) {
        engine->ReadMonotonic4(now);
        return now;
    }
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return FromU64(static_cast<uint64_t>(static_cast<int64_t>(ts.tv_sec)) * kClocksPerSecond +
                   static_cast<uint64_t>(static_cast<int64_t>(ts.tv_nsec)));
}

// Splits a clock count into a kernel time point. The kernel's seconds field is
// 32 bits on the target, so only the low 32 bits of the seconds are kept, the
// same on every platform.
timespec SplitClocks(const ClockTime& t) {
    const uint64_t clocks = ToU64(t);
    const uint64_t seconds = clocks / kClocksPerSecond;
    timespec ts{};
    ts.tv_sec = static_cast<time_t>(static_cast<int32_t>(static_cast<uint32_t>(seconds)));
    ts.tv_nsec = static_cast<long>(clocks - seconds * kClocksPerSecond);
    return ts;
}

// (value + 1) mod 2^64 with the carry into the high word.
inline void Increment(ClockTime& value) {
    if (++value.low == 0) ++value.high;
}

}  // namespace

ClockTime NextMultiple(const ClockTime& now, uint32_t period) {
    ClockTime multiple;
    if (now.high == 0) {
        multiple = ClockTime{now.low / period, 0};  // one 32-bit division
    } else {
        multiple = now;
        ClockTime remainder{period, 0};
        U64DivMod(multiple, remainder);
    }
    Increment(multiple);
    U64MulU32(multiple, period);
    return multiple;
}

void SleepUntilClocks(ClockTime deadline) {
    const timespec request = SplitClocks(deadline);
    // A signal handler interrupting the sleep must not shorten it: the same
    // absolute deadline is simply slept on again.
    while (gSystemClock.sleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &request, nullptr) == EINTR) {
    }
}

void SleepClocks(ClockTime duration) {
    timespec request = SplitClocks(duration);
    timespec remaining{};
    // An interrupted relative sleep resumes with what was left, not anew.
    while (gSystemClock.sleep(CLOCK_MONOTONIC, 0, &request, &remaining) == EINTR) {
        request = remaining;
    }
}

ClockTime WaitUntilNextMultipleClocks64Impl(const ClockTime& period) {
    if (period.low == 0 && period.high == 0) return ReadNow();

    const ClockTime now = ReadNow();
    ClockTime multiple;  // the quotient, then the next multiple's index
    if (now.high == 0 && period.high == 0) {
        multiple = ClockTime{now.low / period.low, 0};
    } else {
        multiple = now;
        ClockTime remainder = period;
        U64DivMod(multiple, remainder);
    }
    Increment(multiple);

    // (m * period) mod 2^64 = m * period.low + ((period.high * m.low) << 32).
    ClockTime deadline = multiple;
    U64MulU32(deadline, period.low);
    deadline.high += period.high * multiple.low;

    SleepUntilClocks(deadline);
    return ReadNow();
}

}  // namespace quelta

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilClocks_C(uint32_t target) {
    const ClockTime now = quelta::ReadNow();
    ClockTime deadline;
    if (target > now.low) {
        // Later in the current 2^32-clock span.
        deadline = ClockTime{target, now.high};
    } else {
        // Just passed (within the tolerance of 1 ms at the usual rate): do not
        // sleep a whole span for a caller that is merely a little late.
        const uint32_t tolerance = 1000u * quelta::gCpuSpeed.load(std::memory_order_relaxed);
        if (now.low - target < tolerance) return now.low;
        // Otherwise the low word has to wrap before it comes up again.
        deadline = ClockTime{target, now.high + 1};
    }
    if (quelta::Earlier(now, deadline)) quelta::SleepUntilClocks(deadline);
    return quelta::ReadNow().low;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilClocks64_C(const ClockTime* target) {
    const ClockTime now = quelta::ReadNow();
    if (target != nullptr && quelta::Earlier(now, *target)) quelta::SleepUntilClocks(*target);
    return quelta::ReadNow().low;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitClocks_C(uint32_t duration) {
    if (duration != 0) quelta::SleepClocks(ClockTime{duration, 0});
    return quelta::ReadNow().low;
}

extern "C" QUELTA_EXPORT uint32_t quelta_iTSC_WaitUntilNextMultipleClocks_C(uint32_t period) {
    if (period == 0) return quelta::ReadNow().low;
    // Always strictly later than now: no comparison needed before sleeping.
    quelta::SleepUntilClocks(quelta::NextMultiple(quelta::ReadNow(), period));
    return quelta::ReadNow().low;
}
