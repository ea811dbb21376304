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
// A describe function names each event word and says whether it is an
// instant ("ph":"i"), or the begin or end of a span. A begin is paired with
// the next end of the same span key, on whatever CPU it was recorded, and
// becomes one complete event ("ph":"X") on the begin's CPU with its "dur";
// a begin or end left without a partner is written as an instant.
// Data words other than 0xFFFFFFFF (the plain recordings' value) appear as
// args.data.
#ifndef QUELTA_TOOLS_TRACEEXPORT_H
#define QUELTA_TOOLS_TRACEEXPORT_H

#include <cstdint>
#include <functional>
#include <string>

namespace qtools {

inline uint32_t TraceCpuOf(uint32_t eventWord) { return (eventWord >> 8) & 0xFFu; }

enum class TracePhase { Instant, Begin, End };

struct TraceEventInfo {
    std::string name;
    std::string category = "log";
    TracePhase phase = TracePhase::Instant;
    uint32_t spanKey = 0;
};

// Gets the event word as read out (CPU index in bits 8-15).
using TraceDescribeFn = std::function<TraceEventInfo(uint32_t eventWord)>;

// Default: an instant named "event 0x........" (the word without its CPU bits).
TraceEventInfo DescribeEventWord(uint32_t eventWord);

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
