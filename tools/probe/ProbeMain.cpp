// quelta-probe: how good is timing on this machine through libquelta.so.6,
// next to what the machine can do at all. See --help and docs/probe.md.
#include <sys/utsname.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>

#include "ProbeReport.h"
#include "SvgPlot.h"
#include "TraceExport.h"
#include "probe/LoadedQuelta.h"
#include "probe/ProbeOptions.h"
#include "probe/Survey.h"

#ifndef QUELTA_DEFAULT_SO
#define QUELTA_DEFAULT_SO "libquelta.so.6"
#endif
#ifndef QUELTA_PROBE_VERSION
#define QUELTA_PROBE_VERSION "unknown"
#endif

namespace {

using namespace qprobe;

// An output file can be written: it exists and is writable, or its
// directory is. Checked before the survey, so nobody waits for nothing.
bool CanWrite(const std::string& path, std::string& why) {
    if (access(path.c_str(), F_OK) == 0) {
        if (access(path.c_str(), W_OK) == 0) return true;
        why = std::strerror(errno);
        return false;
    }
    const std::size_t slash = path.rfind('/');
    const std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
    if (access(dir.c_str(), W_OK | X_OK) == 0) return true;
    why = "directory '" + dir + "': " + std::strerror(errno);
    return false;
}

bool WriteFile(const std::string& path, const std::string& text, const char* what) {
    std::ofstream f(path, std::ios::binary | std::ios::trunc);
    f << text;
    f.close();
    if (!f) {
        std::fprintf(stderr, "quelta-probe: cannot write the %s file '%s': %s\n", what, path.c_str(),
                     std::strerror(errno));
        return false;
    }
    return true;
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

}  // namespace

int main(int argc, char** argv) {
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
    // The library built beside this probe when it is still there; otherwise
    // (an installed probe) the system's libquelta.so.6, found as a runtime
    // finds it.
    std::string library = options.library;
    if (library.empty()) library = access(QUELTA_DEFAULT_SO, R_OK) == 0 ? QUELTA_DEFAULT_SO : "libquelta.so.6";

    const std::pair<const std::string*, const char*> outputs[] = {
        {&options.jsonPath, "--json"}, {&options.svgPath, "--svg"}, {&options.tracePath, "--trace"}};
    for (const auto& [path, flag] : outputs) {
        std::string why;
        if (!path->empty() && !CanWrite(*path, why)) {
            std::fprintf(stderr, "quelta-probe: cannot write %s file '%s': %s\n", flag, path->c_str(), why.c_str());
            return kExitOutput;
        }
    }

    LoadedQuelta lib;
    if (!lib.Load(library)) {
        std::fprintf(stderr, "quelta-probe: %s\n", lib.error().c_str());
        return kExitLibrary;
    }

    std::printf("quelta-probe %s: %d s survey of %s\n", QUELTA_PROBE_VERSION, options.durationS, library.c_str());
    std::fflush(stdout);

    SurveyConfig config;
    config.durationS = options.durationS;
    config.realtime = options.realtime;
    config.progress = isatty(STDOUT_FILENO) != 0;
    SurveyResult survey = RunSurvey(lib, config);

    qtools::ProbeReport report;
    report.machine = Machine(survey);
    report.library = library;
    report.tickService = survey.tickService;
    report.durationS = survey.surveyedS;
    std::vector<qtools::PlotSeries> plot;
    for (const SeriesSamples& s : survey.series) {
        qtools::SeriesResult r;
        r.name = SeriesName(s.id);
        r.description = SeriesDescription(s.id);
        r.summary = qtools::Summarize(s.latenessUs);
        r.failed = s.failed;
        r.overMs = s.overMs;
        r.cpuHeld = s.cpuHeld;
        report.series.push_back(r);
        plot.push_back(qtools::PlotSeries{r.name, s.latenessUs});
    }
    report.costs = survey.costs;
    report.notes = survey.notes;
    qtools::FinishVerdicts(report);

    const qtools::MachineInfo& m = report.machine;
    std::printf("machine: %u CPUs, %s %s, kernel %s; %s\n\n", m.cpus, m.arch.c_str(), m.kernelVersion.c_str(),
                m.kernel.c_str(),
                m.realtime ? ("SCHED_FIFO priority " + std::to_string(m.priority) +
                              (m.memoryLocked ? ", memory locked" : ", memory NOT locked"))
                                 .c_str()
                           : "NOT real-time (normal scheduling)");
    std::fputs(qtools::FormatSeriesTable(report).c_str(), stdout);
    std::printf("(tick: the library's tick grid is not visible from outside; it is rebuilt from the ticks,\n"
                " with the best tick placed at the baseline's minimum)\n\n");
    std::fputs(qtools::FormatCostTable(report).c_str(), stdout);
    if (!report.notes.empty()) {
        std::printf("\nnotes:\n");
        for (const std::string& n : report.notes) std::printf("  - %s\n", n.c_str());
    }

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
        std::printf("\n*** FAILURE: the library returned before the deadline: %s ***\n", which.c_str());
        std::fprintf(stderr, "quelta-probe: FAILURE: a wait returned early (%s)\n", which.c_str());
    }

    bool written = true;
    if (!options.jsonPath.empty()) written &= WriteFile(options.jsonPath, qtools::ReportToJson(report), "JSON");
    if (!options.svgPath.empty()) {
        qtools::PlotOptions po;
        po.title = "Wake-up lateness through libquelta.so.6";
        char sub[256];
        std::snprintf(sub, sizeof sub, "%.0f s survey, %u CPUs, %s kernel %s, %s", report.durationS, m.cpus,
                      m.arch.c_str(), m.kernel.c_str(), m.realtime ? "SCHED_FIFO" : "not real-time");
        po.subtitle = sub;
        written &= WriteFile(options.svgPath, qtools::RenderLatencyHistogram(plot, po), "SVG");
    }
    if (!options.tracePath.empty()) {
        const LogSnapshot& l = survey.log;
        qtools::LogReadOut readOut;
        readOut.count = l.count;
        readOut.timeLow = l.timeLow.data();
        readOut.timeHigh = l.timeHigh.data();
        readOut.events = l.events.data();
        readOut.data = l.data.data();
        qtools::TraceExportOptions to;
        to.processName = "quelta-probe (libquelta log)";
        to.cpuCount = m.cpus;
        written &= WriteFile(options.tracePath, qtools::ExportChromeTrace(readOut, DescribeProbeEvent, to), "trace");
    }
    lib.Unload();

    if (early > 0) return kExitEarly;
    return written ? kExitOk : kExitOutput;
}
