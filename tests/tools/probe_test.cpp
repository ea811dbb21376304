// quelta-probe: its pieces on fixed inputs, then the probe run as its users run it.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <numeric>
#include <random>
#include <regex>
#include <sstream>
#include <thread>

#include <nlohmann/json.hpp>

#include "HistogramFile.h"
#include "ProbeReport.h"
#include "SvgPlot.h"
#include "TestSupport.h"
#include "TickGrid.h"
#include "TraceExport.h"

using namespace qtools;
using nlohmann::json;

namespace {

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}
std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> out;
    std::istringstream in(text);
    for (std::string l; std::getline(in, l);) out.push_back(l);
    return out;
}
bool Has(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }
bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }
void SleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

Summary WithP99(double p99, double p50 = 1.0) {
    Summary s;
    s.count = 1000, s.min = 0.5, s.p50 = p50;
    s.p90 = s.p99 = s.p999 = s.max = p99;
    return s;
}
int Count(const std::string& s, const std::string& what) {
    int n = 0;
    for (std::size_t p = s.find(what); p != std::string::npos; p = s.find(what, p + 1)) ++n;
    return n;
}

// Nearest rank whatever the order (p99.9 of 1000 is the 999th); only negatives early (NAN: not checked).
TEST(ProbeStats, SummaryByNearestRank) {
    std::vector<double> shuffled(100), thousand(1000), tenths;
    std::iota(shuffled.begin(), shuffled.end(), 1.0), std::iota(thousand.begin(), thousand.end(), 1.0);
    std::shuffle(shuffled.begin(), shuffled.end(), std::mt19937(7));
    for (int i = 1; i <= 10; ++i) tenths.push_back(12.0 + i / 10.0);
    const std::pair<std::vector<double>, std::vector<double>> cases[] = {  // count min p50 p90 p99 p999 max early
        {shuffled, {100, 1, 50, 90, 99, 100, 100, 0}},  {thousand, {1000, 1, 500, 900, 990, 999, 1000, 0}},
        {{4, 1, 3, 2}, {4, 1, 2, 4, 4, 4, 4, 0}},        {{7.5}, {1, 7.5, 7.5, 7.5, 7.5, 7.5, 7.5, 0}},
        {tenths, {10, 12.1, 12.5, 12.9, 13, 13, 13, 0}}, {{3, -0.5, 0, -12.25}, {4, -12.25, NAN, 3, 3, 3, 3, 2}}};
    for (const auto& [values, want] : cases) {
        const Summary s = Summarize(values);
        const std::vector<double> got{double(s.count), s.min, s.p50, s.p90, s.p99, s.p999, s.max, double(s.early)};
        for (std::size_t i = 0; i < got.size(); ++i) {
            if (!std::isnan(want[i])) { EXPECT_NEAR(got[i], want[i], 1e-9) << values.size() << " " << i; }
        }
    }
    EXPECT_DOUBLE_EQ(Summarize({1, 2, 3, 6}).mean, 3.0);
    const Summary e = Summarize(std::vector<double>{});
    EXPECT_TRUE(!e.count && std::isnan(e.min) && std::isnan(e.p99) && std::isnan(e.max) && std::isnan(e.mean) &&
                std::isnan(RatioP99(e, WithP99(100))));
    EXPECT_DOUBLE_EQ(RatioP99(WithP99(300), WithP99(100)), 3.0);
}

// Logarithmic buckets beyond 10 ms (within 1.2 %), exact maximum and fine-bucket counts; merge keeps all.
TEST(ProbeStats, HistogramLongTailsAndMerge) {
    LatencyHistogram h, other;
    for (int i = 0; i < 900; ++i) h.Add(50.0);
    for (int i = 1; i <= 100; ++i) h.Add(10000.0 * i);
    EXPECT_TRUE(h.count() == 1000u && h.max() == 1e6 && std::abs(h.Percentile(0.95) - 500000.0) <= 6000.0 &&
                std::abs(h.Percentile(0.999) - 990000.0) <= 11880.0) << h.Percentile(0.95) << " " << h.Percentile(0.999);
    EXPECT_TRUE(h.CountAbove(49.9) == 1000u && h.CountAbove(50.0) == 100u && h.CountAbove(5000.0) == 100u);
    EXPECT_EQ(h.CountInFine(500, 501), 900u);  // 50.0 us in its 0.1 us bucket
    other.Add(-3.0), other.Add(2e9);  // beyond every bucket: still counted, still the maximum
    h.Merge(other);
    EXPECT_TRUE(h.count() == 1002u && h.early() == 1u && h.min() == -3.0 && h.max() == 2e9);
}

// Verdicts: p99 against the baseline's; early values fail whatever the tail.
TEST(ProbeStats, VerdictsAndStalls) {
    const Summary base = WithP99(100, 50), early = Summarize({3, -0.5, 0, -12.25});
    const struct { Summary s; bool isBase; int failed; const char* verdict; } cases[] = {
        {base, true, 0, "the machine's own limit"}, {WithP99(80, 50), false, 0, "as good as the machine"},
        {WithP99(110, 50), false, 0, "as good as the machine"}, {WithP99(100, 60), false, 0, "as good as the machine"},
        {WithP99(140, 50), false, 0, "within 1.5x of the machine"}, {WithP99(160, 50), false, 0, "within 2x of the machine"},
        {WithP99(300, 50), false, 0, "worse than the machine: p99 3.0x the baseline's (+200.0 us)"},
        {WithP99(100, 120), false, 0, "as good as the machine; typical wake-up +70.0 us"},
        {base, false, 3, "as good as the machine; 3 calls failed"}, {Summarize(std::vector<double>{}), false, 0, "no samples"},
        {early, false, 0, "FAILED: returned early 2 times (by up to 12.2 us)"},
    };
    for (const auto& c : cases) EXPECT_EQ(VerdictFor(c.s, base, c.isBase, c.failed), c.verdict);
    EXPECT_EQ(VerdictFor(WithP99(6), WithP99(2), false), "as good as the machine");  // tiny baseline: not "3x"
    EXPECT_EQ(VerdictFor(early, early, true).rfind("MACHINE FAULT", 0), 0u);

    // Stalls explain a tail within the baseline's p50 plus the stall p99; said
    // of the baseline and of series not as good as the machine, with figures.
    const struct { Summary series, stall; bool isBaseline; int explained; const char* clause; } stalls[] = {
        {WithP99(140), WithP99(90), false, 1, "; machine stalls explain the tail (stall p99 90.0 us around it)"},
        {WithP99(300), WithP99(100), false, 0, "; tail 150.0 us beyond machine stalls (stall p99 100.0 us around it)"},
        {base, WithP99(20), true, 0, "; tail 30.0 us beyond machine stalls (stall p99 20.0 us around it)"},
        {WithP99(105), WithP99(900), false, -1, ""},
        {WithP99(300), Summarize(std::vector<double>{}), false, -1, ""},
    };
    for (const auto& c : stalls) {
        int explained = 7;
        EXPECT_EQ(StallClause(c.series, base, c.stall, c.isBaseline, explained), c.clause);
        EXPECT_EQ(explained, c.explained) << c.clause;
    }
}

