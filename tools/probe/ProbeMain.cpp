// quelta-probe: how good is timing on this machine through libquelta.so.6,
// next to what the machine can do at all. See --help, quelta-probe(1) and
// docs/probe.md.
#include <signal.h>
#include <sys/utsname.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <memory>
#include <string>

#include "HistogramFile.h"
#include "ProbeReport.h"
#include "SvgPlot.h"
#include "TraceExport.h"
#include "probe/Compare.h"
#include "probe/LoadedQuelta.h"
#include "probe/Monitor.h"
#include "probe/Outputs.h"
#include "probe/ProbeOptions.h"
#include "probe/Survey.h"

#ifndef QUELTA_PROBE_VERSION
#define QUELTA_PROBE_VERSION "unknown"
#endif

namespace {

using namespace qprobe;

// The library as a runtime finds it: the dynamic loader's search for
// libquelta.so.6. The one exception is a probe that runs from a CMake build
// tree (<build>/tools/quelta-probe, with <build>/CMakeCache.txt): it surveys
// the library built beside it, <build>/libquelta.so.6, found relative to the
// probe's own file. No path is compiled in, so an installed probe surveys
// the installed library.
std::string LibraryToLoad() {
    constexpr const char* kSoname = "libquelta.so.6";
    char self[4096];
    const ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
    if (n <= 0) return kSoname;
    std::string dir(self, static_cast<std::size_t>(n));
    dir = dir.substr(0, dir.rfind('/'));     // <build>/tools
    dir = dir.substr(0, dir.rfind('/') + 1);  // <build>/
    if (dir.empty() || access((dir + "CMakeCache.txt").c_str(), F_OK) != 0) return kSoname;
    const std::string built = dir + kSoname;
    return access(built.c_str(), R_OK) == 0 ? built : kSoname;
}

qtools::MachineInfo Machine(const SurveyResult& s) {
    qtools::MachineInfo m;
    const long cpus = sysconf(_SC_NPROCESSORS_ONLN);
    m.cpus = cpus > 0 ? static_cast<unsigned>(cpus) : 0;
    utsname u{};
    if (uname(&u) == 0) {
        m.kernel = u.release;
        m.kernelVersion = u.version;
        m.arch = u.machine;
    }
    m.realtime = s.realtime;
    m.priority = s.priority;
    m.memoryLocked = s.memoryLocked;
    return m;
}

// The CPUs that exist and are online; empty when that cannot be read.
std::vector<int> OnlineCpus() {
    std::ifstream f("/sys/devices/system/cpu/online");
    std::string line;
    std::vector<int> cpus;
    if (std::getline(f, line)) ParseCpuList(line, cpus);
    return cpus;
}

// A CPU for the machine-noise thread when the survey leaves one: with
// --cpu, on a machine of three CPUs or more (one is left for everything
// else), the highest online CPU this process may use outside the survey's;
// -1 when there is none.
int SpareCpu(const std::vector<int>& online, const std::vector<int>& surveyCpus) {
    if (surveyCpus.empty() || online.size() < 3) return -1;
    cpu_set_t allowed;
    CPU_ZERO(&allowed);
    if (sched_getaffinity(0, sizeof allowed, &allowed) != 0) return -1;
    for (auto c = online.rbegin(); c != online.rend(); ++c) {
        if (CPU_ISSET(*c, &allowed) && !std::binary_search(surveyCpus.begin(), surveyCpus.end(), *c)) return *c;
    }
    return -1;
}

qtools::ProbeReport MakeReport(SurveyResult& survey, const std::string& library, const ProbeOptions& options) {
    qtools::ProbeReport report;
    report.machine = Machine(survey);
    report.library = library;
    report.tickService = survey.tickService;
    report.timerRunning = survey.timerRunning;
    report.durationS = survey.surveyedS;
    report.interrupted = survey.interrupted;
    report.surveyCpus = options.cpus;
    for (const SeriesStats& s : survey.series) {
        qtools::SeriesResult r;
        r.name = SeriesName(s.id);
        r.description = SeriesDescription(s.id);
        r.measured = s.measured;
        r.notMeasured = s.notMeasured;
        r.summary = qtools::Summarize(s.histogram);
        r.failed = s.failed;
        r.overMs = s.overMs;
        r.cpuHeld = s.cpuHeld;
        // The tick runs throughout, so every window is around it.
        const NoiseFigures& noise = survey.noise;
        if (noise.mode != NoiseMode::Off) {
            r.stall = qtools::Summarize(s.id == kTick ? noise.all : noise.perSeries[s.id]);
        }
        report.series.push_back(r);
    }
    const NoiseFigures& n = survey.noise;
    qtools::NoiseResult& nr = report.noise;
    nr.mode = n.mode == NoiseMode::Off ? "off" : n.mode == NoiseMode::Windows ? "windows" : "spare-cpu";
    nr.cpu = n.cpu;
    nr.thresholdUs = static_cast<double>(kStallThresholdNs) / 1000.0;
    nr.windowUs = static_cast<double>(kNoiseWindowNs) / 1000.0;
    nr.measuredS = static_cast<double>(n.spunNs) / 1e9;
    nr.stalls = static_cast<std::size_t>(n.stalls);
    nr.stalledUs = static_cast<double>(n.stalledNs) / 1000.0;
    nr.libraryUs = n.libraryNs >= 0 ? static_cast<double>(n.libraryNs) / 1000.0 : -1.0;
    nr.longest = qtools::Summarize(n.all);
    report.costs = survey.costs;
    report.notes = survey.notes;
    qtools::FinishVerdicts(report);
    return report;
}

void PrintTables(FILE* out, const qtools::ProbeReport& report, const SurveyResult& survey) {
    const qtools::MachineInfo& m = report.machine;
    std::string sched = m.realtime ? "SCHED_FIFO priority " + std::to_string(m.priority) +
                                         (m.memoryLocked ? ", memory locked" : ", memory NOT locked")
                                   : "NOT real-time (normal scheduling)";
    std::fprintf(out, "machine: %u CPUs, %s %s, kernel %s; %s\n", m.cpus, m.arch.c_str(), m.kernelVersion.c_str(),
                 m.kernel.c_str(), sched.c_str());
    std::fprintf(out, "surveyed %.1f s%s\n\n", report.durationS, report.interrupted ? " (ended by a signal)" : "");
    std::fputs(qtools::FormatSeriesTable(report).c_str(), out);
    if (survey.timerRunning) {
        std::fprintf(out, "(tick: the library's tick grid is not visible from outside; it is rebuilt from the ticks,\n"
                          " with the best tick placed at the baseline's minimum)\n");
    } else {
        std::fprintf(out, "(not measured: without real-time privilege the library has no timer thread, and its\n"
                          " tick-service waits answer \"no timer\" at once, as documented; run as root or with\n"
                          " CAP_SYS_NICE or ulimit -r 99 to measure them)\n");
    }
    if (!report.costs.empty()) {
        std::fputs("\n", out);
        std::fputs(qtools::FormatCostTable(report).c_str(), out);
    }
    if (!report.notes.empty()) {
        std::fprintf(out, "\nnotes:\n");
        for (const std::string& n : report.notes) std::fprintf(out, "  - %s\n", n.c_str());
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc >= 2 && std::strcmp(argv[1], "compare") == 0) return RunCompare(argc - 2, argv + 2, stdout, stderr);

    // SIGINT and SIGTERM end the survey cleanly. They are blocked before any
    // thread exists (the library's timer thread included), so only this
    // thread takes them, through sigtimedwait in its loop.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGINT);
    sigaddset(&stopSignals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);

    ProbeOptions options;
    std::string error;
    switch (ParseOptions(argc, argv, options, error)) {
        case ParseOutcome::Help:
            std::fputs(ManualText(), stdout);
            return kExitOk;
        case ParseOutcome::Version:
            std::printf("quelta-probe %s\n", QUELTA_PROBE_VERSION);
            return kExitOk;
        case ParseOutcome::Error:
            std::fprintf(stderr, "quelta-probe: %s\nTry 'quelta-probe --help' for more information.\n",
                         error.c_str());
            return kExitUsage;
        case ParseOutcome::Run:
            break;
    }
    const std::vector<int> online = OnlineCpus();
    std::vector<std::pair<const char*, int>> chosen;
    for (int c : options.cpus) chosen.emplace_back("--cpu", c);
    if (options.noise == NoiseChoice::Cpu) chosen.emplace_back("--noise", options.noiseCpu);
    for (const auto& [flag, c] : chosen) {
        if (!online.empty() && !std::binary_search(online.begin(), online.end(), c)) {
            std::fprintf(stderr, "quelta-probe: %s: CPU %d is not online\n"
                                 "Try 'quelta-probe --help' for more information.\n", flag, c);
            return kExitUsage;
        }
    }

    // Every output is opened before anything else happens.
    OutputFile json("JSON", options.jsonPath), svg("SVG plot", options.svgPath), trace("trace", options.tracePath),
        csv("CSV samples", options.csvPath), histogram("histogram", options.histogramPath);
    OutputFile* outputs[] = {&json, &svg, &trace, &csv, &histogram};
    const char* flags[] = {"--json", "--svg", "--trace", "--csv", "--histogram"};
    for (std::size_t i = 0; i < std::size(outputs); ++i) {
        std::string why;
        if (outputs[i]->requested() && !outputs[i]->Open(why)) {
            std::fprintf(stderr, "quelta-probe: cannot write %s file '%s': %s\n", flags[i],
                         (i == 0 ? options.jsonPath : i == 1 ? options.svgPath : i == 2 ? options.tracePath
                                  : i == 3 ? options.csvPath : options.histogramPath).c_str(),
                         why.c_str());
            for (OutputFile* o : outputs) o->Abandon();
            return kExitOutput;
        }
    }
    bool anyToStdout = false;
    for (OutputFile* o : outputs) anyToStdout |= o->requested() && o->toStdout();
    // A person's text goes where it does not mix with data.
    FILE* human = anyToStdout ? stderr : stdout;

    const std::string library = options.library.empty() ? LibraryToLoad() : options.library;
    LoadedQuelta lib;
    if (!lib.Load(library)) {
        std::fprintf(stderr, "quelta-probe: %s\n", lib.error().c_str());
        for (OutputFile* o : outputs) o->Abandon();
        return kExitLibrary;
    }
    const std::string resolved = lib.ResolvedPath();
    const int interval = options.intervalS >= 0 ? options.intervalS
                                                 : (options.durationS == 0 ? kDefaultIntervalUntilInterrupted : 0);
    const std::string span = options.durationS == 0 ? std::string("survey until interrupted (Ctrl-C ends it)")
                                                    : (options.durationS < 60 ? std::to_string(options.durationS) + " s"
                                                                               : Clock(static_cast<double>(options.durationS))) +
                                                          " survey";
    std::fprintf(human, "quelta-probe %s: %s of %s\n", QUELTA_PROBE_VERSION, span.c_str(), resolved.c_str());
    std::fflush(human);

    SurveyConfig config;
    config.durationS = options.durationS;
    config.realtime = options.realtime;
    config.priority = options.priority;
    config.cpus = options.cpus;
    const int spare = options.noise == NoiseChoice::Cpu    ? options.noiseCpu
                      : options.noise == NoiseChoice::Auto ? SpareCpu(online, options.cpus)
                                                           : -1;
    config.noise = options.noise == NoiseChoice::Off ? NoiseMode::Off
                   : spare >= 0                      ? NoiseMode::SpareCpu
                                                     : NoiseMode::Windows;
    config.noiseCpu = spare;
    Survey survey(lib, config);
    Monitor monitor(csv.requested() ? csv.stream() : nullptr);
    if (!survey.Start()) {
        std::fprintf(stderr, "quelta-probe: could not start the survey thread\n");
        for (OutputFile* o : outputs) o->Abandon();
        return kExitLibrary;
    }

    // The main thread's loop: signals, the samples handed over, progress.
    const bool progress = isatty(fileno(human)) != 0;
    int lastLength = 0;
    auto clearProgress = [&] {
        if (lastLength > 0) std::fprintf(human, "\r%*s\r", lastLength, "");
        lastLength = 0;
    };
    double nextLineS = interval;
    bool stopping = false;
    while (!survey.Done()) {
        const timespec pause{0, 200 * 1000000L};
        const int sig = sigtimedwait(&stopSignals, nullptr, &pause);
        if (sig > 0 && !stopping) {
            stopping = true;
            survey.RequestStop();
            clearProgress();
            std::fprintf(human, "quelta-probe: %s: stopping the survey, then writing the results "
                                "(a second signal aborts)\n", strsignal(sig));
            std::fflush(human);
            pthread_sigmask(SIG_UNBLOCK, &stopSignals, nullptr);  // the next one takes its default action
        }
        survey.Poll(&monitor);
        const double elapsed = survey.ElapsedS();
        if (interval > 0 && survey.Phase() == 1 && elapsed >= nextLineS) {
            clearProgress();
            std::fprintf(human, "%s\n", monitor.IntervalLine(elapsed, interval).c_str());
            std::fflush(human);
            while (nextLineS <= elapsed) nextLineS += interval;
        }
        if (!progress) continue;
        char line[160];
        switch (survey.Phase()) {
            case 0: std::snprintf(line, sizeof line, "preparing ..."); break;
            case 1:
                if (options.durationS == 0) {
                    std::snprintf(line, sizeof line, "surveying: %s, %llu samples (Ctrl-C ends it)",
                                  Clock(elapsed).c_str(), static_cast<unsigned long long>(survey.Samples()));
                } else {
                    std::snprintf(line, sizeof line, "surveying: %s / %s, %llu samples", Clock(elapsed).c_str(),
                                  Clock(static_cast<double>(options.durationS)).c_str(),
                                  static_cast<unsigned long long>(survey.Samples()));
                }
                break;
            default: std::snprintf(line, sizeof line, "measuring call costs ..."); break;
        }
        const int length = static_cast<int>(std::strlen(line));
        std::fprintf(human, "\r%s%*s", line, std::max(0, lastLength - length), "");
        std::fflush(human);
        lastLength = length;
    }
    SurveyResult result = survey.Finish(&monitor);
    if (progress) clearProgress();
    if (interval > 0 && result.surveyedS >= interval) {
        std::fprintf(human, "%s\n", monitor.IntervalLine(result.surveyedS, interval).c_str());
    }
    std::fputs("\n", human);

    qtools::ProbeReport report = MakeReport(result, resolved, options);
    PrintTables(human, report, result);

    const std::size_t early = qtools::LibraryEarlyCount(report);
    if (early > 0) {
        std::string which;
        for (const qtools::SeriesResult& s : report.series) {
            if (s.name == "baseline" || s.summary.early == 0) continue;
            char buf[160];
            std::snprintf(buf, sizeof buf, "%s%s %zu time(s), by up to %.1f us", which.empty() ? "" : "; ",
                          s.name.c_str(), s.summary.early, -s.summary.min);
            which += buf;
        }
        std::fprintf(human, "\n*** FAILURE: the library returned before the deadline: %s ***\n", which.c_str());
        if (human != stderr) {
            std::fprintf(stderr, "quelta-probe: FAILURE: a wait returned early (%s)\n", which.c_str());
        }
    }

    // The files, for what was measured.
    std::vector<qtools::HistogramColumn> columns;
    std::vector<qtools::PlotSeries> plot;
    for (const SeriesStats& s : result.series) {
        columns.push_back({SeriesName(s.id), &s.histogram, s.measured});
        plot.push_back({SeriesName(s.id), &s.histogram, s.measured, "not measured: " + s.notMeasured});
    }
    const qtools::MachineInfo& m = report.machine;
    bool written = true;
    std::vector<std::pair<const OutputFile*, std::string>> wrote;
    auto finish = [&](OutputFile& f, const std::string& text) {
        if (!f.requested()) return;
        std::string why;
        if (f.Finish(text, why)) {
            wrote.emplace_back(&f, f.Where());
        } else {
            std::fprintf(stderr, "quelta-probe: cannot write the %s file '%s': %s\n", f.what().c_str(),
                         f.Where().c_str(), why.c_str());
            written = false;
        }
    };
    finish(json, qtools::ReportToJson(report));
    if (svg.requested()) {
        qtools::PlotOptions po;
        po.title = "Wake-up lateness through libquelta.so.6: how often a wake is later than x";
        char sub[256];
        std::snprintf(sub, sizeof sub, "%.0f s survey, %u CPUs, %s, kernel %s, %s", report.durationS, m.cpus,
                      m.arch.c_str(), m.kernel.c_str(),
                      m.realtime ? ("SCHED_FIFO " + std::to_string(m.priority)).c_str() : "not real-time");
        po.subtitle = sub;
        finish(svg, qtools::RenderTailPlot(plot, po));
    }
    if (trace.requested()) {
        const LogSnapshot& l = result.log;
        qtools::LogReadOut readOut;
        readOut.count = l.count;
        readOut.timeLow = l.timeLow.data();
        readOut.timeHigh = l.timeHigh.data();
        readOut.events = l.events.data();
        readOut.data = l.data.data();
        qtools::TraceExportOptions to;
        to.processName = "quelta-probe (libquelta log)";
        to.cpuCount = m.cpus;
        // Late: later than the machine's own p99 in this run.
        const double baseP99 = report.series.empty() ? NAN : report.series[kBaseline].summary.p99;
        const double lateUs = std::isfinite(baseP99) ? baseP99 : 1000.0;
        finish(trace, qtools::ExportChromeTrace(readOut, ProbeEventDescriber(lateUs), to));
    }
    if (monitor.csvFailed()) {
        std::fprintf(stderr, "quelta-probe: cannot write the CSV samples file '%s': %s\n", csv.Where().c_str(),
                     std::strerror(errno));
        written = false;
    } else {
        finish(csv, "");
    }
    finish(histogram, qtools::FormatHistogramFile(columns, options.histogramMaxUs,
                                                  std::string("quelta-probe ") + QUELTA_PROBE_VERSION +
                                                      " latency histogram of " + resolved));
    if (!wrote.empty()) {
        std::fprintf(human, "\nfiles:\n");
        for (const auto& [f, where] : wrote) std::fprintf(human, "  %-12s %s\n", f->what().c_str(), where.c_str());
    }
    std::fflush(human);
    lib.Unload();

    if (early > 0) return kExitEarly;
    return written ? kExitOk : kExitOutput;
}
