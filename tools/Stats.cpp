#include "Stats.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <limits>

namespace qtools {

namespace {
constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

std::string Format(const char* fmt, double a, double b = 0.0) {
    char buf[160];
    std::snprintf(buf, sizeof buf, fmt, a, b);
    return buf;
}
bool AsGoodAsTheMachine(const Summary& series, const Summary& baseline) {
    const double ratio = RatioP99(series, baseline);
    return series.p99 - baseline.p99 <= kVerdictSlackUs || (!std::isnan(ratio) && ratio <= 1.1);
}

}  // namespace

Summary::Summary() : min(kNaN), mean(kNaN), p50(kNaN), p90(kNaN), p99(kNaN), p999(kNaN), max(kNaN) {}

Summary Summarize(const LatencyHistogram& h) {
    Summary s;
    s.count = static_cast<std::size_t>(h.count());
    s.early = static_cast<std::size_t>(h.early());
    if (s.count == 0) return s;
    s.min = h.min();
    s.max = h.max();
    s.mean = h.mean();
    s.p50 = h.Percentile(0.50);
    s.p90 = h.Percentile(0.90);
    s.p99 = h.Percentile(0.99);
    s.p999 = h.Percentile(0.999);
    return s;
}

Summary Summarize(const std::vector<double>& values) {
    LatencyHistogram h;
    for (double v : values) h.Add(v);
    return Summarize(h);
}

double RatioP99(const Summary& series, const Summary& baseline) {
    if (series.count == 0 || baseline.count == 0) return kNaN;
    if (!(baseline.p99 > 0.0)) return kNaN;
    return series.p99 / baseline.p99;
}

std::string VerdictFor(const Summary& series, const Summary& baseline, bool isBaseline,
                       std::size_t failedCalls) {
    std::string v;
    if (series.count == 0) {
        v = "no samples";
    } else if (series.early > 0) {
        v = Format(isBaseline ? "MACHINE FAULT: the kernel's sleep returned early %.0f times (by up to %.1f us)"
                              : "FAILED: returned early %.0f times (by up to %.1f us)",
                   static_cast<double>(series.early), -series.min);
    } else if (isBaseline) {
        v = "the machine's own limit";
    } else if (baseline.count == 0) {
        v = "no baseline to compare with";
    } else {
        const double excess = series.p99 - baseline.p99;
        const double ratio = RatioP99(series, baseline);
        if (AsGoodAsTheMachine(series, baseline)) {
            v = "as good as the machine";
        } else if (!std::isnan(ratio) && ratio <= 1.5) {
            v = "within 1.5x of the machine";
        } else if (!std::isnan(ratio) && ratio <= 2.0) {
            v = "within 2x of the machine";
        } else if (!std::isnan(ratio)) {
            v = Format("worse than the machine: p99 %.1fx the baseline's (+%.1f us)", ratio, excess);
        } else {
            v = Format("worse than the machine: p99 +%.1f us over the baseline's", excess);
        }
    }
    // The p99 decides; a typical wake-up that is clearly slower is worth a
    // mention all the same (a second wake-up on the way, for instance).
    if (!isBaseline && series.count > 0 && series.early == 0 && baseline.count > 0) {
        const double typicalExcess = series.p50 - baseline.p50;
        if (typicalExcess > kVerdictSlackUs && series.p50 > 1.5 * baseline.p50) {
            v += Format("; typical wake-up +%.1f us", typicalExcess);
        }
    }
    if (failedCalls > 0) {
        v += Format("; %.0f calls failed", static_cast<double>(failedCalls));
    }
    return v;
}

std::string StallClause(const Summary& series, const Summary& baseline, const Summary& stall, bool isBaseline,
                        int& explained) {
    explained = -1;
    if (series.count == 0 || series.early > 0 || stall.count == 0 || baseline.count == 0) return "";
    if (!isBaseline && AsGoodAsTheMachine(series, baseline)) return "";
    const double beyond = series.p99 - (baseline.p50 + stall.p99);
    explained = beyond <= kVerdictSlackUs ? 1 : 0;
    return explained ? Format("; machine stalls explain the tail (stall p99 %.1f us around it)", stall.p99)
                     : Format("; tail %.1f us beyond machine stalls (stall p99 %.1f us around it)", beyond, stall.p99);
}

}  // namespace qtools