// Ticks by the library's rule (restarting after a tick a period late) give back the true lateness, never < 0.
TEST(ProbeTickGrid, RecoversTheTrueLateness) {
    std::vector<int64_t> random, missed(40, 50000), stretch(400, 60000);
    std::mt19937 rng(3);
    for (int k = 0; k < 2000; ++k) random.push_back(20000 + static_cast<int64_t>(rng() % 300000));
    random[700] = 20000;
    missed[0] = 30000, missed[10] = 3500000, missed[11] = 4000;
    stretch[0] = 30000, stretch[50] = 2500000, stretch[51] = 3000, stretch[300] = 30000;
    const struct { std::vector<int64_t> late; double floorUs; std::size_t restarts, checkFrom, nudged; } cases[] = {
        {random, 20.0, 0, 0, 0}, {missed, 30.0, 1, 0, 0}, {stretch, 30.0, 1, 51, 50}};  // nudged: callback 20 us on
    for (const auto& c : cases) {
        std::vector<uint64_t> times;
        std::size_t restarts = 0;
        uint64_t due = 5000000123456ull;
        for (int64_t late : c.late) {
            times.push_back(due + static_cast<uint64_t>(late));
            due += 1000000;
            if (due < times.back()) due = times.back(), ++restarts;
        }
        ASSERT_EQ(restarts, c.restarts);
        if (c.nudged != 0) times[c.nudged] += 20000;
        const auto r = TickLateness(times, 1000000, c.floorUs);
        ASSERT_EQ(r.latenessUs.size(), c.late.size());
        EXPECT_EQ(r.restarts, c.restarts);
        for (std::size_t k = c.checkFrom; k < c.late.size(); ++k) ASSERT_NEAR(r.latenessUs[k], c.late[k] / 1000.0, 1e-6) << k;
    }
    EXPECT_TRUE(TickLateness({}, 1000000, 10.0).latenessUs.empty());
    const std::vector<uint64_t> odd{1000000000, 1001200000, 1001300000, 1003900000, 1003950000, 1005000000};
    const auto r = TickLateness(odd, 1000000, std::nan(""));
    ASSERT_EQ(r.latenessUs.size(), odd.size());
    for (double v : r.latenessUs) EXPECT_GE(v, 0.0);
}

// A row per microsecond, a column per series (zeros when not measured), then the '#' summary lines.
TEST(ProbeHistogramFile, RowsColumnsAndSummary) {
    LatencyHistogram a, b, off;
    for (double v : {0.4, 0.96, 1.0, 1.94, 2.0, 4.99, 7.0}) a.Add(v);
    for (double v : {3.0, 12.0, 9000.0, -1.5}) b.Add(v);  // two overflow, one early
    off.Add(1.0);
    const std::string text =
        FormatHistogramFile({{"baseline", &a, true}, {"plain-wait", &b, true}, {"tick", &off, false}}, 10, "title here");
    std::string want = "# title here\n";
    for (int i = 0; i < 10; ++i) want += "00000" + std::to_string(i) + "\t00000" + "1310010100"[i] + "\t00000" + "0001000000"[i] + "\t000000\n";
    want += "# Total: 000000007 000000003 000000000\n# Min Latencies: 00000 00003 00000\n# Avg Latencies: 00003 02253 00000\n"
            "# Max Latencies: 00007 09000 00000\n# Histogram Overflows: 000000000 000000002 000000000\n"
            "# Early Returns: 00000 00001 00000\n";
    std::string kept;  // the rows and the summary lines, in order
    std::istringstream in(text);
    for (std::string l; std::getline(in, l);) {
        if (l[0] != '#' || std::regex_search(l, std::regex("^# (title|Total|Min|Avg|Max|Histogram|Early)"))) kept += l + "\n";
    }
    EXPECT_EQ(kept, want);
    EXPECT_TRUE(Has(text, "\n# columns: us baseline plain-wait tick\n") && Has(text, "\n# not measured (all zero): tick\n"));
}

