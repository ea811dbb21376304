// Command line of quelta-probe.
#ifndef QUELTA_PROBE_PROBEOPTIONS_H
#define QUELTA_PROBE_PROBEOPTIONS_H

#include <cstdint>
#include <string>
#include <vector>

namespace qprobe {

// Exit statuses, documented in the manual page, --help and docs/probe.md.
enum ExitStatus {
    kExitOk = 0,
    kExitUsage = 1,
    kExitLibrary = 2,
    kExitEarly = 3,
    kExitOutput = 4,
};

constexpr int64_t kMaxDurationS = 30LL * 24 * 3600;  // 30 days; 0 runs until interrupted
constexpr int kDefaultIntervalUntilInterrupted = 60;
constexpr int kDefaultHistogramMaxUs = 10000;

// --noise: where the machine's stalls are measured beside the survey.
enum class NoiseChoice { Auto, Windows, Cpu, Off };

struct ProbeOptions {
    int64_t durationS = 10;  // 0: until SIGINT or SIGTERM
    int intervalS = -1;      // summary line every N s; 0 none; -1 the default
    std::string library;     // empty: libquelta.so.6 as the loader finds it
    std::string jsonPath;    // "-" for standard output, as for every output
    std::string svgPath;
    std::string tracePath;
    std::string csvPath;
    std::string histogramPath;
    int histogramMaxUs = kDefaultHistogramMaxUs;
    std::vector<int> cpus;   // survey thread's CPUs; empty: not restricted
    int priority = 0;        // SCHED_FIFO priority; 0: just below the library's timer thread
    bool realtime = true;
    NoiseChoice noise = NoiseChoice::Auto;
    int noiseCpu = -1;       // NoiseChoice::Cpu
};

enum class ParseOutcome { Run, Help, Version, Error };

ParseOutcome ParseOptions(int argc, char** argv, ProbeOptions& options, std::string& error);

// "10", "90s", "15m", "12h", "1d", "0": seconds, or false.
bool ParseDurationText(const std::string& text, int64_t& seconds);
// A CPU list as the kernel writes them ("0-3,6"): false when malformed.
bool ParseCpuList(const std::string& text, std::vector<int>& cpus);

const char* ManualText();  // --help

}  // namespace qprobe

#endif
