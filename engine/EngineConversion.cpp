// Conversion between the monotonic and the global time base, the raw clock's
// resolution, and the unit slots (clocks <-> microseconds).
#include <errno.h>
#include <time.h>

#include <limits>

#include "engine/U64Arith.h"
#include "engine/tKPusTimingEngine.h"

namespace quelta {

std::atomic<int32_t> gConvertSyscallNr{0};
std::atomic<bool> gConvertStandInEnabled{true};

namespace {

constexpr uint64_t kNsPerSecond = 1000000000ull;
constexpr int64_t kNsPerSecondSigned = 1000000000;

// Brackets taken per user-space conversion at most. A bracket this tight or
// tighter is taken at once: the offset it gives is off by at most half of it,
// and a further try would only cost time on the conversion path.
constexpr int kStandInTries = 3;
constexpr uint64_t kTightBracketNs = 200;

bool IsKnownClock(int32_t id) {
    return id == CLOCK_REALTIME || id == CLOCK_MONOTONIC || id == CLOCK_MONOTONIC_RAW;
}

// Writes a nanosecond count back as a kernel would: a time before the clock's
// zero (top bit set, read as signed) gets negative seconds and nanoseconds in
// [0, 1e9); otherwise this is the library's ordinary split. Either way
// JoinNanoseconds gives the count back.
timespec SplitSigned(uint64_t ns) {
    const int64_t v = static_cast<int64_t>(ns);
    if (v >= 0) return SplitNanoseconds(ns);
    int64_t q = v / kNsPerSecondSigned;
    int64_t r = v % kNsPerSecondSigned;
    if (r < 0) {
        r += kNsPerSecondSigned;
        q -= 1;
    }
    timespec t{};
    t.tv_sec = static_cast<time_t>(q);
    t.tv_nsec = static_cast<long>(r);
    return t;
}

inline bool ReadNs(int32_t clock, uint64_t& ns) {
    timespec ts{};
    if (gSystemClock.getTime(static_cast<clockid_t>(clock), &ts) != 0) return false;
    ns = JoinNanoseconds(ts);
    return true;
}

// The user-space stand-in for the kernel's conversion call, for kernels that
// lack it. The offset between the two clocks is measured afresh on every
// call, so every step and slew of the wall clock up to the moment of the call
// is followed, as with the kernel call. One try reads the target clock, the
// source clock and the target clock again; the source reading is taken to lie
// midway between the two target readings. The try with the tightest bracket
// wins; a preempted try shows as a wide bracket and loses.
int32_t StandInConvert(int32_t fromClock, int32_t toClock, timespec* time) {
    if (fromClock == toClock) return 0;
    bool found = false;
    uint64_t bestSpan = 0;
    uint64_t bestOffset = 0;
    for (int i = 0; i < kStandInTries; ++i) {
        uint64_t before, source, after;
        if (!ReadNs(toClock, before) || !ReadNs(fromClock, source) || !ReadNs(toClock, after)) continue;
        // A target clock stepped back inside the bracket wraps the span to a
        // huge value: such a try only wins when nothing better exists.
        const uint64_t span = after - before;
        if (!found || span < bestSpan) {
            found = true;
            bestSpan = span;
            bestOffset = before + span / 2 - source;
        }
        if (span <= kTightBracketNs) break;
    }
    if (!found) return EINVAL;  // no clock could be read: the time point stays as it was
    const uint64_t point = JoinNanoseconds(*time);
    *time = SplitSigned(point + bestOffset);
    return 0;
}

// The kernel's conversion call takes the kernel's own time point, whose
// seconds are as wide as its long. A time point whose seconds do not fit (a
// wall-clock time past 2038-01-19 on a 32-bit target), or a result the call
// reports it cannot represent (EOVERFLOW), is left to the user-space
// conversion: returns false then, with the time point untouched. Any other
// result of the call is passed back, the time point as the call left it.
bool KernelConvert(int32_t nr, int32_t fromClock, int32_t toClock, timespec* time, int32_t& result) {
    constexpr long kLongMax = std::numeric_limits<long>::max();
    constexpr long kLongMin = std::numeric_limits<long>::min();
    if (time->tv_sec > kLongMax || time->tv_sec < kLongMin) return false;
    KernelTimespec k{static_cast<long>(time->tv_sec), time->tv_nsec};
    const long r = gSystemClock.convertTime(nr, fromClock, toClock, &k);
    if (r == -1 && errno == EOVERFLOW) return false;
    time->tv_sec = static_cast<time_t>(k.tv_sec);
    time->tv_nsec = k.tv_nsec;
    result = static_cast<int32_t>(r);
    return true;
}

}  // namespace

int32_t ConvertClockTime(int32_t fromClock, int32_t toClock, struct timespec* time) {
    const int32_t nr = gConvertSyscallNr.load(std::memory_order_relaxed);
    if (nr >= 1) {
        int32_t result = 0;
        if (KernelConvert(nr, fromClock, toClock, time, result)) return result;
        if (!gConvertStandInEnabled.load(std::memory_order_relaxed)) return EOVERFLOW;
    } else if (!gConvertStandInEnabled.load(std::memory_order_relaxed)) {
        return ENOSYS;
    }
    if (!IsKnownClock(fromClock) || !IsKnownClock(toClock)) return EINVAL;
    return StandInConvert(fromClock, toClock, time);
}

}  // namespace quelta

