// The probe's results, and their two forms: the tables a person reads and
// the JSON document ("quelta-probe/1") that other tools read.
#ifndef QUELTA_TOOLS_PROBEREPORT_H
#define QUELTA_TOOLS_PROBEREPORT_H

#include <cstddef>
#include <string>
#include <vector>

#include "Stats.h"

namespace qtools {

constexpr const char* kProbeSchema = "quelta-probe/1";

struct MachineInfo {
    unsigned cpus = 0;
    std::string kernel;         // uname release
    std::string kernelVersion;  // uname version (build, preemption model)
    std::string arch;           // uname machine
    bool realtime = false;      // the survey ran under SCHED_FIFO
    int priority = 0;           // its SCHED_FIFO priority, 0 without
    bool memoryLocked = false;  // mlockall succeeded
};

struct SeriesResult {
    std::string name;
    std::string description;
    bool measured = true;      // false: the survey could not run it (see notMeasured)
    std::string notMeasured;   // why, for a person
    Summary summary;           // microseconds
    std::size_t failed = 0;    // calls that did not return as documented (no sample)
    std::size_t overMs = 0;    // samples more than 1 ms late
    long cpuHeld = -1;         // of those, kept off the CPU for most of it; -1 unknown
    Summary stall;             // the machine's longest stall per window around it (count 0: not measured)
    int stallExplains = -1;    // filled by FinishVerdicts: 1 the machine's stalls explain the tail, 0 not, -1 -
    double ratio = 0.0;        // filled by FinishVerdicts (NaN when none)
    std::string verdict;       // filled by FinishVerdicts
};

struct CostResult {
    std::string name;          // stable identifier
    std::string label;         // for the table
    int slot = -1;             // engine or log engine slot, -1 for none
    double nsPerCall = 0.0;
    double baselineNs = -1.0;  // the raw system call it stands on; < 0: none
};

// The machine's own stalls, measured beside the series (see the probe's
// MachineNoise): the CPU taken from a thread spinning at the survey's
// priority.
struct NoiseResult {
    std::string mode = "off";  // "off"; "windows": the survey thread after each sample; "spare-cpu"
    int cpu = -1;              // spare-cpu: the CPU it spun on
    double thresholdUs = 0.0;  // a gap longer than this is a stall
    double windowUs = 0.0;     // windows: each one's length
    double measuredS = 0.0;    // time spent spinning
    std::size_t stalls = 0;    // gaps above the threshold
    double stalledUs = 0.0;    // their sum
    double libraryUs = -1.0;   // the library's timer thread's time left out of the gaps; < 0: not known
    Summary longest;           // the longest stall of each window (or sample), all series together
};

struct ProbeReport {
    MachineInfo machine;
    std::string library;
    bool tickService = true;   // the engine's UsesTickService
    bool timerRunning = true;  // the library's timer serves (its waits did not answer "no timer")
    double durationS = 0.0;
    bool interrupted = false;  // ended by a signal rather than by the duration
    std::vector<int> surveyCpus;  // the survey thread's CPUs (empty: not restricted)
    std::vector<SeriesResult> series;  // the one named "baseline" is the reference
    NoiseResult noise;
    std::vector<CostResult> costs;
    std::vector<std::string> notes;    // warnings worth a person's attention
};

// Fills ratio and verdict of every series against the one named "baseline",
// with what the machine's stalls say about its tail.
void FinishVerdicts(ProbeReport& report);
// Wait series that returned early, the baseline excluded.
std::size_t LibraryEarlyCount(const ProbeReport& report);

// The JSON document, indented by two spaces, ending in a newline.
std::string ReportToJson(const ProbeReport& report);
std::string FormatSeriesTable(const ProbeReport& report);
// One table cell: `v` printed with `fmt`, or "-" when it is not a number.
std::string Cell(double v, const char* fmt = "%.1f");
// Rows of cells as a table: columns padded to their widest cell, the first
// left-aligned and the others right-aligned (the last one left as it is),
// a rule under the first row.
std::string FormatColumns(const std::vector<std::vector<std::string>>& rows);
std::string FormatCostTable(const ProbeReport& report);

}  // namespace qtools

#endif
