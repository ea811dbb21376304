// The latency histogram as a text file in the layout that real-time Linux
// latency tools write and that their plotting scripts read: one row per
// microsecond bucket ("000042" then one zero-padded count per series,
// tab-separated), and '#' lines for what is not a row: a header naming the
// columns, then the summary ("# Total:", "# Min Latencies:", "# Avg
// Latencies:", "# Max Latencies:", "# Histogram Overflows:") with one value
// per series in column order.
//
// A sample of lateness L us falls in row floor(L rounded to 0.1 us); rows run
// from 0 to maxUs - 1 and a sample at or beyond maxUs is an overflow. Early
// samples (negative) are in no row and not in Total; they are counted on a
// line of their own ("# Early Returns:"). Min, Avg and Max are whole
// microseconds over the samples in rows and overflows.
#ifndef QUELTA_TOOLS_HISTOGRAMFILE_H
#define QUELTA_TOOLS_HISTOGRAMFILE_H

#include <string>
#include <vector>

#include "LatencyHistogram.h"

namespace qtools {

struct HistogramColumn {
    std::string name;
    const LatencyHistogram* histogram = nullptr;
    bool measured = true;  // false: the column is all zeros and named as not measured
};

constexpr int kHistogramMaxUsLimit = LatencyHistogram::kFineBuckets / LatencyHistogram::kFinePerUs;

// maxUs: 1 to kHistogramMaxUsLimit. `title` goes on the first line.
std::string FormatHistogramFile(const std::vector<HistogramColumn>& columns, int maxUs,
                                const std::string& title);

}  // namespace qtools

#endif