using namespace quelta;

// clock_getres failing leaves the zeroed timespec: the resolution reads as 0,
// which no working clock reports, so a caller can tell it is unknown.
ClockTime tKPusTimingEngine::GetRawClockResolution() {
    timespec ts{};
    gSystemClock.getRes(CLOCK_MONOTONIC_RAW, &ts);
    return FromU64(JoinNanoseconds(ts));
}

// Both directions keep the wall-clock seconds in 64 bits: the conversion
// goes on past 2038-01-19 on every target, and gives the results of the
// kernel's 32-bit fields wherever the seconds fit in 31 bits.
ClockTime tKPusTimingEngine::GlobalToMonotonicImpl(const ClockTime& g) {
    const int64_t offset = epochOffset.load(std::memory_order_relaxed);
    const uint64_t t = ToU64(g) - static_cast<uint64_t>(offset) * kNsPerSecond;
    timespec ts = SplitNanoseconds(t);
    ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts);  // a failure leaves ts as it was
    return FromU64(JoinNanoseconds(ts));
}

ClockTime tKPusTimingEngine::MonotonicToGlobalImpl(const ClockTime& m) {
    timespec ts = SplitNanoseconds(ToU64(m));
    ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts);  // a failure leaves ts as it was
    const int64_t offset = epochOffset.load(std::memory_order_relaxed);
    // The offset joins the seconds before the product, both sign-extended.
    const uint64_t seconds = static_cast<uint64_t>(static_cast<int64_t>(ts.tv_sec)) + static_cast<uint64_t>(offset);
    return FromU64(seconds * kNsPerSecond + static_cast<uint64_t>(static_cast<int64_t>(ts.tv_nsec)));
}

// --- units ---------------------------------------------------------------------

ClockTime tKPusTimingEngine::MicrosecondsToClocks64(const ClockTime& us) {
    ClockTime value = us;
    U64MulU32(value, 1000);
    return value;
}

uint32_t tKPusTimingEngine::MicrosecondsToClocks32(const uint32_t& us) { return us * 1000u; }

// x / 1000 by a reciprocal multiplication, no division: 4294967 and
// 1271310319 are the high and low words of floor(2^64 / 1000). The product of
// the two low words is left out and the two middle products are rounded at
// bit 31 before their upper part joins the high product. The result is this
// formula, not a rounding rule (it is not floor(x / 1000) everywhere).
ClockTime tKPusTimingEngine::ClocksToMicroseconds64(const ClockTime& ns) {
    constexpr uint32_t kRecipHigh = 4294967u;
    constexpr uint32_t kRecipLow = 1271310319u;
    const uint64_t p1 = static_cast<uint64_t>(ns.low) * kRecipHigh;
    const uint64_t p2 = static_cast<uint64_t>(ns.high) * kRecipLow;
    const uint64_t p3 = static_cast<uint64_t>(ns.high) * kRecipHigh;
    const uint64_t lowSum = (p1 & 0xFFFFFFFFu) + (p2 & 0xFFFFFFFFu);  // at most 33 bits
    const uint64_t carry = lowSum >> 32;
    const uint64_t roundBit = (lowSum >> 31) & 1u;
    return FromU64(p3 + (p2 >> 32) + (p1 >> 32) + carry + roundBit);
}

// floor(x / 1000) exactly for every 32-bit x: 0x10624DD3 is ceil(2^38 / 1000).
uint32_t tKPusTimingEngine::ClocksToMicroseconds32(const uint32_t& ns) {
    return static_cast<uint32_t>((static_cast<uint64_t>(ns) * 0x10624DD3u) >> 38);
}
