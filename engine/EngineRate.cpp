// The kernel clock's rate (adjtimex tick and freq) and steps of the wall
// clock: engine slots 12, 13, 14 and 56.
//
// The rate word W = 1000 * 2^32 * (tick + freq / 2^16) carries the rate in
// fixed point; setting the rate splits W into tick and freq, reading it
// rebuilds W. The double arithmetic is done in exactly the documented order:
// its rounding decides the last bit of freq.
#include <stdio.h>
#include <sys/timex.h>
#include <time.h>

#include "engine/EngineDetail.h"
#include "engine/EngineRate.h"
#include "engine/tKPusTimingEngine.h"

namespace quelta {

std::atomic<double> gKernelTickRate{-1.0};

namespace {

constexpr double kRateScale = 4.294967296e12;  // 1000 * 2^32
constexpr int64_t kTwoTo32 = 4294967296ll;
constexpr unsigned int kModesTickAndFrequency = ADJ_TICK | ADJ_FREQUENCY;  // 0x4002

}  // namespace

double KernelTickRate() {
    const double cached = gKernelTickRate.load(std::memory_order_relaxed);
    if (!(cached < 0.0)) return cached;
    // Two threads arriving here together both compute (and announce) the same
    // value; nothing worse happens.
    const long ticksPerSecond = gSystemClock.clockTicksPerSecond();
    printf("ticks_per_sec= %ld\n", ticksPerSecond);
    const double rate = static_cast<double>(ticksPerSecond) / 1000000.0;
    gKernelTickRate.store(rate, std::memory_order_relaxed);
    return rate;
}

double KernelTickPeriod() { return 1.0 / KernelTickRate(); }

double CurrentClockRate() {
    struct timex tx {};
    gSystemClock.adjustTime(&tx);  // modes 0: read only; the result is not needed
    // tick and freq are 32-bit words on the target; a 64-bit build keeps
    // their low 32 bits so both compute the same W.
    const uint32_t tickTimes1000 = static_cast<uint32_t>(tx.tick) * 1000u;
    const int64_t freqTimes1000 = static_cast<int64_t>(static_cast<int32_t>(static_cast<uint32_t>(tx.freq))) * 1000;
    const uint64_t w = (static_cast<uint64_t>(tickTimes1000) << 32) + static_cast<uint64_t>(freqTimes1000) * 65536u;
    const double p1 = KernelTickPeriod();
    const double p2 = KernelTickPeriod();
    return static_cast<double>(static_cast<int64_t>(w)) / ((p1 * kRateScale) * p2);
}

}  // namespace quelta

using namespace quelta;

double tKPusTimingEngine::GetClockRate() { return CurrentClockRate() * 1000000.0; }

void tKPusTimingEngine::SetClockRate(double ticksPerSecond) {
    this->SetClockRateMHz(ticksPerSecond / 1000000.0);
}

void tKPusTimingEngine::SetClockRateMHz(double ticksPerMicrosecond) {
    const double t1 = KernelTickRate();
    const double t2 = KernelTickRate();
    // W / (1000 * 2^32) = r / T^2: the requested rate relative to the nominal
    // one, times the nominal microseconds per tick.
    const int64_t w = SaturateToI64(kRateScale / (t1 * (t2 / ticksPerMicrosecond)));
    // tick: the high word of W, signed, over 1000 (truncated toward zero).
    const int32_t high = static_cast<int32_t>(static_cast<uint32_t>(static_cast<uint64_t>(w) >> 32));
    const int32_t tick = high / 1000;
    // |tick * 1000| <= |high|, so neither the product nor the difference overflows.
    const int64_t y = w - static_cast<int64_t>(tick * 1000) * kTwoTo32;
    const int64_t quotient = y / 1000;
    // Bits 16 to 47 of the quotient.
    const int32_t freq = static_cast<int32_t>(static_cast<uint32_t>(static_cast<uint64_t>(quotient) >> 16));

    struct timex tx {};
    tx.modes = kModesTickAndFrequency;
    tx.tick = tick;
    tx.freq = freq;
    if (gSystemClock.adjustTime(&tx) == -1) {
        printf("unable to update frequency [adjtimex(tick= %ld, freq= %ld) failed]\n", static_cast<long>(tick),
               static_cast<long>(freq));
    }
}

// Steps CLOCK_REALTIME by a signed delta (a delta with the top bit set steps
// back), in 64-bit seconds on every target. The epoch offset plays no part:
// the global clock follows because it is derived from CLOCK_REALTIME. If the clock cannot even be read, nothing
// is set and -1 is returned (errno from clock_gettime): setting the clock to
// "zero plus delta" instead would throw the machine's clock back to 1970.
int32_t tKPusTimingEngine::StepGlobalClock(const ClockTime& delta) {
    timespec now{};
    if (gSystemClock.getTime(CLOCK_REALTIME, &now) != 0) return -1;
    const uint64_t t = JoinNanoseconds(now) + ToU64(delta);
    const timespec target = SplitNanoseconds(t);
    return static_cast<int32_t>(gSystemClock.setTime(CLOCK_REALTIME, &target));
}
