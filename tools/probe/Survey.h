// The survey: interleaved lateness samples of every series, the library's
// tick seen from a tick callback, the probe's own log read out for the
// trace, then the call costs. Everything runs on one worker thread
// (SCHED_FIFO when allowed) while the calling thread shows progress.
#ifndef QUELTA_PROBE_SURVEY_H
#define QUELTA_PROBE_SURVEY_H

#include <cstdint>
#include <string>
#include <vector>

#include "ProbeReport.h"
#include "TraceExport.h"
#include "probe/LoadedQuelta.h"

namespace qprobe {

// Series identifiers, also bits 0-7 of the probe's log event words.
enum SeriesId : uint32_t {
    kBaseline = 0,
    kPlainWait = 1,
    kTick = 2,
    kEventOwnSem = 3,
    kEventTimeout = 4,
    kGlobalWait = 5,
    kCallbackTime = 6,
    kSeriesCount = 7,
    kSurveyItself = 0xFF,
};

// Kinds of log entries, bits 16-23 of the event word (bits 8-15 carry the
// CPU after read-out).
enum LogKind : uint32_t {
    kKindStart = 1,  // a series starts
    kKindEnd = 2,    // a series ends
    kKindWait = 3,   // a wait begins (or a callback time is set)
    kKindWake = 4,   // the waiter woke (or the callback ran, or a tick)
    kKindCost = 5,   // recorded while measuring the log engine's costs
};

inline uint32_t EventWord(uint32_t series, uint32_t kind) { return (kind << 16) | (series & 0xFFu); }

const char* SeriesName(uint32_t id);
const char* SeriesDescription(uint32_t id);

struct SeriesSamples {
    uint32_t id = 0;
    std::vector<double> latenessUs;
    std::size_t failed = 0;
    // Wake-ups more than 1 ms late, and how many of them the survey thread
    // spent mostly runnable but off its CPU (-1: not known for this series).
    std::size_t overMs = 0;
    long cpuHeld = -1;
};

struct LogSnapshot {
    std::vector<uint32_t> timeLow, timeHigh, events, data;
    uint32_t count = 0;
};

struct SurveyConfig {
    int durationS = 10;
    bool realtime = true;
    bool progress = false;  // a progress line on stdout (a terminal)
};

struct SurveyResult {
    std::vector<SeriesSamples> series;  // in SeriesId order
    std::size_t tickRestarts = 0;
    std::vector<qtools::CostResult> costs;
    LogSnapshot log;
    bool realtime = false;
    int priority = 0;
    bool memoryLocked = false;
    bool tickService = true;
    double surveyedS = 0.0;
    std::vector<std::string> notes;
};

SurveyResult RunSurvey(const LoadedQuelta& lib, const SurveyConfig& config);

// The describe function for the trace exporter: names the probe's entries.
qtools::TraceEventInfo DescribeProbeEvent(uint32_t eventWord);

}  // namespace qprobe

#endif
