#include "probe/ProbeOptions.h"

#include <sched.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdlib>

namespace qprobe {

namespace {

bool ParseWhole(const std::string& text, int64_t& out) {
    if (text.empty() || !std::isdigit(static_cast<unsigned char>(text[0]))) return false;
    errno = 0;
    char* end = nullptr;
    const long long v = std::strtoll(text.c_str(), &end, 10);
    if (errno != 0 || end == nullptr || *end != '\0') return false;
    out = v;
    return true;
}

}  // namespace

bool ParseDurationText(const std::string& text, int64_t& seconds) {
    if (text.empty()) return false;
    int64_t unit = 1;
    std::string digits = text;
    switch (text.back()) {
        case 's': unit = 1; break;
        case 'm': unit = 60; break;
        case 'h': unit = 3600; break;
        case 'd': unit = 86400; break;
        default: unit = 0;
    }
    if (unit != 0) digits.pop_back();
    else unit = 1;
    int64_t v = 0;
    if (!ParseWhole(digits, v) || v > kMaxDurationS || v * unit > kMaxDurationS) return false;
    seconds = v * unit;
    return true;
}

bool ParseCpuList(const std::string& text, std::vector<int>& cpus) {
    std::vector<int> out;
    std::size_t pos = 0;
    while (pos <= text.size()) {
        const std::size_t comma = std::min(text.find(',', pos), text.size());
        const std::string item = text.substr(pos, comma - pos);
        const std::size_t dash = item.find('-');
        int64_t a = 0, b = 0;
        if (dash == std::string::npos) {
            if (!ParseWhole(item, a)) return false;
            b = a;
        } else if (!ParseWhole(item.substr(0, dash), a) || !ParseWhole(item.substr(dash + 1), b) || b < a) {
            return false;
        }
        if (b >= CPU_SETSIZE) return false;
        for (int64_t c = a; c <= b; ++c) out.push_back(static_cast<int>(c));
        pos = comma + 1;
    }
    std::sort(out.begin(), out.end());
    out.erase(std::unique(out.begin(), out.end()), out.end());
    cpus = out;
    return !cpus.empty();
}

ParseOutcome ParseOptions(int argc, char** argv, ProbeOptions& o, std::string& error) {
    CLI::App app{"quelta-probe"};
    app.set_help_flag();  // the manual text instead of the library's help
    // A later option overrides an earlier one, so that a user's options win
    // over the defaults a script passes first (scripts/probe.sh). Flags
    // already behave so.
    app.option_defaults()->multi_option_policy(CLI::MultiOptionPolicy::TakeLast);
    bool help = false, version = false, noRealtime = false;
    std::string duration, cpuList, noise = "auto";
    int interval = -1, priority = 0, histogramMax = kDefaultHistogramMaxUs;
    const int maxPriority = sched_get_priority_max(SCHED_FIFO) - 1;
    app.add_flag("-h,--help", help);
    app.add_flag("--version", version);
    app.add_option("-d,--duration", duration);
    app.add_option("-l,--library", o.library)->check(CLI::Validator(
        [](std::string& s) { return s.empty() ? std::string("needs a path") : std::string(); }, "PATH"));
    // An empty FILE turns the output off: how a user drops one that a
    // script's defaults ask for (the CSV grows by 130 MB an hour).
    for (auto [flag, target] : {std::pair{"--json", &o.jsonPath}, std::pair{"--svg", &o.svgPath},
                                std::pair{"--trace", &o.tracePath}, std::pair{"--csv", &o.csvPath},
                                std::pair{"--histogram", &o.histogramPath}}) {
        app.add_option(flag, *target);
    }
    app.add_option("--histogram-max", histogramMax)->check(CLI::Range(1, 10000));
    app.add_option("-i,--interval", interval)->check(CLI::Range(0, 86400));
    app.add_option("--cpu", cpuList);
    app.add_option("-p,--priority", priority)->check(CLI::Range(1, std::max(1, maxPriority)));
    app.add_flag("--no-realtime", noRealtime);
    app.add_option("--noise", noise);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        // Help and version win over everything else on the line.
        for (int i = 1; i < argc; ++i) {
            const std::string a = argv[i];
            if (a == "-h" || a == "--help") return ParseOutcome::Help;
        }
        error = e.what();
        return ParseOutcome::Error;
    }
    if (help) return ParseOutcome::Help;
    if (version) return ParseOutcome::Version;
    if (!duration.empty() && !ParseDurationText(duration, o.durationS)) {
        error = "--duration: '" + duration + "' is not a duration from 1 s to 30 d (a whole number with s, m, h "
                "or d, seconds without), or 0 to run until interrupted";
        return ParseOutcome::Error;
    }
    if (!cpuList.empty() && !ParseCpuList(cpuList, o.cpus)) {
        error = "--cpu: '" + cpuList + "' is not a CPU list such as 1 or 2-3 or 0,2";
        return ParseOutcome::Error;
    }
    int64_t noiseCpu = -1;
    if (noise == "auto" || noise == "windows" || noise == "off") {
        o.noise = noise == "auto" ? NoiseChoice::Auto : noise == "windows" ? NoiseChoice::Windows : NoiseChoice::Off;
    } else if (ParseWhole(noise, noiseCpu) && noiseCpu < CPU_SETSIZE) {
        o.noise = NoiseChoice::Cpu;
        o.noiseCpu = static_cast<int>(noiseCpu);
        if (o.cpus.empty() || std::binary_search(o.cpus.begin(), o.cpus.end(), o.noiseCpu)) {
            error = "--noise " + noise + ": a CPU of its own needs --cpu with a list of other CPUs for the survey";
            return ParseOutcome::Error;
        }
    } else {
        error = "--noise: '" + noise + "' is not auto, windows, off or a CPU number";
        return ParseOutcome::Error;
    }
    if (priority != 0 && noRealtime) {
        error = "--priority and --no-realtime contradict each other";
        return ParseOutcome::Error;
    }
    int dashes = 0;
    for (const std::string* p : {&o.jsonPath, &o.svgPath, &o.tracePath, &o.csvPath, &o.histogramPath}) {
        dashes += *p == "-";
    }
    if (dashes > 1) {
        error = "only one output can go to standard output ('-')";
        return ParseOutcome::Error;
    }
    o.intervalS = interval;
    o.priority = priority;
    o.histogramMaxUs = histogramMax;
    o.realtime = !noRealtime;
    return ParseOutcome::Run;
}