ProbeReport SampleReport() {
    ProbeReport r;
    r.machine = {2, "6.1.0-rt", "#1 SMP PREEMPT_RT", "armv7l", true, 98, false};
    r.library = "/opt/lib/libquelta.so.6";
    r.durationS = 10.0, r.timerRunning = false, r.interrupted = true, r.surveyCpus = {1, 3};
    auto series = [](const char* name, std::vector<double> v, std::size_t failed, long held) {
        SeriesResult s;
        s.name = name, s.description = std::string("about ") + name;
        s.summary = Summarize(v), s.failed = failed, s.cpuHeld = held;
        return s;
    };
    SeriesResult wait = series("plain-wait", {15, 25, 35, 55, 1500, 2500.1234}, 0, 1), off = series("tick", {}, 0, -1);
    wait.overMs = 2;
    wait.stall = Summarize(std::vector<double>{3, 2600});
    r.noise.mode = "windows", r.noise.thresholdUs = 5, r.noise.windowUs = 200, r.noise.measuredS = 2;
    r.noise.stalledUs = 1000, r.noise.longest = wait.stall;
    off.measured = false, off.notMeasured = "needs the library's timer";
    r.series = {series("baseline", {10, 20, 30, 40}, 0, 0), wait, series("event-own-sem", {}, 7, -1), off};
    r.costs.push_back({"clock_gettime_monotonic", "clock_gettime(CLOCK_MONOTONIC)", -1, 20.5, -1.0});
    r.costs.push_back({"read_monotonic0", "engine ReadMonotonic0 (slot 0)", 0, 22.34, 20.5});
    r.notes.push_back("a note");
    FinishVerdicts(r);
    return r;
}

// Every series with every key; three decimals of a us; NaN is null; a cost's baseline only when measured.
TEST(ProbeJson, ReportFollowsTheSchema) {
    const std::string text = ReportToJson(SampleReport());
    ASSERT_EQ(text.back(), '\n');
    const json v = json::parse(text);
    ASSERT_EQ(v["series"].size(), 4u);
    for (const char* key : {"name", "measured", "unit", "count", "min", "mean", "p50", "p90", "p99", "p999", "max",
                            "ratio_p99_to_baseline", "verdict", "early", "failed", "over_1ms", "machine_stall_count",
                            "machine_stall_p99", "machine_stall_max", "machine_stalls_explain_tail"}) {
        for (const json& s : v["series"]) EXPECT_TRUE(s.contains(key)) << key;
    }
    const std::pair<const char*, json> want[] = {
        {"/schema", "quelta-probe/1"}, {"/machine/kernel", "6.1.0-rt"}, {"/machine/cpus", 2}, {"/notes/0", "a note"},
        {"/survey_cpus", {1, 3}}, {"/duration_s", 10.0}, {"/series/1/unit", "us"},
        {"/series/1/max", 2500.123}, {"/series/1/p50", 35.0}, {"/series/1/ratio_p99_to_baseline", 62.503},
        {"/series/0/ratio_p99_to_baseline", 1.0}, {"/series/1/over_1ms", 2}, {"/series/1/over_1ms_cpu_held", 1},
        {"/series/1/machine_stall_p99", 2600.0}, {"/series/1/machine_stalls_explain_tail", true},
        {"/series/0/machine_stall_p99", nullptr}, {"/series/0/machine_stalls_explain_tail", nullptr},
        {"/machine_noise/mode", "windows"}, {"/machine_noise/stalled_fraction", 0.0005},
        {"/machine_noise/stall_max", 2600.0}, {"/machine_noise/cpu", nullptr}, {"/machine_noise/library_timer_us", nullptr},
        {"/series/2/count", 0}, {"/series/2/p99", nullptr}, {"/series/2/ratio_p99_to_baseline", nullptr},
        {"/series/2/over_1ms_cpu_held", nullptr}, {"/series/2/failed", 7}, {"/series/2/measured", true},
        {"/series/3/measured", false}, {"/series/3/not_measured_reason", "needs the library's timer"},
        {"/series/3/verdict", "not measured: needs the library's timer"}, {"/costs/0/slot", nullptr},
        {"/costs/1/slot", 0}, {"/costs/1/baseline_ns", 20.5}};
    for (const auto& [path, value] : want) EXPECT_EQ(v.value(json::json_pointer(path), json("absent")), value) << path;
    EXPECT_TRUE(!v["costs"][0].contains("baseline_ns") && Has(v["series"][1]["verdict"], "machine stalls explain the tail"));

    const std::string t = FormatSeriesTable(SampleReport()) + FormatCostTable(SampleReport());
    for (const char* shown : {"baseline", "plain-wait", "event-own-sem", "2500.1", "62.50x", "stall max", "22.3", "1.09x",
                              "in each 200 us window after a sample", "no samples; 7 calls failed",
                              "not measured: needs the library's timer"})
        EXPECT_TRUE(Has(t, shown)) << shown;
}


// Falling curves inside the image, the baseline's last (on top), a p99 marker each, escaped names, axes.
TEST(ProbeSvg, TailPlotWithTheBaselineOnTop) {
    LatencyHistogram base, wait, tick, odd;  // evenly spread: 20..900, 25..1500, 0..4000 us
    for (int i = 0; i < 3000; ++i) tick.Add(4000.0 * i / 2999);
    for (int i = 0; i < 500; ++i) base.Add(20 + 880.0 * i / 499), wait.Add(25 + 1475.0 * i / 499);
    for (double v : {-3.0, 5.0, 7.0, 2.5e6}) odd.Add(v);
    const PlotOptions options;
    const std::string svg = RenderTailPlot({{"baseline", &base, true, ""}, {"plain-wait", &wait, true, ""},
                                            {"tick", &tick, true, ""}, {"a <b> & \"c\"", &odd, true, ""},
                                            {"event-own-sem", nullptr, false, "not measured: no timer"}}, options);
    const std::string file = testing::TempDir() + "probe.svg";
    std::ofstream(file) << svg;
    EXPECT_EQ(std::system(("! command -v python3 >/dev/null || python3 -c 'import xml.dom.minidom as m,sys; "
                           "m.parse(sys.argv[1])' " + file).c_str()), 0);
    std::vector<std::string> names;  // each curve falls (y grows downwards) as x grows, inside the image
    const std::regex curve("<polyline class=\"curve curve-([^\"]*)\"[^>]*points=\"([^\"]*)\""), pt("(-?[0-9.]+),(-?[0-9.]+)");
    for (std::sregex_iterator it(svg.begin(), svg.end(), curve), end; it != end; ++it) {
        const std::string list = (*it)[2];
        double px = 0, py = 0, n = 0;
        for (std::sregex_iterator p(list.begin(), list.end(), pt); p != end; ++p, ++n) {
            const double x = std::stod((*p)[1]), y = std::stod((*p)[2]);
            EXPECT_TRUE(x >= px && y >= py && x <= options.width && y <= options.height) << (*it)[1] << " " << x << "," << y;
            px = x, py = y;
        }
        names.push_back((*it)[1].str() + (n > 3 ? "" : " (few points)"));
    }
    EXPECT_TRUE(names == std::vector<std::string>({"plain-wait", "tick", "a__b_____c_", "baseline"}) && Count(svg, "<polyline") == 4);
    for (const char* text : {"a &lt;b&gt; &amp; &quot;c&quot;", "1 early, not plotted", "not measured: no timer",
                             "event-own-sem", "lateness x", "wakes later than x", ">1 µs<", ">1 s<", ">100 %<",
                             ">1 %<", ">0.01 %<", "891.2 µs", "1.49 ms (1.67×)"}) {
        EXPECT_GT(Count(svg, text), 0) << text;
    }
    // The baseline's marker (p99 891.2 us) left of plain-wait's.
    EXPECT_EQ(Count(svg, "class=\"p99 p99-"), 4);
    std::smatch c, d;
    ASSERT_TRUE(std::regex_search(svg, c, std::regex("class=\"p99 p99-plain-wait\" cx=\"([0-9.]+)\"")));
    ASSERT_TRUE(std::regex_search(svg, d, std::regex("class=\"p99 p99-baseline\" points=\"([0-9.]+),")));
    EXPECT_LT(std::stod(d[1]), std::stod(c[1]));
}

