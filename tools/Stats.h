// Summary statistics of a latency series and the verdict that compares a
// series with the machine's own limit (the baseline series).
#ifndef QUELTA_TOOLS_STATS_H
#define QUELTA_TOOLS_STATS_H

#include <cstddef>
#include <string>
#include <vector>

#include "LatencyHistogram.h"

namespace qtools {

// Percentiles use the nearest-rank rule: the p-th percentile of n sorted
// values is the value at rank ceil(p/100 * n) (1-based), read from the
// series' histogram (exact to 0.1 us below 10 ms). Fields are NaN for an
// empty series.
struct Summary {
    std::size_t count = 0;
    std::size_t early = 0;  // values below zero (a wait that returned early)
    double min;
    double mean;
    double p50;
    double p90;
    double p99;
    double p999;
    double max;
    Summary();
};

Summary Summarize(const LatencyHistogram& histogram);
// The same for a handful of values (through a histogram).
Summary Summarize(const std::vector<double>& values);

// p99 of a series over p99 of the baseline; NaN when either is missing or
// the baseline's p99 is not above zero.
double RatioP99(const Summary& series, const Summary& baseline);

// Differences of p99 below this many microseconds count as equal: on a
// machine with a tiny baseline, ratios alone would call noise a difference.
constexpr double kVerdictSlackUs = 5.0;

// One line that tells a person how the series compares with the machine:
//   "as good as the machine"              p99 within 1.1x (or within the slack)
//   "within 1.5x of the machine"          p99 within 1.5x
//   "within 2x of the machine"            p99 within 2x
//   "worse than the machine: ..."         beyond, with the factor and the excess
// An early return overrides all of these with a failure. Appended: a p50
// more than 1.5x (and the slack) above the baseline's ("typical wake-up
// +N us"), and failed calls. The baseline itself is "the machine's own limit".
std::string VerdictFor(const Summary& series, const Summary& baseline, bool isBaseline,
                       std::size_t failedCalls = 0);

// The machine's part in a series' tail, appended to its verdict. `stall`
// holds the machine's longest stall per measuring window around the series.
// The machine explains the tail when the series' p99 is within the
// baseline's typical wake-up (p50) plus the stall that 1 % of those windows
// reached (the stall p99), give or take the slack: "; machine stalls explain
// the tail (stall p99 X us around it)"; otherwise "; tail Y us beyond machine
// stalls (...)". Said of the baseline and of every series not as good as the
// machine; empty (and `explained` -1) when there is nothing to say. A window
// is shorter than a wait, so the stall p99 errs low: "explained" is never
// claimed on thin evidence.
std::string StallClause(const Summary& series, const Summary& baseline, const Summary& stall, bool isBaseline,
                        int& explained);

}  // namespace qtools

#endif