const char* ManualText() {
    return R"(NAME
    quelta-probe - survey the timing of this machine through libquelta.so.6

SYNOPSIS
    quelta-probe [-d TIME] [-l PATH] [--cpu LIST] [-p N] [--no-realtime]
                 [--noise WHERE] [-i S] [--json FILE] [--svg FILE]
                 [--trace FILE] [--csv FILE] [--histogram FILE]
                 [--histogram-max US]
    quelta-probe compare A.json B.json
    quelta-probe --help | --version

DESCRIPTION
    quelta-probe answers one question: how good is timing on this machine,
    through this library, compared with what the machine can do at all?

    It loads libquelta.so.6 the way a real-time runtime does (dlopen, the
    exported functions, the timing engine's and the log engine's virtual
    slots) and measures the lateness of wake-ups: the time a thread actually
    woke minus the time it asked for, in microseconds. The samples come from
    a SCHED_FIFO thread when the process may use real-time scheduling. The
    series are:

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

    The last five series need the library's timer thread, which needs
    real-time privilege (root, CAP_SYS_NICE or an RLIMIT_RTPRIO of 99).
    Without it the library answers those waits with "no timer" at once, as
    documented; the probe then says so, shows them as not measured, surveys
    the baseline and plain-wait alone and exits 0.

    Beside the series it measures the machine's own stalls: a thread at the
    survey's priority spins reading CLOCK_MONOTONIC, and every gap is time
    the CPU was taken from it (an interrupt, an SMI, the hypervisor, a task
    of higher priority; the library's timer thread is left out). Each series
    gets the p99 and max of the longest stall around its samples, and its
    verdict says whether those stalls explain its tail.

    After a survey that ran its full duration it measures what calls cost,
    in ns per call (median of batches): the engine's clock reads next to
    clock_gettime, a conversion between the time bases, the log engine's
    recording and its read-out.

OPTIONS
    -d, --duration TIME
           Survey for TIME: whole seconds, or a number with s, m, h or d
           (90s, 15m, 12h, 1d), up to 30 days; default 10. 0 runs until
           interrupted. SIGINT (Ctrl-C) or SIGTERM ends any survey early: the
           survey stops, the tables are printed and every requested file is
           written for what was measured (a second signal aborts).
    -i, --interval S
           Print a one-line summary every S seconds (count, early returns,
           and each series' worst wake-up in the interval and overall).
           Default: 60 when running until interrupted, otherwise none. 0
           turns it off.
    --cpu LIST
           Run the survey thread on these CPUs only (a list such as 3, 2-3
           or 0,2). The tick and callback-time series run on the library's
           timer thread, whose CPUs the probe leaves alone.
    -p, --priority N
           SCHED_FIFO priority of the survey thread, 1 to 98; default 98,
           just below the library's timer thread.
    --no-realtime
           Do not ask for SCHED_FIFO even when it is allowed.
    --noise WHERE
           Where the machine's stalls are measured: auto (default), windows,
           a CPU number, or off. windows: the survey thread spins for 200 us
           after each sample, on its own CPU. A CPU number: a thread of its
           own spins on that CPU throughout (outside the --cpu list, which
           it needs; real-time only) and watches each sample. auto takes the
           highest spare CPU when --cpu leaves one on a machine of 3 CPUs or
           more, windows otherwise.
    -l, --library PATH
           Load this libquelta.so.6 instead of the one the dynamic loader
           finds (a probe in a build tree finds the library built beside it).
           A PATH without a slash is searched for by the dynamic loader.
    --json FILE
           Write the results as JSON (schema "quelta-probe/1").
    --svg FILE
           Write a tail plot as SVG: for each series, the fraction of wakes
           later than x, with the baseline on top and each series' p99.
    --trace FILE
           Write the log read-out as a Chrome trace-event file: one track per
           CPU, each wait a span with its deadline and lateness; late wakes
           are named "<series> LATE". Open it in ui.perfetto.dev.
    --csv FILE
           Write every sample: time_s,series,lateness_us, one row per wake-up,
           streamed while the survey runs (about 130 MB an hour).
    --histogram FILE
           Write a histogram with one row per microsecond and one column per
           series, '#' lines for the header and the summary (Total, Min, Avg
           and Max Latencies, Histogram Overflows), as real-time Linux latency
           tools write it.
    --histogram-max US
           Rows of the histogram, 1 to 10000 (default 10000); later wake-ups
           count as overflows.
    -h, --help
           Show this text.
    --version
           Show the probe's version.

    FILE may be - for standard output (one output at most); the tables then
    go to standard error. An empty FILE ('') turns that output off. Every
    output is opened before the survey starts, and where each went is
    printed at the end.

    An option given again overrides the earlier one: the user's options
    after a script's defaults win (bash scripts/probe.sh --duration 60).

COMPARE
    quelta-probe compare A.json B.json shows two surveys saved with --json
    side by side: per series p50, p99 and max of A and of B with the ratio
    B/A (below 1: better in B), and each survey's machine stalls. It reads
    schema "quelta-probe/1" and refuses a file that is missing, not JSON or
    of another schema (exit status 1).

OUTPUT
    A table with one row per series: sample count, min, p50, p90, p99, p99.9
    and max of the lateness in microseconds, the ratio of the series' p99 to
    the baseline's p99, the p99 and max of the machine's longest stall
    around the series' samples, and a verdict: "as good as the machine"
    (within 1.1x or 5 us), "within 1.5x of the machine", "within 2x of the
    machine", "worse than the machine: ..." with the factor, or "not
    measured: ...". For the baseline and every series not as good as the
    machine the verdict adds "machine stalls explain the tail" (its p99 is
    within the baseline's p50 plus the stall p99 around it) or "tail N us
    beyond machine stalls". Then a table of call costs and notes. While the
    survey runs, a progress line is shown when standard output is a
    terminal.

EXIT STATUS
    0   the survey ran (or was ended by a signal); no wait returned early;
        series that need real-time privilege may be shown as not measured
    1   usage error: unknown option, missing or bad value; for compare, a
        file that is missing, not JSON or of another schema
    2   the library could not be loaded, lacks a symbol, or did not start
    3   a wait of the library returned before its deadline
    4   an output file could not be opened or written

EXAMPLES
    quelta-probe
           Ten seconds, tables on the terminal.
    quelta-probe --duration 60 --json probe.json --svg probe.svg
           A minute, with results for other tools and a plot.
    quelta-probe -d 0 --cpu 1 --histogram hist.txt --csv samples.csv
           A qualification run on CPU 1 (an isolated one, ideally) until
           Ctrl-C, with a summary line a minute.
    quelta-probe --json - | jq '.series[] | {name, p99, machine_stall_p99}'
           JSON to a pipe, the tables to the terminal.
    quelta-probe compare before.json after.json
           Two surveys saved with --json, before and after a change, side
           by side.
)";
}

}  // namespace qprobe