// A log read-out (ascending time, CPU in bits 8-15 of the event word).
struct Entries {
    std::vector<uint32_t> lo, hi, ev, data;
    void Add(uint64_t t, uint32_t event, uint32_t d = 0xFFFFFFFFu) {
        lo.push_back(static_cast<uint32_t>(t)), hi.push_back(static_cast<uint32_t>(t >> 32)), ev.push_back(event), data.push_back(d);
    }
    json Export(const TraceDescribeFn& describe = DescribeEventWord, unsigned cpus = 0) const {
        const LogReadOut r{static_cast<uint32_t>(ev.size()), lo.data(), hi.data(), ev.data(), data.data()};
        TraceExportOptions o;
        o.cpuCount = cpus;
        return json::parse(ExportChromeTrace(r, describe, o));
    }
};
constexpr uint64_t kT0 = 3878268966793746343ull;  // a global-clock time: high word in use

// The events of phase `ph` as [name, tid, ts, dur, args] (tracks: [tid, name]).
std::vector<json> Rows(const json& doc, const std::string& ph) {
    std::vector<json> out;
    for (const json& e : doc["traceEvents"]) {
        if (e["ph"] != ph || (ph == "M" && e["name"] != "thread_name")) continue;
        EXPECT_TRUE(e["pid"] == 1 && (ph != "i" || e["s"] == "t")) << e;
        out.push_back(ph == "M" ? json{e["tid"], e["args"]["name"]}
                                : json{e["name"], e["tid"], e["ts"], e.value("dur", json()), e.value("args", json())});
    }
    return out;
}

// Instants on a track per CPU (CPU bits out of the name); a begin and its end one span on the begin's CPU.
TEST(ProbeTrace, InstantsAndSpansOnCpuTracks) {
    Entries e;
    e.Add(kT0, 0x00010003u), e.Add(kT0 + 2500, 0x00040107u), e.Add(kT0 + 1000000, 0x12000300u, 256);
    const json doc = e.Export(), empty = Entries{}.Export(DescribeEventWord, 2);
    EXPECT_EQ(Rows(doc, "i"), (std::vector<json>{{"event 0x00010003", 0, 0.0, nullptr, nullptr},
                                                 {"event 0x00040007", 1, 2.5, nullptr, nullptr},
                                                 {"event 0x12000000", 3, 1000.0, nullptr, {{"data", 256}}}}));
    EXPECT_EQ(Rows(doc, "M"), (std::vector<json>{{0, "CPU 0"}, {1, "CPU 1"}, {3, "CPU 3"}}));
    EXPECT_TRUE(Rows(empty, "i").empty() && empty["otherData"]["entries"] == 0);
    EXPECT_EQ(Rows(empty, "M"), (std::vector<json>{{0, "CPU 0"}, {1, "CPU 1"}}));

    auto describe = [](const TraceEntry& e) {
        TraceEventInfo info;
        const uint32_t kind = (e.event >> 16) & 0xFF;
        info.name = "wait " + std::to_string(e.event & 0xFF);
        info.phase = kind == 1 ? TracePhase::Begin : kind == 2 ? TracePhase::End : TracePhase::Instant;
        info.spanKey = e.event & 0xFF;
        if (kind == 1) info.args["deadline_us"] = e.tsUs + e.data / 1000.0;
        if (kind == 2) info.args["lateness_us"] = e.data / 1000.0, info.name = e.data > 5000 ? info.name + " LATE" : "";
        return info;  // an end's empty name: the begin's
    };
    Entries w;
    w.Add(kT0, 0x00010005u, 20000);          // begin 5 on CPU 0, deadline 20 us on
    w.Add(kT0 + 4000, 0x00010106u, 30000);   // begin 6 on CPU 1
    w.Add(kT0 + 30000, 0x00020105u, 10000);  // end 5 on CPU 1, 10 us late
    w.Add(kT0 + 31000, 0x00020009u, 0);      // end without a begin
    w.Add(kT0 + 40000, 0x00020106u, 2000);   // end 6 on CPU 1, 2 us late
    w.Add(kT0 + 50000, 0x00010007u, 0);      // begin never ended
    const json spans = w.Export(describe, 2);
    EXPECT_EQ(Rows(spans, "X"),
              (std::vector<json>{{"wait 5 LATE", 0, 0, 30, {{"deadline_us", 20}, {"lateness_us", 10}, {"end_cpu", 1}}},
                                 {"wait 6", 1, 4, 36, {{"deadline_us", 34}, {"lateness_us", 2}}}}));
    const std::vector<json> lone = Rows(spans, "i");
    ASSERT_EQ(lone.size(), 2u);
    EXPECT_TRUE(lone[0][2] == 31.0 && lone[1][0] == "wait 7") << lone[0] << lone[1];
}

