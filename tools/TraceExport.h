// Export of a log read-out as a trace in the Chrome trace-event format
// ({"traceEvents": [...]}, readable by chrome://tracing and Perfetto).
//
// Input: the arrays exactly as the log engine's read-out (ReadOutMerged,
// slot 23, or ReadOut7) fills them: count entries of time (low and high
// word), event word and, optionally, data word. The read-out puts the index
// of the CPU that recorded an entry into bits 8-15 of its event word; every
// CPU becomes one track: "pid" 1, "tid" = CPU index, named "CPU n" by a
// thread_name metadata event. "ts" is in microseconds (with ns decimals)
// relative to the earliest entry.
//
// A describe function names each entry, gives its arguments, and says
// whether it is an instant ("ph":"i"), or the begin or end of a span. A begin
// is paired with the next end of the same span key, on whatever CPU it was
// recorded, and becomes one complete event ("ph":"X") on the begin's CPU
// with its "dur": named by the end when the end gives a name (so an end can
// mark its span, say as late), otherwise by the begin, with the begin's
// arguments and then the end's ("end_cpu" added when it ended on another
// CPU). A begin or end left without a partner is written as an instant.
#ifndef QUELTA_TOOLS_TRACEEXPORT_H
#define QUELTA_TOOLS_TRACEEXPORT_H

#include <cstdint>
#include <functional>
#include <string>

#include <nlohmann/json.hpp>

namespace qtools {

inline uint32_t TraceCpuOf(uint32_t eventWord) { return (eventWord >> 8) & 0xFFu; }

// The data word of the plain recordings (no data).
constexpr uint32_t kLogNoData = 0xFFFFFFFFu;

enum class TracePhase { Instant, Begin, End };

// One entry as the describe function sees it.
struct TraceEntry {
    uint32_t event = 0;       // as read out: CPU index in bits 8-15
    uint32_t data = kLogNoData;
    double tsUs = 0.0;        // the entry's "ts"
};

struct TraceEventInfo {
    std::string name;
    std::string category = "log";
    TracePhase phase = TracePhase::Instant;
    uint32_t spanKey = 0;
    nlohmann::ordered_json args = nlohmann::ordered_json::object();
};

using TraceDescribeFn = std::function<TraceEventInfo(const TraceEntry& entry)>;

// Default: an instant named "event 0x........" (the word without its CPU
// bits), with args.data when the data word is not kLogNoData.
TraceEventInfo DescribeEventWord(const TraceEntry& entry);

struct LogReadOut {
    uint32_t count = 0;
    const uint32_t* timeLow = nullptr;
    const uint32_t* timeHigh = nullptr;
    const uint32_t* events = nullptr;
    const uint32_t* data = nullptr;  // optional
};

struct TraceExportOptions {
    std::string processName = "quelta log";
    unsigned cpuCount = 0;  // tracks named up front; CPUs seen in the entries are added
    std::string clockNote = "log time stamps (global clock, ns)";
};

std::string ExportChromeTrace(const LogReadOut& readOut,
                              const TraceDescribeFn& describe = DescribeEventWord,
                              const TraceExportOptions& options = TraceExportOptions());

}  // namespace qtools

#endif
