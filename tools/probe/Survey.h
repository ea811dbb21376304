// The survey: interleaved lateness samples of every series on one worker
// thread (SCHED_FIFO when allowed, on the chosen CPUs), the library's tick
// seen from a tick callback, the probe's own log read out for the trace,
// then the call costs.
//
// Threads: the worker samples and keeps the sampled series' histograms (read
// by others only after it has been joined); the library's timer thread runs
// the tick and callback-time callbacks; the thread that started the survey
// (the probe's main thread) calls Poll() every so often, which drains the
// samples and ticks that the other two hand over through lock-free rings,
// rebuilds the tick's lateness in chunks, and passes every sample to a sink
// (the CSV file, the summary lines). RequestStop() may be called from that
// thread at any time (a signal arrived); the worker stops within one sample.
#ifndef QUELTA_PROBE_SURVEY_H
#define QUELTA_PROBE_SURVEY_H

#include <pthread.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "LatencyHistogram.h"
#include "ProbeReport.h"
#include "TraceExport.h"
#include "probe/LoadedQuelta.h"
#include "probe/MachineNoise.h"

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
    kKindWait = 3,   // a wait begins (or a callback time is set); data: ns to the deadline
    kKindWake = 4,   // the waiter woke (or the callback ran, or a tick); data: lateness in ns
    kKindCost = 5,   // recorded while measuring the log engine's costs
};

inline uint32_t EventWord(uint32_t series, uint32_t kind) { return (kind << 16) | (series & 0xFFu); }

const char* SeriesName(uint32_t id);
const char* SeriesDescription(uint32_t id);

struct SeriesStats {
    uint32_t id = 0;
    qtools::LatencyHistogram histogram;
    bool measured = true;
    std::string notMeasured;
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
    int64_t durationS = 10;  // 0: until RequestStop
    bool realtime = true;
    int priority = 0;        // 0: just below the library's timer thread
    std::vector<int> cpus;   // empty: not restricted
    NoiseMode noise = NoiseMode::Windows;  // SpareCpu: on noiseCpu, when real-time
    int noiseCpu = -1;
};

struct SurveyResult {
    std::vector<SeriesStats> series;  // in SeriesId order
    std::size_t tickRestarts = 0;
    std::vector<qtools::CostResult> costs;
    LogSnapshot log;
    bool realtime = false;
    int priority = 0;
    bool memoryLocked = false;
    bool tickService = true;
    bool timerRunning = true;
    bool interrupted = false;
    double surveyedS = 0.0;
    NoiseFigures noise;  // the machine's stalls while the survey ran
    std::vector<std::string> notes;
};

// Receives every sample, on the thread that calls Poll(): the series, its
// deadline in seconds since the survey started, and its lateness in us.
class SampleSink {
public:
    virtual ~SampleSink() = default;
    virtual void OnSample(uint32_t series, double atS, double latenessUs) = 0;
};

struct Worker;

class Survey {
public:
    Survey(const LoadedQuelta& lib, const SurveyConfig& config);
    ~Survey();
    Survey(const Survey&) = delete;
    Survey& operator=(const Survey&) = delete;

    // Starts the worker; false when no thread could be started.
    bool Start();
    void RequestStop();
    bool Done() const;  // the worker has finished (survey and costs)

    // For the progress line: 0 preparing, 1 surveying, 2 measuring costs.
    int Phase() const;
    double ElapsedS() const;  // of the survey proper
    uint64_t Samples() const;

    // Drains what the worker and the timer thread have handed over.
    void Poll(SampleSink* sink);
    // Joins the worker, drains the rest and gives the results.
    SurveyResult Finish(SampleSink* sink);

private:
    void ProcessTicks(SampleSink* sink, bool all);

    std::unique_ptr<Worker> worker_;
    SurveyResult result_;
    pthread_t thread_{};
    bool started_ = false;
    // Main-thread side of the tick: the chunk being collected and the
    // rebuilt lateness.
    std::vector<uint64_t> tickChunk_;
    SeriesStats tick_;
    double baselineMinUs_ = -1.0;
    std::string timerThreadNote_;  // what /proc says of the library's timer thread
};

// The describe function for the trace exporter: names the probe's entries
// and gives each wait its deadline and lateness; a wake-up later than
// lateUs gets the name "<series> LATE" and the category "wait,late".
qtools::TraceDescribeFn ProbeEventDescriber(double lateUs);

}  // namespace qprobe

#endif
