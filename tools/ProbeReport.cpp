#include "ProbeReport.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <iterator>
#include <limits>

#include <nlohmann/json.hpp>

namespace qtools {

namespace {

const SeriesResult* FindBaseline(const ProbeReport& r) {
    for (const SeriesResult& s : r.series) {
        if (s.name == "baseline") return &s;
    }
    return nullptr;
}


std::string Pad(const std::string& s, std::size_t width, bool right) {
    if (s.size() >= width) return s;
    const std::string fill(width - s.size(), ' ');
    return right ? fill + s : s + fill;
}

}  // namespace

std::string Cell(double v, const char* fmt) {
    if (!std::isfinite(v)) return "-";
    char buf[32];
    std::snprintf(buf, sizeof buf, fmt, v);
    return buf;
}

void FinishVerdicts(ProbeReport& report) {
    const SeriesResult* base = FindBaseline(report);
    const Summary none;
    const Summary& b = base ? base->summary : none;
    for (SeriesResult& s : report.series) {
        const bool isBase = &s == base;
        s.ratio = isBase ? (s.summary.count > 0 && s.summary.p99 > 0 ? 1.0
                                                                       : std::numeric_limits<double>::quiet_NaN())
                         : RatioP99(s.summary, b);
        s.verdict = s.measured ? VerdictFor(s.summary, b, isBase, s.failed) : "not measured: " + s.notMeasured;
        s.stallExplains = -1;
        if (s.measured) s.verdict += StallClause(s.summary, b, s.stall, isBase, s.stallExplains);
    }
}

std::size_t LibraryEarlyCount(const ProbeReport& report) {
    std::size_t n = 0;
    for (const SeriesResult& s : report.series) {
        if (s.name != "baseline") n += s.summary.early;
    }
    return n;
}

std::string ReportToJson(const ProbeReport& r) {
    using json = nlohmann::ordered_json;
    // Three decimals (ns) are all a microsecond value carries; NaN is null.
    auto number = [](double v, double scale = 1000.0) -> json {
        if (!std::isfinite(v)) return nullptr;
        return std::round(v * scale) / scale;
    };
    json doc = json::object();
    doc["schema"] = kProbeSchema;
    doc["machine"] = {{"cpus", r.machine.cpus},
                      {"kernel", r.machine.kernel},
                      {"kernel_version", r.machine.kernelVersion},
                      {"arch", r.machine.arch},
                      {"realtime", r.machine.realtime},
                      {"priority", r.machine.priority},
                      {"memory_locked", r.machine.memoryLocked}};
    doc["library"] = r.library;
    doc["tick_service"] = r.tickService;
    doc["timer_running"] = r.timerRunning;
    doc["duration_s"] = number(r.durationS);
    doc["interrupted"] = r.interrupted;
    doc["survey_cpus"] = r.surveyCpus.empty() ? json(nullptr) : json(r.surveyCpus);
    json series = json::array();
    for (const SeriesResult& s : r.series) {
        const Summary& m = s.summary;
        series.push_back({{"name", s.name},
                          {"description", s.description},
                          {"measured", s.measured},
                          {"not_measured_reason", s.measured ? json(nullptr) : json(s.notMeasured)},
                          {"unit", "us"},
                          {"count", m.count},
                          {"min", number(m.min)},
                          {"mean", number(m.mean)},
                          {"p50", number(m.p50)},
                          {"p90", number(m.p90)},
                          {"p99", number(m.p99)},
                          {"p999", number(m.p999)},
                          {"max", number(m.max)},
                          {"ratio_p99_to_baseline", number(s.ratio)},
                          {"verdict", s.verdict},
                          {"early", m.early},
                          {"failed", s.failed},
                          {"over_1ms", s.overMs},
                          {"over_1ms_cpu_held", s.cpuHeld >= 0 ? json(s.cpuHeld) : json(nullptr)},
                          {"machine_stall_count", s.stall.count},
                          {"machine_stall_p99", number(s.stall.p99)},
                          {"machine_stall_max", number(s.stall.max)},
                          {"machine_stalls_explain_tail",
                           s.stallExplains < 0 ? json(nullptr) : json(s.stallExplains == 1)}});
    }
    doc["series"] = std::move(series);
    const NoiseResult& n = r.noise;
    const bool on = n.mode != "off";
    doc["machine_noise"] = {
        {"mode", n.mode},
        {"cpu", n.cpu >= 0 ? json(n.cpu) : json(nullptr)},
        {"threshold_us", on ? number(n.thresholdUs) : json(nullptr)},
        {"window_us", n.mode == "windows" ? number(n.windowUs) : json(nullptr)},
        {"measured_s", number(n.measuredS)},
        {"stalls", n.stalls},
        {"stalled_fraction", n.measuredS > 0 ? number(n.stalledUs / (n.measuredS * 1e6), 1e6) : json(nullptr)},
        {"library_timer_us", n.libraryUs >= 0 ? number(n.libraryUs) : json(nullptr)},
        {"stall_p50", number(n.longest.p50)},
        {"stall_p99", number(n.longest.p99)},
        {"stall_max", number(n.longest.max)}};
    json costs = json::array();
    for (const CostResult& c : r.costs) {
        json cost = {{"name", c.name},
                     {"label", c.label},
                     {"slot", c.slot >= 0 ? json(c.slot) : json(nullptr)},
                     {"ns_per_call", number(c.nsPerCall, 100.0)}};
        if (c.baselineNs >= 0) cost["baseline_ns"] = number(c.baselineNs, 100.0);
        costs.push_back(std::move(cost));
    }
    doc["costs"] = std::move(costs);
    doc["notes"] = r.notes;
    return doc.dump(2) + "\n";
}

std::string FormatSeriesTable(const ProbeReport& r) {
    const char* heads[] = {"series", "count",    "min",       "p50",       "p90",    "p99",
                           "p99.9",  "max",      "p99/base", "stall p99", "stall max", "verdict"};
    std::vector<std::vector<std::string>> rows;
    rows.push_back(std::vector<std::string>(std::begin(heads), std::end(heads)));
    for (const SeriesResult& s : r.series) {
        const Summary& m = s.summary;
        rows.push_back({s.name, std::to_string(m.count), Cell(m.min), Cell(m.p50), Cell(m.p90), Cell(m.p99),
                        Cell(m.p999), Cell(m.max), Cell(s.ratio, "%.2fx"), Cell(s.stall.p99), Cell(s.stall.max),
                        s.verdict});
    }
    std::string out = "Lateness in microseconds (actual wake-up minus intended time)\n" + FormatColumns(rows);
    // Under the table: how the stall columns were measured.
    const NoiseResult& n = r.noise;
    if (n.mode == "off") return out;
    char where[96];
    if (n.mode == "windows") {
        std::snprintf(where, sizeof where, "in each %.0f us window after a sample, on the survey's CPU", n.windowUs);
    } else {
        std::snprintf(where, sizeof where, "during each sample, on spare CPU %d", n.cpu);
    }
    char buf[400];
    std::snprintf(buf, sizeof buf,
                  "stall: the machine's longest stall %s, seen by a thread spinning at the survey's priority;\n"
                  "       %zu gaps over %.0f us in %.1f s of spinning, %.3f %% of its time%s\n",
                  where, n.stalls, n.thresholdUs, n.measuredS,
                  n.measuredS > 0 ? 100.0 * n.stalledUs / (n.measuredS * 1e6) : 0.0,
                  n.libraryUs > 0 ? " (the library's timer thread's share left out)" : "");
    return out + buf;
}

std::string FormatColumns(const std::vector<std::vector<std::string>>& rows) {
    std::vector<std::size_t> width;
    for (const auto& row : rows) {
        width.resize(std::max(width.size(), row.size()), 0);
        for (std::size_t c = 0; c < row.size(); ++c) width[c] = std::max(width[c], row[c].size());
    }
    std::string out;
    for (std::size_t i = 0; i < rows.size(); ++i) {
        std::string line;
        for (std::size_t c = 0; c < rows[i].size(); ++c) {
            const bool last = c + 1 == rows[i].size();
            line += last ? rows[i][c] : Pad(rows[i][c], width[c], c > 0) + "  ";
        }
        line.erase(line.find_last_not_of(' ') + 1);
        out += line + "\n";
        if (i == 0) {
            std::size_t total = 0;
            for (std::size_t c = 0; c < width.size(); ++c) total += width[c] + (c + 1 < width.size() ? 2 : 0);
            out += std::string(total, '-') + "\n";
        }
    }
    return out;
}

std::string FormatCostTable(const ProbeReport& r) {
    std::size_t w = 4;
    for (const CostResult& c : r.costs) w = std::max(w, c.label.size());
    std::string out = "Cost per call in nanoseconds (median of batches)\n";
    out += Pad("call", w, false) + "  " + Pad("ns/call", 9, true) + "  " + "raw system call" + "\n";
    out += std::string(w + 2 + 9 + 2 + 15, '-') + "\n";
    for (const CostResult& c : r.costs) {
        std::string base;
        if (c.baselineNs >= 0) {
            base = Cell(c.baselineNs) + " ns";
            if (c.baselineNs > 0) base += " (" + Cell(c.nsPerCall / c.baselineNs, "%.2fx") + ")";
        }
        out += Pad(c.label, w, false) + "  " + Pad(Cell(c.nsPerCall), 9, true) + "  " + base + "\n";
    }
    return out;
}

}  // namespace qtools
