#include "probe/ProbeOptions.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace qprobe {

namespace {

bool ParseDuration(const std::string& text, int& out, std::string& error) {
    errno = 0;
    char* end = nullptr;
    const long v = std::strtol(text.c_str(), &end, 10);
    if (text.empty() || end == nullptr || *end != '\0' || errno != 0) {
        error = "--duration needs a whole number of seconds, got '" + text + "'";
        return false;
    }
    if (v < kMinDuration || v > kMaxDuration) {
        error = "--duration " + text + " is out of range (" + std::to_string(kMinDuration) + " to " +
                std::to_string(kMaxDuration) + " seconds)";
        return false;
    }
    out = static_cast<int>(v);
    return true;
}

}  // namespace

ParseOutcome ParseOptions(int argc, char** argv, ProbeOptions& o, std::string& error) {
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "-h" || arg == "--help") return ParseOutcome::Help;
        if (arg == "--version") return ParseOutcome::Version;
        if (arg == "--no-realtime") {
            o.realtime = false;
            continue;
        }
        // Options with a value: "--name value" or "--name=value".
        std::string name = arg, value;
        bool inlineValue = false;
        const std::size_t eq = arg.find('=');
        if (arg.rfind("--", 0) == 0 && eq != std::string::npos) {
            name = arg.substr(0, eq);
            value = arg.substr(eq + 1);
            inlineValue = true;
        }
        std::string* target = nullptr;
        bool isDuration = false;
        if (name == "--duration" || name == "-d") {
            isDuration = true;
        } else if (name == "--library" || name == "-l") {
            target = &o.library;
        } else if (name == "--json") {
            target = &o.jsonPath;
        } else if (name == "--svg") {
            target = &o.svgPath;
        } else if (name == "--trace") {
            target = &o.tracePath;
        } else {
            error = arg.rfind("-", 0) == 0 ? "unknown option '" + arg + "'"
                                           : "unexpected argument '" + arg + "'";
            return ParseOutcome::Error;
        }
        if (!inlineValue) {
            if (i + 1 >= argc) {
                error = "option '" + name + "' needs a value";
                return ParseOutcome::Error;
            }
            value = argv[++i];
        }
        if (isDuration) {
            if (!ParseDuration(value, o.durationS, error)) return ParseOutcome::Error;
        } else {
            if (value.empty()) {
                error = "option '" + name + "' needs a non-empty value";
                return ParseOutcome::Error;
            }
            *target = value;
        }
    }
    return ParseOutcome::Run;
}

const char* ManualText() {
    return R"(NAME
    quelta-probe - survey the timing of this machine through libquelta.so.6

SYNOPSIS
    quelta-probe [--duration S] [--library PATH] [--json FILE] [--svg FILE]
                 [--trace FILE] [--no-realtime]
    quelta-probe --help | --version

DESCRIPTION
    quelta-probe answers one question: how good is timing on this machine,
    through this library, compared with what the machine can do at all?

    It loads libquelta.so.6 the way a real-time runtime does (dlopen, the
    exported functions, the timing engine's and the log engine's virtual
    slots) and, for S seconds, measures the lateness of wake-ups: the time a
    thread actually woke minus the time it asked for, in microseconds. The
    samples come from a SCHED_FIFO thread when the process may use real-time
    scheduling (it says so when it may not, and goes on under normal
    scheduling; numbers are then much noisier). The series are:

      baseline        clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME) itself:
                      the machine's own wake-up latency, the reference
      plain-wait      quelta_iTSC_WaitUntilClocks64_C, an absolute wait
      tick            the library's 1 ms tick, seen from a tick callback
                      (engine slot 54); its grid is rebuilt from the ticks
      event-own-sem   quelta_iTSCEvent_Wait_Callback_C with its own semaphore
      event-timeout   quelta_iTSCEvent_Wait_C on a semaphore nobody posts
      global-wait     quelta_iTSC_WaitUntilGlobalClocks64_C, measured on the
                      global clock (engine slot 2)
      callback-time   quelta_iTSC_SetCallbackTime: when the callback ran

    The waits are interleaved, one sample of each series in turn in a
    shuffled order, each with a random deadline 0.2 to 1.2 ms ahead, so that
    whatever the machine does meanwhile hits every series alike. A wait that
    returns before its deadline is a fault of the library; it is reported
    loudly and the exit status is 3.

    After the survey it measures what calls cost, in ns per call (median of
    batches): the engine's clock reads next to clock_gettime, a conversion
    between the time bases, the log engine's recording and its read-out.

    The probe records its own activity in the library's log engine (each
    series' start and end, each wait and wake-up) and can write that log as a
    trace.

OPTIONS
    -d, --duration S
           Survey for S seconds, 1 to 3600 (default 10). The call costs add
           about a second.
    -l, --library PATH
           Load this libquelta.so.6 instead of the one the probe was built
           with. A PATH without a slash is searched for by the dynamic loader.
    --json FILE
           Write the results as JSON (schema "quelta-probe/1", see
           docs/probe.md).
    --svg FILE
           Write a latency histogram (log-log, one curve per series) as SVG.
    --trace FILE
           Write the log read-out as a Chrome trace-event file: one track per
           CPU, time in microseconds from the first entry. Open it in
           chrome://tracing or ui.perfetto.dev.
    --no-realtime
           Do not ask for SCHED_FIFO even when it is allowed.
    -h, --help
           Show this text.
    --version
           Show the probe's version.

OUTPUT
    A table with one row per series: sample count, min, p50, p90, p99, p99.9
    and max of the lateness in microseconds, the ratio of the series' p99 to
    the baseline's p99, and a verdict: "as good as the machine" (within 1.1x
    or 5 us), "within 1.5x of the machine", "within 2x of the machine", or
    "worse than the machine: ..." with the factor. Then a table of call
    costs. While the survey runs, a progress line is shown when standard
    output is a terminal.

EXIT STATUS
    0   the survey ran; no wait returned early
    1   usage error: unknown option, missing value, duration out of range
    2   the library could not be loaded, lacks a symbol, or did not start
    3   a wait of the library returned before its deadline
    4   an output file could not be written

EXAMPLES
    quelta-probe
           Ten seconds, tables on the terminal.
    quelta-probe --duration 60 --json probe.json --svg probe.svg
           A minute, with results for other tools and a plot.
    quelta-probe --library /opt/runtime/lib/libquelta.so.6 --trace t.json
           Survey an installed copy and keep a trace of what happened.
)";
}

}  // namespace qprobe
