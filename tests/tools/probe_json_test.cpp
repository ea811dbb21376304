// The JSON writer and the probe's report document ("quelta-probe/1"), read
// back with an independent reader.
#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

#include "JsonWriter.h"
#include "ProbeReport.h"
#include "probe_json_reader.h"

using probejson::Value;
using qtools::JsonWriter;

namespace {

TEST(ProbeJson, WriterOutputReadsBack) {
    for (int indent : {0, 2}) {
        JsonWriter w(indent);
        w.BeginObject();
        w.Key("text").String("quote \" backslash \\ newline \n tab \t bell \x07 end");
        w.Key("nested").BeginArray().BeginObject().EndObject().BeginArray().EndArray().Integer(-3).EndArray();
        w.Key("tenth").Number(0.1);
        w.Key("fixed").Number(2.0 / 3.0, 3);
        w.Key("nan").Number(std::numeric_limits<double>::quiet_NaN());
        w.Key("inf").Number(std::numeric_limits<double>::infinity(), 2);
        w.Key("negzero").Number(-0.0001, 1);
        w.Key("big").Unsigned(18446744073709551615ull);
        w.Key("yes").Bool(true).Key("none").Null();
        w.EndObject();

        Value v;
        ASSERT_TRUE(probejson::Parse(w.str(), v)) << w.str();
        EXPECT_EQ(v["text"].s, "quote \" backslash \\ newline \n tab \t bell \x07 end");
        ASSERT_EQ(v["nested"].items.size(), 3u);
        EXPECT_TRUE(v["nested"][0].kind == Value::Object && v["nested"][1].kind == Value::Array);
        EXPECT_EQ(v["nested"][2].n, -3);
        EXPECT_EQ(v["tenth"].n, 0.1);
        EXPECT_NE(w.str().find("0.667"), std::string::npos);
        EXPECT_TRUE(v["nan"].kind == Value::Null && v["inf"].kind == Value::Null);  // not numbers in JSON
        EXPECT_EQ(w.str().find("-0.0"), std::string::npos);
        EXPECT_EQ(v["negzero"].n, 0.0);
        EXPECT_TRUE(v["yes"].b && v["none"].kind == Value::Null);
        EXPECT_TRUE(indent != 0 || w.str().find('\n') == std::string::npos);
    }
}

qtools::ProbeReport SampleReport() {
    qtools::ProbeReport r;
    r.machine = {2, "6.1.0-rt", "#1 SMP PREEMPT_RT", "armv7l", true, 98, false};
    r.library = "/opt/lib/libquelta.so.6";
    r.durationS = 10.0;
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
    qtools::SeriesResult wait = series("plain-wait", {15, 25, 35, 55, 1500, 2500}, 0, 1);
    wait.overMs = 2;
    const qtools::SeriesResult empty = series("event-own-sem", {}, 7, -1);
    r.series = {base, wait, empty};
    r.costs.push_back({"clock_gettime_monotonic", "clock_gettime(CLOCK_MONOTONIC)", -1, 20.5, -1.0});
    r.costs.push_back({"read_monotonic0", "engine ReadMonotonic0 (slot 0)", 0, 22.34, 20.5});
    r.notes.push_back("a note");
    qtools::FinishVerdicts(r);
    return r;
}

TEST(ProbeJson, ReportFollowsTheSchema) {
    Value v;
    ASSERT_TRUE(probejson::Parse(qtools::ReportToJson(SampleReport()), v));
    const Value &m = v["machine"], &series = v["series"], &costs = v["costs"];
    ASSERT_EQ(series.items.size(), 3u);
    ASSERT_EQ(costs.items.size(), 2u);
    for (const Value& s : series.items) {
        for (const char* key : {"name", "unit", "count", "min", "p50", "p90", "p99", "p999", "max",
                                "ratio_p99_to_baseline", "verdict", "early"}) {
            EXPECT_TRUE(s.has(key)) << key;
        }
        EXPECT_EQ(s["unit"].s, "us");
    }
    const std::pair<const Value*, const char*> strings[] = {
        {&v["schema"], "quelta-probe/1"}, {&m["kernel"], "6.1.0-rt"}, {&v["library"], "/opt/lib/libquelta.so.6"},
        {&series[0]["name"], "baseline"}, {&costs[0]["name"], "clock_gettime_monotonic"}, {&v["notes"][0], "a note"}};
    for (const auto& [value, want] : strings) EXPECT_EQ(value->s, want);
    // NaN: null, a number that is not known (an empty series has no numbers).
    const double null = std::nan("");
    const std::pair<const Value*, double> numbers[] = {
        {&m["cpus"], 2}, {&v["duration_s"], 10}, {&series[0]["ratio_p99_to_baseline"], 1},
        {&series[1]["p50"], 35}, {&series[1]["min"], 15}, {&series[1]["max"], 2500},
        {&series[1]["ratio_p99_to_baseline"], 2500.0 / 40.0}, {&series[1]["over_1ms"], 2},
        {&series[1]["over_1ms_cpu_held"], 1}, {&series[2]["count"], 0}, {&series[2]["p99"], null},
        {&series[2]["ratio_p99_to_baseline"], null}, {&series[2]["failed"], 7},
        {&series[2]["over_1ms_cpu_held"], null}, {&costs[0]["slot"], null}, {&costs[1]["ns_per_call"], 22.34},
        {&costs[1]["baseline_ns"], 20.5}, {&costs[1]["slot"], 0}};
    for (const auto& [value, want] : numbers) {
        EXPECT_EQ(value->kind, std::isnan(want) ? Value::Null : Value::Number) << want;
        EXPECT_DOUBLE_EQ(std::isnan(want) ? 0.0 : value->n, std::isnan(want) ? 0.0 : want);
    }
    EXPECT_TRUE(m["realtime"].kind == Value::Bool && m["realtime"].b);
    EXPECT_FALSE(costs[0].has("baseline_ns"));  // only with a raw call to compare with
}

TEST(ProbeJson, TablesShowEverySeriesWithOneDecimal) {
    const qtools::ProbeReport report = SampleReport();
    const std::string t = qtools::FormatSeriesTable(report), c = qtools::FormatCostTable(report);
    for (const char* name : {"baseline", "plain-wait", "event-own-sem"}) EXPECT_NE(t.find(name), std::string::npos);
    EXPECT_NE(t.find("2500.0"), std::string::npos);
    EXPECT_NE(t.find("62.50x"), std::string::npos);
    EXPECT_NE(t.find("no samples; 7 calls failed"), std::string::npos);
    EXPECT_NE(c.find("22.3"), std::string::npos);
    EXPECT_NE(c.find("1.09x"), std::string::npos);
}

}  // namespace
