// Command line of quelta-probe.
#ifndef QUELTA_PROBE_PROBEOPTIONS_H
#define QUELTA_PROBE_PROBEOPTIONS_H

#include <string>

namespace qprobe {

// Exit statuses, documented in the manual text and docs/probe.md.
enum ExitStatus {
    kExitOk = 0,
    kExitUsage = 1,
    kExitLibrary = 2,
    kExitEarly = 3,
    kExitOutput = 4,
};

constexpr int kMinDuration = 1;
constexpr int kMaxDuration = 3600;

struct ProbeOptions {
    int durationS = 10;
    std::string library;  // empty: the default (the library this probe was built with)
    std::string jsonPath;
    std::string svgPath;
    std::string tracePath;
    bool realtime = true;
};

enum class ParseOutcome { Run, Help, Version, Error };

ParseOutcome ParseOptions(int argc, char** argv, ProbeOptions& options, std::string& error);

const char* ManualText();  // --help

}  // namespace qprobe

#endif