const std::string kProbe = std::string(QUELTA_BINARY_DIR) + "/tools/quelta-probe", kSource = QUELTA_SOURCE_DIR;
const char* const kSeries[] = {"baseline", "plain-wait", "tick", "event-own-sem", "event-timeout", "global-wait",
                               "callback-time"};

// The probe's arguments as scripts/probe.sh passes them (its exec line), build/ -> dir, the user's last.
std::vector<std::string> AsTheScriptRunsIt(const std::string& dir, const std::vector<std::string>& user) {
    const std::string script = ReadFile(kSource + "/scripts/probe.sh");
    std::string line;
    for (std::size_t at = script.find("\nexec "); at != std::string::npos && !Has(line, "\"$@\"");) {
        const std::size_t end = script.find('\n', at + 1);
        line += script.substr(at + 1, end - at - 1);
        at = end;
    }
    std::vector<std::string> args;
    std::istringstream words(line);
    for (std::string w; words >> w;) {
        w.erase(std::remove(w.begin(), w.end(), '"'), w.end());
        if (w == "$@") args.insert(args.end(), user.begin(), user.end());
        if (w == "exec" || w == "\\" || w == "$@" || Has(w, "/quelta-probe")) continue;
        if (w.rfind("$root/build/", 0) == 0) w = dir + "/" + w.substr(12);
        args.push_back(w);
    }
    EXPECT_TRUE(args.size() > user.size() && std::equal(user.rbegin(), user.rend(), args.rbegin())) << line;
    return args;
}

// The quelta-probe command lines in `text` after `section`, each after `lead`, roff escapes undone.
std::vector<std::string> Examples(const std::string& text, const std::string& section, const std::string& lead) {
    std::vector<std::string> out;
    for (std::string l : Lines(text.substr(std::min(text.find(section), text.size())))) {
        if (l.rfind(lead + "quelta-probe", 0) != 0) continue;
        for (auto [from, to] : {std::pair{"\\-", "-"}, std::pair{"\\(aq", "'"}}) {
            for (std::size_t p; (p = l.find(from)) != std::string::npos;) l.replace(p, std::strlen(from), to);
        }
        out.push_back(l.substr(lead.size()));
    }
    return out;
}

struct ProbeRun {
    int status = -1;  // exit status, or -1 when it did not exit
    std::string out, err;
};

class ProbeCli : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(access(kProbe.c_str(), X_OK), 0) << kProbe << " is not built";
        char tmpl[] = "/tmp/probe_cli_XXXXXX";
        ASSERT_NE(mkdtemp(tmpl), nullptr);
        dir_ = tmpl;
        if (Run({"--version"}).status == 127) GTEST_SKIP() << "cannot exec " << kProbe << " here (no binfmt_misc for it)";
    }
    void TearDown() override { EXPECT_EQ(std::system(("rm -rf '" + dir_ + "'").c_str()), 0); }

    // Runs `binary args...` with standard output and error in files; `child`
    // runs in the child before exec, `during` in the parent while it runs.
    ProbeRun Run(const std::vector<std::string>& args, const std::function<void()>& child = {},
                 const std::function<void(pid_t)>& during = {}, const std::string& binary = kProbe) {
        const std::string out = dir_ + "/stdout", err = dir_ + "/stderr";
        unlink(out.c_str()), unlink(err.c_str());  // nothing of an earlier run for `during` to see
        const pid_t pid = fork();
        if (pid == 0) {
            dup2(open("/dev/null", O_RDONLY), 0);
            dup2(open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
            dup2(open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
            if (child) child();
            std::vector<char*> argv{const_cast<char*>(binary.c_str())};
            for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
            argv.push_back(nullptr);
            execv(binary.c_str(), argv.data());
            _exit(127);
        }
        int status = 0;
        if (pid > 0 && during) during(pid);
        if (pid < 0 || waitpid(pid, &status, 0) != pid) return {};
        return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, ReadFile(out), ReadFile(err)};
    }

    std::string dir_;
};

// Every sample of every series is a CSV row and a histogram count; the plot and trace are written.
void FilesHoldEverySample(const json& doc, const std::string& csv, const std::string& hist, int maxUs,
                          const std::string& svg, const std::string& trace) {
    std::map<std::string, long> rows;  // time_s,series,lateness_us
    const std::vector<std::string> lines = Lines(ReadFile(csv));
    EXPECT_EQ(lines.empty() ? "" : lines[0], "time_s,series,lateness_us");
    for (std::size_t i = 1; i < lines.size(); ++i) {
        static const std::regex row("(-0\\.[0-9]+|[0-9]+\\.?[0-9]*),([a-z-]+),-?[0-9]+\\.?[0-9]*");
        std::smatch m;
        EXPECT_TRUE(std::regex_match(lines[i], m, row)) << lines[i];
        ++rows[m.size() > 2 ? m[2].str() : ""];
    }
    int buckets = 0;  // a row per microsecond; Total + Early Returns per column
    std::vector<long> total(7, 0);
    for (const std::string& l : Lines(ReadFile(hist))) {
        std::istringstream in(l.substr(l.rfind(':') + 1));
        buckets += l[0] != '#';
        for (long n, i = 0; (l.rfind("# Total:", 0) == 0 || l.rfind("# Early Returns:", 0) == 0) && in >> n; ++i) total.at(i) += n;
    }
    EXPECT_EQ(buckets, maxUs);
    ASSERT_EQ(doc["series"].size(), 7u);
    for (std::size_t i = 0; i < 7; ++i) {
        const json& s = doc["series"][i];
        EXPECT_TRUE(s["name"] == kSeries[i] && s["count"] == rows[kSeries[i]] && s["count"] == total[i]) << s.dump() << total[i];
    }
    EXPECT_TRUE(Has(ReadFile(svg), "curve-baseline"));
    EXPECT_TRUE(json::accept(ReadFile(trace)));
}

