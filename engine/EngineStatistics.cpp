// Timing statistics of the engine: the histogram mode, the copy-out of the
// statistics record (slot 31), and Calibrate, which fills the record from
// clock-read pairs and from the tick service's lateness samples.
#include <time.h>

#include <cstring>

#include "engine/EngineDetail.h"
#include "engine/EngineRate.h"
#include "engine/HandOff.h"
#include "engine/tKPusTimingEngine.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace quelta {

namespace {

constexpr uint32_t kHistogramBuckets = 10000;
constexpr uint32_t kHeaderWords = 4;
constexpr uint32_t kBlockWords = kHeaderWords + 3 * kStatsSamples;  // 3004 words, 12016 bytes

// Word i of the record in its documented order.
const std::atomic<uint32_t>& BlockWord(const StatisticsBlock& b, uint32_t i) {
    switch (i) {
        case 0: return b.statsReserved;
        case 1: return b.jitterMode;
        case 2: return b.rawReadCost;
        case 3: return b.globalReadExtra;
        default: break;
    }
    i -= kHeaderWords;
    if (i < kStatsSamples) return b.jitterSamples[i];
    i -= kStatsSamples;
    if (i < kStatsSamples) return b.rawReadSamples[i];
    return b.globalReadSamples[i - kStatsSamples];
}

// The give-up clock of CalibrateWithin reads the kernel directly, not through
// the replaceable clock calls: a test's fake clock must not stall it.
uint64_t MonotonicMs() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * 1000u + static_cast<uint64_t>(ts.tv_nsec) / 1000000u;
}

}  // namespace

uint32_t HistogramModeOf(const uint32_t* samples, uint32_t count, uint32_t bucketWidth, uint32_t bucketLimit) {
    // 40,000 bytes per call: this routine is for calibration, not for the
    // tick path.
    uint32_t* counters = static_cast<uint32_t*>(PalMemAllocZeroed(kHistogramBuckets * sizeof(uint32_t)));
    if (counters == nullptr) return 0;
    if (count == 0) {
        PalMemFree(counters);
        return 0;
    }
    const uint32_t limit = bucketLimit < kHistogramBuckets ? bucketLimit : kHistogramBuckets;
    uint32_t mode = 0;
    for (uint32_t i = 0; i < count; ++i) {
        // A width of 0 sends every nonzero sample past the last bucket and a
        // zero sample (0/0) to bucket 0, so the result is 0 either way.
        const uint32_t b = SaturateToU32(static_cast<double>(samples[i]) / static_cast<double>(bucketWidth) + 0.5);
        if (b < limit) {
            // Strictly greater: a tie stays with the bucket that got there
            // first, and the mode's own bucket never beats itself.
            const uint32_t n = ++counters[b];
            if (n > counters[mode]) mode = b;
        }
    }
    PalMemFree(counters);
    // A mode in the first or the last bucket is never reported.
    if (mode == 0 || mode >= limit - 1) return 0;
    return SaturateToU32(static_cast<double>(mode) * static_cast<double>(bucketWidth) + 0.5);
}

uint32_t JitterHistogramMode(const uint32_t* samples) { return HistogramModeOf(samples, kStatsSamples, 10, 10000); }

}  // namespace quelta

using namespace quelta;

uint32_t tKPusTimingEngine::HistogramMode(const uint32_t* samples, uint32_t count, uint32_t bucketWidth,
                                          uint32_t bucketLimit) {
    return HistogramModeOf(samples, count, bucketWidth, bucketLimit);
}

// Word by word with relaxed loads: the tick service may be writing jitter
// samples meanwhile, and a copy taken during Calibrate may mix old and new
// samples (never a torn word). The destination need not be aligned.
void tKPusTimingEngine::CopyStatistics(void* destination, uint32_t full) {
    unsigned char* out = static_cast<unsigned char*>(destination);
    const uint32_t words = full != 0 ? kBlockWords : kHeaderWords;
    for (uint32_t i = 0; i < words; ++i) {
        const uint32_t w = BlockWord(stats, i).load(std::memory_order_relaxed);
        std::memcpy(out + i * sizeof(uint32_t), &w, sizeof w);
    }
}

uint32_t tKPusTimingEngine::Calibrate() { return CalibrateWithin(0); }

// timeoutMs 0: wait as long as it takes (Calibrate). Otherwise give up, switch
// recording off and return 0 once statsCount has not moved for timeoutMs.
uint32_t tKPusTimingEngine::CalibrateWithin(uint32_t timeoutMs) {
    // 1. Cost of clock reads, from back-to-back pairs with nothing between.
    for (uint32_t i = 0; i < kStatsSamples; ++i) {
        ClockTime a, b;
        this->ReadGlobal3(a);
        this->ReadGlobal3(b);
        stats.globalReadSamples[i].store(b.low - a.low, std::memory_order_relaxed);
        this->ReadRaw9(a);
        this->ReadRaw9(b);
        const uint32_t d = b.low - a.low;
        stats.rawReadSamples[i].store(SaturateToU32((static_cast<double>(d) * 1000.0) / CurrentClockRate() + 0.5),
                                      std::memory_order_relaxed);
    }

    // 2.-4. Let the tick service record 1000 lateness samples. The count is
    // reset before recording is switched on, so the tick service never sees
    // recording on with a stale count.
    statsCount.store(0, std::memory_order_relaxed);
    statsEnabled.store(1, std::memory_order_relaxed);
    int32_t lastCount = 0;
    uint64_t lastAdvanceMs = MonotonicMs();
    for (;;) {
        // The samples counted are visible once the count is (HandOff.h).
        const int32_t n = SamplesCounted<StdAtomics>(statsCount);
        if (n >= static_cast<int32_t>(kStatsSamples)) break;
        if (timeoutMs != 0) {
            const uint64_t nowMs = MonotonicMs();
            if (n != lastCount) {
                lastCount = n;
                lastAdvanceMs = nowMs;
            } else if (nowMs - lastAdvanceMs >= timeoutMs) {
                statsEnabled.store(0, std::memory_order_relaxed);
                return 0;
            }
        }
        PalSleepMilliseconds(1);
    }
    statsEnabled.store(0, std::memory_order_relaxed);

    // 5.-6. Means, summed in double in index order.
    double rawSum = 0.0;
    double globalSum = 0.0;
    for (uint32_t i = 0; i < kStatsSamples; ++i) rawSum += stats.rawReadSamples[i].load(std::memory_order_relaxed);
    for (uint32_t i = 0; i < kStatsSamples; ++i) globalSum += stats.globalReadSamples[i].load(std::memory_order_relaxed);
    const uint32_t rawCost = SaturateToU32(rawSum / 1000.0 + 0.5);
    stats.rawReadCost.store(rawCost, std::memory_order_relaxed);
    stats.globalReadExtra.store(SaturateToU32(globalSum / 1000.0 + 0.5) - rawCost, std::memory_order_relaxed);

    // 7. The most frequent lateness, from a private copy of the samples.
    uint32_t jitter[kStatsSamples];
    for (uint32_t i = 0; i < kStatsSamples; ++i) jitter[i] = stats.jitterSamples[i].load(std::memory_order_relaxed);
    const uint32_t mode = JitterHistogramMode(jitter);
    stats.jitterMode.store(mode, std::memory_order_relaxed);
    return mode;
}
