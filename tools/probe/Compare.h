// quelta-probe compare A.json B.json: two saved surveys side by side, for a
// before/after on one machine (a kernel setting, another library build).
#ifndef QUELTA_PROBE_COMPARE_H
#define QUELTA_PROBE_COMPARE_H

#include <cstdio>

namespace qprobe {

// The command, given the arguments after "compare"; returns the exit
// status (0 compared, 1 bad arguments or a file that is missing, not JSON or
// not of this probe's schema). The table goes to `out`, errors to `err`.
int RunCompare(int argc, char** argv, FILE* out, FILE* err);

}  // namespace qprobe

#endif
