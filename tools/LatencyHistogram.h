// A latency series kept as a histogram rather than as its samples, so that a
// survey of a day costs the same memory as one of ten seconds and adding a
// sample never allocates (the survey thread adds samples between waits).
//
// Below 10 ms the buckets are 0.1 us wide, so percentiles there are exact to
// the table's one decimal; from 10 ms up they are logarithmic, 200 per
// decade (within 1.2 %). Count, sum, minimum and maximum are exact. A value
// below zero is a wait that returned early: counted (and in the minimum),
// never placed in a bucket.
//
// One thread owns a histogram at a time; it has no locking of its own.
#ifndef QUELTA_TOOLS_LATENCYHISTOGRAM_H
#define QUELTA_TOOLS_LATENCYHISTOGRAM_H

#include <cstddef>
#include <cstdint>
#include <vector>

namespace qtools {

class LatencyHistogram {
public:
    static constexpr int kFinePerUs = 10;        // 0.1 us buckets ...
    static constexpr int kFineBuckets = 100000;  // ... up to 10 ms
    static constexpr int kCoarsePerDecade = 200;
    static constexpr int kCoarseDecades = 7;     // 10 ms to 100,000 s

    LatencyHistogram();

    void Add(double us);
    void Merge(const LatencyHistogram& other);

    uint64_t count() const { return count_; }
    uint64_t early() const { return early_; }
    double min() const;  // NaN when empty
    double max() const;  // NaN when empty
    double mean() const; // NaN when empty

    // Nearest-rank percentile, fraction in [0, 1]: the value at rank
    // ceil(fraction * count). Rank 1 is the exact minimum and the top rank
    // the exact maximum; ranks among the early values give the minimum.
    double Percentile(double fraction) const;

    // Samples strictly greater than `us` (for tail plots); exact at bucket
    // edges, which is where the plot asks.
    uint64_t CountAbove(double us) const;

    // Samples whose value rounded to 0.1 us lies in [fromUs, toUs), with
    // both edges whole multiples of 0.1 us below 10 ms: one row of a
    // per-microsecond histogram. Callers pass whole microseconds.
    uint64_t CountInFine(int fromTenths, int toTenths) const;

private:
    std::vector<uint64_t> fine_;
    std::vector<uint64_t> coarse_;
    uint64_t count_ = 0;
    uint64_t early_ = 0;
    double sum_ = 0.0;
    double min_ = 0.0;
    double max_ = 0.0;
};

// The 0.1 us bucket a non-negative value falls in (rounded to nearest).
int64_t TenthsOfUs(double us);

}  // namespace qtools

#endif
