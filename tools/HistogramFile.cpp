#include "HistogramFile.h"

#include <algorithm>
#include <cinttypes>
#include <cmath>
#include <cstdio>

namespace qtools {

namespace {

// Whole microseconds of a value as the rows count it.
long long RowOf(double us) { return static_cast<long long>(TenthsOfUs(us) / LatencyHistogram::kFinePerUs); }

}  // namespace

std::string FormatHistogramFile(const std::vector<HistogramColumn>& columns, int maxUs, const std::string& title) {
    maxUs = std::clamp(maxUs, 1, kHistogramMaxUsLimit);
    std::string out = "# " + title + "\n";
    out += "# lateness (actual wake-up minus intended time) in microseconds, one row per 1 us bucket\n";
    out += "# columns: us";
    std::string notMeasured;
    for (const HistogramColumn& c : columns) {
        out += " " + c.name;
        if (!c.measured) notMeasured += " " + c.name;
    }
    out += "\n";
    if (!notMeasured.empty()) out += "# not measured (all zero):" + notMeasured + "\n";

    char buf[64];
    std::vector<uint64_t> inRows(columns.size(), 0);
    for (int us = 0; us < maxUs; ++us) {
        std::snprintf(buf, sizeof buf, "%06d", us);
        out += buf;
        for (std::size_t i = 0; i < columns.size(); ++i) {
            const LatencyHistogram* h = columns[i].measured ? columns[i].histogram : nullptr;
            // Row u holds the values that round to [u, u + 1) in tenths.
            const uint64_t n = h ? h->CountInFine(us * LatencyHistogram::kFinePerUs,
                                                  (us + 1) * LatencyHistogram::kFinePerUs)
                                 : 0;
            inRows[i] += n;
            std::snprintf(buf, sizeof buf, "\t%06" PRIu64, n);
            out += buf;
        }
        out += "\n";
    }

    std::string total = "# Total:", mins = "# Min Latencies:", avgs = "# Avg Latencies:",
                maxs = "# Max Latencies:", overflows = "# Histogram Overflows:", early = "# Early Returns:";
    for (std::size_t i = 0; i < columns.size(); ++i) {
        const LatencyHistogram* h = columns[i].measured ? columns[i].histogram : nullptr;
        const uint64_t placed = h ? h->count() - h->early() : 0;
        std::snprintf(buf, sizeof buf, " %09" PRIu64, placed);
        total += buf;
        std::snprintf(buf, sizeof buf, " %09" PRIu64, placed - inRows[i]);
        overflows += buf;
        std::snprintf(buf, sizeof buf, " %05" PRIu64, h ? h->early() : 0);
        early += buf;
        // The minimum over placed samples: the overall one unless it is early.
        long long mn = 0, mx = 0, avg = 0;
        if (placed > 0) {
            mn = h->early() > 0 ? 0 : RowOf(h->min());
            if (h->early() > 0) {  // the smallest placed row
                for (int t = 0; t < LatencyHistogram::kFineBuckets; ++t) {
                    if (h->CountInFine(t, t + 1) > 0) {
                        mn = t / LatencyHistogram::kFinePerUs;
                        break;
                    }
                }
            }
            mx = RowOf(h->max());
            avg = std::llround(h->mean());
        }
        std::snprintf(buf, sizeof buf, " %05lld", mn);
        mins += buf;
        std::snprintf(buf, sizeof buf, " %05lld", std::max(0LL, avg));
        avgs += buf;
        std::snprintf(buf, sizeof buf, " %05lld", mx);
        maxs += buf;
    }
    out += total + "\n" + mins + "\n" + avgs + "\n" + maxs + "\n" + overflows + "\n" + early + "\n";
    return out;
}

}  // namespace qtools