// The main job with the user's options after its own: every output moved, agreeing, stalls beside each series.
TEST_F(ProbeCli, SurveyWritesEveryOutput) {
    const bool realtime = testsupport::CanUseRealtime();
    const int cpu = static_cast<int>(sysconf(_SC_NPROCESSORS_ONLN)) - 1;
    const std::string svg = dir_ + "/p.svg", trace = dir_ + "/t.json", csv = dir_ + "/s.csv", hist = dir_ + "/h.txt";
    const ProbeRun r = Run(AsTheScriptRunsIt(dir_, {"--duration", "2", "--json", "-", "--svg", svg, "--trace", trace,
                                                    "--csv", csv, "--histogram", hist, "--histogram-max", "2000",
                                                    "--cpu", std::to_string(cpu), "--priority", "50"}));
    ASSERT_EQ(r.status, 0) << r.out << r.err;
    for (const char* f : {"probe.json", "probe.svg", "probe-histogram.txt", "probe-samples.csv", "probe-trace.json"})
        EXPECT_FALSE(Exists(dir_ + "/" + f)) << f;  // every default overridden
    const json doc = json::parse(r.out);  // nothing but the JSON on standard output
    for (const std::string& text : {std::string("baseline"), std::string("p99/base"), std::string("files:"), svg, trace,
                                    csv, hist, std::string("standard output")}) {
        EXPECT_TRUE(Has(r.err, text) && !Has(r.err, "\r")) << text << "\n" << r.err;  // no progress line without a terminal
    }
    EXPECT_EQ(doc["library"], std::string(QUELTA_BINARY_DIR) + "/libquelta.so.6");  // the one built here
    EXPECT_TRUE(doc["duration_s"] >= 2.0 && doc["duration_s"] < 9.0 && doc["machine_noise"]["mode"] != "off" &&
                doc["machine_noise"]["measured_s"] > 0.0 && doc["survey_cpus"] == json({cpu}) &&
                doc["machine"]["priority"] == (realtime ? 50 : 0) && doc["costs"].size() >= 7u) << doc.dump();
    FilesHoldEverySample(doc, csv, hist, 2000, svg, trace);
    for (std::size_t i = 0; i < 7; ++i) {
        const json& s = doc["series"][i];
        EXPECT_TRUE(s["early"] == 0 && ((!realtime && i > 1) || (s["measured"] == true && s["count"] > 10 &&
                                                                  s["failed"] == 0 && s["machine_stall_count"] > 10))) << s.dump();
    }

    // The trace: every wait a span on the survey's CPU, with its deadline
    // and lateness (agreeing loosely with the span's end: the log's stamps
    // against the survey's readings); the late ones named so.
    const double baseP99 = doc["series"][0]["p99"].get<double>();
    int spans = 0, late = 0;
    const json events = json::parse(ReadFile(trace))["traceEvents"];
    for (const json& e : events) {
        if (e["ph"] != "X") continue;
        const std::string name = e["name"];
        const double lateness = e["args"].value("lateness_us", NAN), end = e["ts"].get<double>() + e["dur"].get<double>();
        EXPECT_TRUE(std::abs(e["args"].value("deadline_us", NAN) + lateness - end) < 100000.0 &&
                    Has(name, " LATE") == (lateness > baseP99) && (name.rfind("callback-time", 0) == 0 || e["tid"] == cpu))
            << e.dump();
        ++spans, late += Has(name, " LATE");
    }
    EXPECT_TRUE(spans > 60 && late < spans) << spans << " " << late;
    EXPECT_EQ(Count(ReadFile(svg), "<polyline"), realtime ? 7 : 2);
}

// The README's long runs of the main job ended by SIGINT or SIGTERM still print the tables and write every file.
TEST_F(ProbeCli, SignalEndsASurveyWithTheFilesWritten) {
    const std::string cpu = std::to_string(sysconf(_SC_NPROCESSORS_ONLN) - 1);
    const std::pair<int, std::vector<std::string>> forms[] = {
        {SIGINT, {"--duration", "12h", "--cpu", cpu, "--interval", "1"}}, {SIGTERM, {"--duration", "0", "--interval", "1"}}};
    for (const auto& [sig, user] : forms) {
        SCOPED_TRACE(strsignal(sig));
        const std::string d = dir_ + "/probe";
        for (const char* f : {".json", "-samples.csv", "-histogram.txt", ".svg", "-trace.json"}) unlink((d + f).c_str());
        const auto start = std::chrono::steady_clock::now();
        const ProbeRun r = Run(AsTheScriptRunsIt(dir_, user), {}, [&](pid_t pid) {
            for (int i = 0; i < 300 && !Has(ReadFile(dir_ + "/stdout"), "wakes,"); ++i) SleepMs(100);  // a summary line
            kill(pid, sig);
        });
        ASSERT_EQ(r.status, 0) << r.out << r.err;
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(60));
        for (const char* text : {"stopping the survey", " wakes, 0 early; worst us (last 1 s / all): baseline ", "p99/base"})
            EXPECT_TRUE(Has(r.out, text)) << text << "\n" << r.out;
        const json doc = json::parse(ReadFile(d + ".json"));
        EXPECT_TRUE(doc["interrupted"] == true && doc["duration_s"] > 0.5 && doc["series"][0]["count"] > 10 &&
                    doc["costs"].empty()) << doc.dump();  // costs skipped after a signal
        FilesHoldEverySample(doc, d + "-samples.csv", d + "-histogram.txt", 10000, d + ".svg", d + "-trace.json");
    }
}

