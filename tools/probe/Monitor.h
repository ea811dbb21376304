// What the probe's main thread does with the samples while the survey runs:
// streams them to the CSV file and keeps the figures of the one-line
// summaries that long runs print every few seconds.
#ifndef QUELTA_PROBE_MONITOR_H
#define QUELTA_PROBE_MONITOR_H

#include <cstdint>
#include <cstdio>
#include <string>

#include "probe/Survey.h"

namespace qprobe {

class Monitor : public SampleSink {
public:
    explicit Monitor(FILE* csv);  // null: no CSV

    void OnSample(uint32_t series, double atS, double latenessUs) override;

    // "[ 2:15:00] 9876543 wakes, 0 early; worst us (last 60 s / all):
    // baseline 142.0/3172.5 ..." and starts the next interval.
    std::string IntervalLine(double elapsedS, int intervalS);

    bool csvFailed() const { return csvFailed_; }

private:
    struct Figures {
        uint64_t count = 0;
        uint64_t early = 0;
        double intervalMax = -1e300;
        double overallMax = -1e300;
        bool seen = false;
        bool seenInInterval = false;
    };
    FILE* csv_;
    bool csvFailed_ = false;
    Figures figures_[kSeriesCount];
};

// H:MM:SS, hours going past 24.
std::string Clock(double seconds);

}  // namespace qprobe

#endif
