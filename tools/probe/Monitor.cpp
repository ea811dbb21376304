#include "probe/Monitor.h"

#include <algorithm>
#include <cmath>

namespace qprobe {

std::string Clock(double seconds) {
    const long long s = static_cast<long long>(std::max(0.0, seconds));
    char buf[32];
    std::snprintf(buf, sizeof buf, "%lld:%02lld:%02lld", s / 3600, s / 60 % 60, s % 60);
    return buf;
}

Monitor::Monitor(FILE* csv) : csv_(csv) {
    if (csv_ != nullptr && std::fputs("time_s,series,lateness_us\n", csv_) < 0) csvFailed_ = true;
}

void Monitor::OnSample(uint32_t series, double atS, double latenessUs) {
    if (series >= kSeriesCount) return;
    Figures& f = figures_[series];
    ++f.count;
    if (latenessUs < 0) ++f.early;
    f.intervalMax = f.seenInInterval ? std::max(f.intervalMax, latenessUs) : latenessUs;
    f.overallMax = f.seen ? std::max(f.overallMax, latenessUs) : latenessUs;
    f.seen = f.seenInInterval = true;
    if (csv_ != nullptr && !csvFailed_ &&
        std::fprintf(csv_, "%.6f,%s,%.3f\n", atS, SeriesName(series), latenessUs) < 0) {
        csvFailed_ = true;
    }
}

std::string Monitor::IntervalLine(double elapsedS, int intervalS) {
    uint64_t count = 0, early = 0;
    for (const Figures& f : figures_) {
        count += f.count;
        early += f.early;
    }
    char buf[160];
    std::snprintf(buf, sizeof buf, "[%9s] %llu wakes, %llu early; worst us (last %d s / all):",
                  Clock(elapsedS).c_str(), static_cast<unsigned long long>(count),
                  static_cast<unsigned long long>(early), intervalS);
    std::string line = buf;
    for (uint32_t id = 0; id < kSeriesCount; ++id) {
        Figures& f = figures_[id];
        if (!f.seen) continue;
        if (f.seenInInterval) {
            std::snprintf(buf, sizeof buf, " %s %.1f/%.1f", SeriesName(id), f.intervalMax, f.overallMax);
        } else {
            std::snprintf(buf, sizeof buf, " %s -/%.1f", SeriesName(id), f.overallMax);
        }
        line += buf;
        f.seenInInterval = false;
    }
    return line;
}

}  // namespace qprobe
