// The probe's report: the JSON document ("quelta-probe/1") read back, and
// the tables a person reads.
#include <gtest/gtest.h>

#include <cmath>
#include <nlohmann/json.hpp>
#include <string>

#include "ProbeReport.h"

using nlohmann::json;

namespace {

qtools::ProbeReport SampleReport() {
    qtools::ProbeReport r;
    r.machine = {2, "6.1.0-rt", "#1 SMP PREEMPT_RT", "armv7l", true, 98, false};
    r.library = "/opt/lib/libquelta.so.6";
    r.durationS = 10.0;
    r.timerRunning = false;
    r.interrupted = true;
    r.surveyCpus = {1, 3};
    auto series = [](const char* name, std::vector<double> v, std::size_t failed, long held) {
        qtools::SeriesResult s;
        s.name = name;
        s.description = std::string("about ") + name;
        s.summary = qtools::Summarize(v);
        s.failed = failed;
        s.cpuHeld = held;
        return s;
    };
    const qtools::SeriesResult base = series("baseline", {10, 20, 30, 40}, 0, 0);
    qtools::SeriesResult wait = series("plain-wait", {15, 25, 35, 55, 1500, 2500.1234}, 0, 1);
    wait.overMs = 2;
    wait.stall = qtools::Summarize(std::vector<double>{3, 2600});
    r.noise.mode = "windows";
    r.noise.thresholdUs = 5;
    r.noise.windowUs = 200;
    r.noise.measuredS = 2;
    r.noise.stalledUs = 1000;
    r.noise.longest = wait.stall;
    const qtools::SeriesResult empty = series("event-own-sem", {}, 7, -1);
    qtools::SeriesResult off = series("tick", {}, 0, -1);
    off.measured = false;
    off.notMeasured = "needs the library's timer";
    r.series = {base, wait, empty, off};
    r.costs.push_back({"clock_gettime_monotonic", "clock_gettime(CLOCK_MONOTONIC)", -1, 20.5, -1.0});
    r.costs.push_back({"read_monotonic0", "engine ReadMonotonic0 (slot 0)", 0, 22.34, 20.5});
    r.notes.push_back("a note");
    qtools::FinishVerdicts(r);
    return r;
}

TEST(ProbeJson, ReportFollowsTheSchema) {
    const std::string text = qtools::ReportToJson(SampleReport());
    ASSERT_EQ(text.back(), '\n');
    const json v = json::parse(text);
    const json &m = v["machine"], &series = v["series"], &costs = v["costs"];
    ASSERT_EQ(series.size(), 4u);
    ASSERT_EQ(costs.size(), 2u);
    for (const json& s : series) {
        for (const char* key : {"name", "measured", "unit", "count", "min", "mean", "p50", "p90", "p99", "p999",
                                "max", "ratio_p99_to_baseline", "verdict", "early", "failed", "over_1ms",
                                "machine_stall_count", "machine_stall_p99", "machine_stall_max",
                                "machine_stalls_explain_tail"}) {
            EXPECT_TRUE(s.contains(key)) << key;
        }
        EXPECT_EQ(s["unit"], "us");
    }
    EXPECT_EQ(v["schema"], "quelta-probe/1");
    EXPECT_EQ(m["kernel"], "6.1.0-rt");
    EXPECT_EQ(m["cpus"], 2);
    EXPECT_EQ(m["realtime"], true);
    EXPECT_EQ(v["library"], "/opt/lib/libquelta.so.6");
    EXPECT_EQ(v["timer_running"], false);
    EXPECT_EQ(v["interrupted"], true);
    EXPECT_EQ(v["survey_cpus"], json({1, 3}));
    EXPECT_EQ(v["notes"][0], "a note");
    EXPECT_DOUBLE_EQ(v["duration_s"].get<double>(), 10.0);
    // Three decimals of a microsecond; NaN (nothing known) is null.
    EXPECT_DOUBLE_EQ(series[1]["max"].get<double>(), 2500.123);
    EXPECT_DOUBLE_EQ(series[1]["p50"].get<double>(), 35);
    EXPECT_DOUBLE_EQ(series[1]["ratio_p99_to_baseline"].get<double>(), 62.503);
    EXPECT_DOUBLE_EQ(series[0]["ratio_p99_to_baseline"].get<double>(), 1.0);
    EXPECT_EQ(series[1]["over_1ms"], 2);
    EXPECT_EQ(series[1]["over_1ms_cpu_held"], 1);
    EXPECT_DOUBLE_EQ(series[1]["machine_stall_p99"].get<double>(), 2600);
    EXPECT_EQ(series[1]["machine_stalls_explain_tail"], true);
    EXPECT_NE(series[1]["verdict"].get<std::string>().find("machine stalls explain the tail"), std::string::npos);
    EXPECT_TRUE(series[0]["machine_stall_p99"].is_null() && series[0]["machine_stalls_explain_tail"].is_null());
    EXPECT_EQ(v["machine_noise"]["mode"], "windows");
    EXPECT_DOUBLE_EQ(v["machine_noise"]["stalled_fraction"].get<double>(), 0.0005);
    EXPECT_DOUBLE_EQ(v["machine_noise"]["stall_max"].get<double>(), 2600);
    EXPECT_TRUE(v["machine_noise"]["cpu"].is_null() && v["machine_noise"]["library_timer_us"].is_null());
    EXPECT_EQ(series[2]["count"], 0);
    EXPECT_TRUE(series[2]["p99"].is_null() && series[2]["ratio_p99_to_baseline"].is_null());
    EXPECT_TRUE(series[2]["over_1ms_cpu_held"].is_null());
    EXPECT_EQ(series[2]["failed"], 7);
    EXPECT_EQ(series[2]["measured"], true);
    EXPECT_EQ(series[3]["measured"], false);
    EXPECT_EQ(series[3]["not_measured_reason"], "needs the library's timer");
    EXPECT_EQ(series[3]["verdict"], "not measured: needs the library's timer");
    EXPECT_TRUE(costs[0]["slot"].is_null());
    EXPECT_FALSE(costs[0].contains("baseline_ns"));  // only with a raw call to compare with
    EXPECT_EQ(costs[1]["slot"], 0);
    EXPECT_DOUBLE_EQ(costs[1]["baseline_ns"].get<double>(), 20.5);
}

TEST(ProbeJson, TablesShowEverySeriesWithOneDecimal) {
    const qtools::ProbeReport report = SampleReport();
    const std::string t = qtools::FormatSeriesTable(report), c = qtools::FormatCostTable(report);
    for (const char* name : {"baseline", "plain-wait", "event-own-sem"}) EXPECT_NE(t.find(name), std::string::npos);
    EXPECT_NE(t.find("2500.1"), std::string::npos);
    EXPECT_NE(t.find("62.50x"), std::string::npos);
    EXPECT_NE(t.find("stall max"), std::string::npos);
    EXPECT_NE(t.find("in each 200 us window after a sample"), std::string::npos);
    EXPECT_NE(t.find("no samples; 7 calls failed"), std::string::npos);
    EXPECT_NE(t.find("not measured: needs the library's timer"), std::string::npos);
    EXPECT_NE(c.find("22.3"), std::string::npos);
    EXPECT_NE(c.find("1.09x"), std::string::npos);
}

}  // namespace
