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

struct ProbeReport {
    MachineInfo machine;
    std::string library;
    bool tickService = true;   // the engine's UsesTickService
    bool timerRunning = true;  // the library's timer serves (its waits did not answer "no timer")
    double durationS = 0.0;
    bool interrupted = false;  // ended by a signal rather than by the duration
    std::vector<int> surveyCpus;  // the survey thread's CPUs (empty: not restricted)
    std::vector<SeriesResult> series;  // the one named "baseline" is the reference
    std::vector<CostResult> costs;
    std::vector<std::string> notes;    // warnings worth a person's attention
};

// Fills ratio and verdict of every series against the one named "baseline".
void FinishVerdicts(ProbeReport& report);
// Wait series that returned early, the baseline excluded.
std::size_t LibraryEarlyCount(const ProbeReport& report);

// The JSON document, indented by two spaces, ending in a newline.
std::string ReportToJson(const ProbeReport& report);
std::string FormatSeriesTable(const ProbeReport& report);
std::string FormatCostTable(const ProbeReport& report);

}  // namespace qtools

#endif