// The probe stopped 60 ms six times: the spare CPU's thread sees the stalls, charged to a series it made late.
TEST_F(ProbeCli, AStoppedMachineShowsAsStalls) {
    const long cpus = sysconf(_SC_NPROCESSORS_ONLN);
    if (cpus < 2 || !testsupport::CanUseRealtime()) GTEST_SKIP() << "needs two CPUs and SCHED_FIFO";
    const std::vector<std::string> args = {"--duration", "5", "--cpu", std::to_string(cpus - 1), "--noise", "0", "--interval", "1", "--json", "-"};
    const ProbeRun r = Run(args, {}, [&](pid_t pid) {
        for (int i = 0; i < 300 && !Has(ReadFile(dir_ + "/stderr"), "wakes,"); ++i) SleepMs(100);  // surveying
        for (int i = 0; i < 6; ++i) kill(pid, SIGSTOP), SleepMs(60), kill(pid, SIGCONT), SleepMs(50);
    });
    ASSERT_EQ(r.status, 0) << r.err;
    const json doc = json::parse(r.out), noise = doc["machine_noise"];
    EXPECT_TRUE(noise["mode"] == "spare-cpu" && noise["cpu"] == 0 && noise["stall_max"] >= 50000.0) << noise.dump();
    // (A stop landing between a series' wake and its record is charged
    // without making the sample late, so only "at least one".)
    EXPECT_TRUE(std::any_of(doc["series"].begin(), doc["series"].end(), [](const json& s) {
        return s["name"] != "tick" && s["machine_stall_max"].is_number() && s["max"].is_number() &&
               s["machine_stall_max"] >= 50000.0 && s["max"] >= 40000.0;
    })) << r.out;
}

// compare: two saved surveys side by side, B/A and the stalls; a missing, non-JSON or other-schema file refused.
TEST_F(ProbeCli, CompareShowsTwoSurveysSideBySide) {
    auto survey = [this](const char* file, const char* schema, const std::string& series, const char* noise) {
        std::ofstream(dir_ + "/" + file) << "{\"schema\": \"" << schema << "\", \"machine\": {\"cpus\": 2}, " << noise
                                         << "\"series\": [" << series << "]}";
        return dir_ + "/" + file;
    };
    const std::string a = survey("a.json", "quelta-probe/1", R"({"name": "baseline", "p50": 10, "p99": 20, "max": 40},
                                    {"name": "tick", "p50": 5, "p99": null, "max": 9})", "");
    const std::string b = survey("b.json", "quelta-probe/1", R"({"name": "baseline", "p50": 12, "p99": 30, "max": 20},
                                    {"name": "global-wait", "p50": 1, "p99": 2, "max": 3})",
                                 R"("machine_noise": {"mode": "windows", "stall_p99": 35, "stall_max": 2100},)");
    const std::string other = survey("other.json", "quelta-probe/2", "", "");
    std::ofstream(dir_ + "/bad.json") << "{\"schema\": ";
    const ProbeRun r = Run({"compare", a, b});
    ASSERT_EQ(r.status, 0) << r.err;
    const std::string rows = "\n" + std::regex_replace(std::regex_replace(r.out, std::regex("[ \t]+"), " "), std::regex(" ?\n ?"), "\n");
    for (const char* row : {"\nbaseline 10.0 12.0 1.20x 20.0 30.0 1.50x 40.0 20.0 0.50x\n", "\ntick 5.0 - - - - - 9.0 - - only in A\n",
                            "\nglobal-wait - 1.0 - - 2.0 - - 3.0 - only in B\n", "(us): A not measured, B 35.0 / 2100.0"}) {
        EXPECT_TRUE(Has(rows, row)) << row << r.out;
    }
    const std::pair<std::vector<std::string>, const char*> errors[] = {
        {{"compare", a}, "needs two files"},
        {{"compare", a, dir_ + "/missing.json"}, "missing.json: No such file"},
        {{"compare", dir_ + "/bad.json", b}, "bad.json: not a JSON document"},
        {{"compare", a, other}, "other.json: schema 'quelta-probe/2', but this quelta-probe reads 'quelta-probe/1'"}};
    for (const auto& [args, message] : errors) {
        const ProbeRun e = Run(args);
        EXPECT_EQ(e.status, 1) << message;
        EXPECT_TRUE(Has(e.err, message)) << e.err;
    }
}

// Without real-time privilege (run as nobody, RLIMIT_RTPRIO 0): the plain series measured, the rest not, status 0.
TEST_F(ProbeCli, WithoutRealtimePrivilegeThePlainSeriesAreMeasured) {
    const std::string js = dir_ + "/p.json";
    ASSERT_EQ(chmod(dir_.c_str(), 0777), 0);
    const ProbeRun r = Run({"--duration", "1", "--json", js}, [] {
        const rlimit none{0, 0};
        if (setrlimit(RLIMIT_RTPRIO, &none) != 0 || (getuid() == 0 && setuid(65534) != 0)) _exit(126);
    });
    ASSERT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_FALSE(Has(r.out, "FAILURE")) << r.out;
    EXPECT_TRUE(Has(r.out, "not measured: needs real-time privilege")) << r.out;
    const json doc = json::parse(ReadFile(js));
    EXPECT_TRUE(doc["machine"]["realtime"] == false && doc["timer_running"] == false);
    for (std::size_t i = 0; i < 7; ++i) {
        const json& s = doc["series"][i];
        EXPECT_TRUE(s["measured"] == (i <= 1) && s["early"] == 0 && (i <= 1 ? s["count"] > 10 : s["count"] == 0))
            << s.dump();
    }
}

// Outside the build tree the loader's search finds libquelta.so.6, as for an installed probe.
TEST_F(ProbeCli, OutsideTheBuildTreeTheLoaderFindsTheLibrary) {
    const std::string probe = dir_ + "/bin/quelta-probe", lib = dir_ + "/lib";
    ASSERT_EQ(std::system(("mkdir '" + dir_ + "/bin' '" + lib + "' && cp '" + kProbe + "' '" + probe + "' && cp -L '" +
                           QUELTA_BINARY_DIR + "/libquelta.so.6' '" + lib + "/'").c_str()), 0);
    const ProbeRun missing = Run({"--duration", "1"}, [] { unsetenv("LD_LIBRARY_PATH"); }, {}, probe);
    EXPECT_TRUE(missing.status != 2 || Has(missing.err, "cannot load library 'libquelta.so.6'")) << missing.err;  // none system-wide
    const ProbeRun found = Run({"--duration", "1", "--json", "-", "--no-realtime"},
                               [lib] { setenv("LD_LIBRARY_PATH", lib.c_str(), 1); }, {}, probe);
    ASSERT_EQ(found.status, 0) << found.err;
    EXPECT_EQ(json::parse(found.out)["library"], lib + "/libquelta.so.6");
}

