// Cost per call of the library's clock reads, conversion and log engine,
// next to the raw system calls they stand on.
#ifndef QUELTA_PROBE_COSTS_H
#define QUELTA_PROBE_COSTS_H

#include <vector>

#include "ProbeReport.h"
#include "probe/LoadedQuelta.h"

namespace qprobe {

// Runs on the survey's worker thread after the survey. Records into the log
// engine (recording switched on), so the survey's log must be read out first.
std::vector<qtools::CostResult> MeasureCosts(const LoadedQuelta& lib);

}  // namespace qprobe

#endif
