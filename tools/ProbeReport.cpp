#include "ProbeReport.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <iterator>
#include <limits>

#include "JsonWriter.h"

namespace qtools {

namespace {

const SeriesResult* FindBaseline(const ProbeReport& r) {
    for (const SeriesResult& s : r.series) {
        if (s.name == "baseline") return &s;
    }
    return nullptr;
}

std::string Cell(double v, const char* fmt = "%.1f") {
    if (!std::isfinite(v)) return "-";
    char buf[32];
    std::snprintf(buf, sizeof buf, fmt, v);
    return buf;
}

std::string Pad(const std::string& s, std::size_t width, bool right) {
    if (s.size() >= width) return s;
    const std::string fill(width - s.size(), ' ');
    return right ? fill + s : s + fill;
}

}  // namespace

void FinishVerdicts(ProbeReport& report) {
    const SeriesResult* base = FindBaseline(report);
    const Summary none;
    const Summary& b = base ? base->summary : none;
    for (SeriesResult& s : report.series) {
        const bool isBase = &s == base;
        s.ratio = isBase ? (s.summary.count > 0 && s.summary.p99 > 0 ? 1.0
                                                                       : std::numeric_limits<double>::quiet_NaN())
                         : RatioP99(s.summary, b);
        s.verdict = VerdictFor(s.summary, b, isBase, s.failed);
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
    JsonWriter w(2);
    w.BeginObject();
    w.Key("schema").String(kProbeSchema);
    w.Key("machine").BeginObject();
    w.Key("cpus").Unsigned(r.machine.cpus);
    w.Key("kernel").String(r.machine.kernel);
    w.Key("kernel_version").String(r.machine.kernelVersion);
    w.Key("arch").String(r.machine.arch);
    w.Key("realtime").Bool(r.machine.realtime);
    w.Key("priority").Integer(r.machine.priority);
    w.Key("memory_locked").Bool(r.machine.memoryLocked);
    w.EndObject();
    w.Key("library").String(r.library);
    w.Key("tick_service").Bool(r.tickService);
    w.Key("duration_s").Number(r.durationS, 3);
    w.Key("series").BeginArray();
    for (const SeriesResult& s : r.series) {
        const Summary& m = s.summary;
        w.BeginObject();
        w.Key("name").String(s.name);
        w.Key("description").String(s.description);
        w.Key("unit").String("us");
        w.Key("count").Unsigned(m.count);
        w.Key("min").Number(m.min, 3);
        w.Key("p50").Number(m.p50, 3);
        w.Key("p90").Number(m.p90, 3);
        w.Key("p99").Number(m.p99, 3);
        w.Key("p999").Number(m.p999, 3);
        w.Key("max").Number(m.max, 3);
        w.Key("ratio_p99_to_baseline").Number(s.ratio, 3);
        w.Key("verdict").String(s.verdict);
        w.Key("early").Unsigned(m.early);
        w.Key("failed").Unsigned(s.failed);
        w.Key("over_1ms").Unsigned(s.overMs);
        if (s.cpuHeld >= 0) {
            w.Key("over_1ms_cpu_held").Integer(s.cpuHeld);
        } else {
            w.Key("over_1ms_cpu_held").Null();
        }
        w.EndObject();
    }
    w.EndArray();
    w.Key("costs").BeginArray();
    for (const CostResult& c : r.costs) {
        w.BeginObject();
        w.Key("name").String(c.name);
        w.Key("label").String(c.label);
        if (c.slot >= 0) {
            w.Key("slot").Integer(c.slot);
        } else {
            w.Key("slot").Null();
        }
        w.Key("ns_per_call").Number(c.nsPerCall, 2);
        if (c.baselineNs >= 0) w.Key("baseline_ns").Number(c.baselineNs, 2);
        w.EndObject();
    }
    w.EndArray();
    w.Key("notes").BeginArray();
    for (const std::string& n : r.notes) w.String(n);
    w.EndArray();
    w.EndObject();
    return w.str() + "\n";
}

std::string FormatSeriesTable(const ProbeReport& r) {
    const char* heads[] = {"series", "count", "min", "p50", "p90", "p99", "p99.9", "max", "p99/base", "verdict"};
    std::vector<std::vector<std::string>> rows;
    rows.push_back(std::vector<std::string>(std::begin(heads), std::end(heads)));
    for (const SeriesResult& s : r.series) {
        const Summary& m = s.summary;
        rows.push_back({s.name, std::to_string(m.count), Cell(m.min), Cell(m.p50), Cell(m.p90), Cell(m.p99),
                        Cell(m.p999), Cell(m.max), Cell(s.ratio, "%.2fx"), s.verdict});
    }
    std::vector<std::size_t> width(std::size(heads), 0);
    for (const auto& row : rows) {
        for (std::size_t c = 0; c < row.size(); ++c) width[c] = std::max(width[c], row[c].size());
    }
    std::string out = "Lateness in microseconds (actual wake-up minus intended time)\n";
    for (std::size_t i = 0; i < rows.size(); ++i) {
        std::string line;
        for (std::size_t c = 0; c < rows[i].size(); ++c) {
            const bool last = c + 1 == rows[i].size();
            line += last ? rows[i][c] : Pad(rows[i][c], width[c], c > 0) + "  ";
        }
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