// Bad command lines exit 1 (pointing at --help), library problems 2, unwritable outputs 4: before any survey.
TEST_F(ProbeCli, ErrorsExitWithTheirStatusBeforeAnySurvey) {
    const std::string notLib = dir_ + "/not-a-library.so", left = dir_ + "/left.json";
    std::ofstream(notLib) << "not an ELF file\n";
    const struct { std::vector<std::string> args; int status; const char* message; } cases[] = {
        {{"--help"}, 0, "\nEXIT STATUS\n"}, {{"--version"}, 0, "quelta-probe 6."},
        {{"--duration", "2x"}, 1, "--duration"}, {{"--duration", "31d"}, 1, "30 d"}, {{"--duration"}, 1, "--duration"},
        {{"--bogus"}, 1, "--bogus"}, {{"extra"}, 1, "extra"}, {{"--cpu", "3-1"}, 1, "--cpu"},
        {{"--cpu", "1023"}, 1, "not online"}, {{"--priority", "99"}, 1, "--priority"},
        {{"--priority", "5", "--no-realtime"}, 1, "contradict"}, {{"--histogram-max", "10001"}, 1, "--histogram-max"},
        {{"--noise", "0"}, 1, "needs --cpu"}, {{"--noise", "spare"}, 1, "--noise"},
        {{"--json", "-", "--csv", "-"}, 1, "only one output"},
        {{"--library", dir_ + "/missing/libquelta.so.6", "--json", left}, 2, "No such file"},
        {{"--library", notLib}, 2, "cannot load library"},
        {{"--library", "libm.so.6"}, 2, "lacks symbol"},  // loads, but is not this library
        {{"--json", dir_ + "/no/such/dir/p.json"}, 4, "--json"}, {{"--csv", left, "--histogram", dir_}, 4, "is a directory"}};
    for (const auto& c : cases) {
        const ProbeRun r = Run(c.args);
        const std::string all = r.out + r.err;  // no survey ran (no table), no file left
        EXPECT_TRUE(r.status == c.status && Has(all, c.message) && (c.status != 1 || Has(r.err, "--help")) &&
                    !Has(all, "p99/base") && !Exists(left)) << testing::PrintToString(c.args) << ": " << r.status << " " << all;
    }
}

// Every option accepted and named in --help and the manual (installed, warning-free); every example runs.
TEST_F(ProbeCli, DocumentedOptionsAndExamples) {
    const std::string help = Run({"--help"}).out, page = ReadFile(kSource + "/docs/quelta-probe.1");
    const std::pair<const char*, const char*> options[] = {
        {"--duration", "5"}, {"--interval", "5"}, {"--cpu", "0"}, {"--priority", "5"}, {"--no-realtime", nullptr},
        {"--library", "x"}, {"--json", "x"}, {"--svg", "x"}, {"--trace", "x"}, {"--csv", "x"}, {"--histogram", "x"},
        {"--histogram-max", "5"}, {"--noise", "off"}, {"--help", nullptr}, {"--version", nullptr}};
    for (const auto& [name, value] : options) {
        std::string roff;
        for (char ch : std::string(name)) roff += ch == '-' ? "\\-" : std::string(1, ch);
        EXPECT_TRUE(Has(help, name) && Has(page, roff)) << name;
        std::vector<std::string> args{name};
        if (value) args.push_back(value);
        if (std::string(name) != "--help") args.push_back("--version");  // parsed, then nothing runs
        EXPECT_EQ(Run(args).status, 0) << name;
    }
    EXPECT_EQ(std::system(("gzip -dc '" + std::string(QUELTA_BINARY_DIR) + "/tools/quelta-probe.1.gz' | cmp -s - '" +
                           kSource + "/docs/quelta-probe.1'").c_str()), 0);
    if (std::system("command -v man >/dev/null 2>&1") == 0) {
        EXPECT_EQ(std::system(("LC_ALL=C.UTF-8 MANROFFSEQ='' MANWIDTH=80 man --warnings -E UTF-8 -l -Tutf8 -Z '" + kSource +
                               "/docs/quelta-probe.1' >/dev/null 2>'" + dir_ + "/man.txt'").c_str()), 0);
        EXPECT_EQ(ReadFile(dir_ + "/man.txt"), "");
    }
    const std::vector<std::string> examples = Examples(help, "\nEXAMPLES\n", "    ");
    EXPECT_EQ(examples, Examples(page, ".SH EXAMPLES", ".B "));
    ASSERT_GE(examples.size(), 5u);
    for (std::string cmd : examples) {
        const std::size_t compare = cmd.find(" compare ");
        if (compare == std::string::npos) {
            cmd.insert(std::min(cmd.find(" | "), cmd.size()), " --duration 1");
        } else {  // the two surveys it compares: the one an earlier example saved
            std::istringstream files(cmd.substr(compare + 9));
            for (std::string f; files >> f;) {
                EXPECT_EQ(std::system(("cd '" + dir_ + "' && { [ -e '" + f + "' ] || cp probe.json '" + f + "'; }").c_str()), 0);
            }
        }
        EXPECT_EQ(std::system(("cd '" + dir_ + "' && PATH='" + QUELTA_BINARY_DIR + "/tools':\"$PATH\" && (" + cmd +
                               ") >out.txt 2>&1").c_str()), 0) << cmd << "\n" << ReadFile(dir_ + "/out.txt");
    }
}

}  // namespace
