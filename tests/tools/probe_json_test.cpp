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
        EXPECT_EQ(v["nested"][0].kind, Value::Object);
        EXPECT_EQ(v["nested"][1].kind, Value::Array);
        EXPECT_EQ(v["nested"][2].n, -3);
        EXPECT_EQ(v["tenth"].n, 0.1);
        EXPECT_NE(w.str().find("0.667"), std::string::npos);
        EXPECT_EQ(v["nan"].kind, Value::Null);
        EXPECT_EQ(v["inf"].kind, Value::Null);
        EXPECT_EQ(w.str().find("-0.0"), std::string::npos);
        EXPECT_EQ(v["negzero"].n, 0.0);
        EXPECT_EQ(v["yes"].kind, Value::Bool);
        EXPECT_EQ(v["none"].kind, Value::Null);
        if (indent == 0) {
            EXPECT_EQ(w.str().find('\n'), std::string::npos);
        }
    }
}

qtools::ProbeReport SampleReport() {
    qtools::ProbeReport r;
    r.machine.cpus = 2;
    r.machine.kernel = "6.1.0-rt";
    r.machine.kernelVersion = "#1 SMP PREEMPT_RT";
    r.machine.arch = "armv7l";
    r.machine.realtime = true;
    r.machine.priority = 98;
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
    const qtools::ProbeReport report = SampleReport();
    Value v;
    ASSERT_TRUE(probejson::Parse(qtools::ReportToJson(report), v));
    EXPECT_EQ(v["schema"].s, "quelta-probe/1");

    const Value& m = v["machine"];
    EXPECT_EQ(m["cpus"].n, 2);
    EXPECT_EQ(m["kernel"].s, "6.1.0-rt");
    EXPECT_EQ(m["realtime"].kind, Value::Bool);
    EXPECT_TRUE(m["realtime"].b);
    EXPECT_EQ(v["duration_s"].n, 10.0);
    EXPECT_EQ(v["library"].s, "/opt/lib/libquelta.so.6");

    const Value& series = v["series"];
    ASSERT_EQ(series.items.size(), 3u);
    for (const Value& s : series.items) {
        for (const char* key : {"name", "unit", "count", "min", "p50", "p90", "p99", "p999", "max",
                                "ratio_p99_to_baseline", "verdict", "early"}) {
            EXPECT_TRUE(s.has(key)) << key;
        }
        EXPECT_EQ(s["unit"].s, "us");
    }
    EXPECT_EQ(series[0]["name"].s, "baseline");
    EXPECT_EQ(series[0]["ratio_p99_to_baseline"].n, 1.0);
    EXPECT_EQ(series[1]["p50"].n, 35);
    EXPECT_EQ(series[1]["min"].n, 15);
    EXPECT_EQ(series[1]["max"].n, 2500);
    EXPECT_DOUBLE_EQ(series[1]["ratio_p99_to_baseline"].n, 2500.0 / 40.0);
    EXPECT_EQ(series[1]["over_1ms"].n, 2);
    EXPECT_EQ(series[1]["over_1ms_cpu_held"].n, 1);
    // An empty series: count 0, no numbers, its failures counted.
    EXPECT_EQ(series[2]["count"].n, 0);
    EXPECT_EQ(series[2]["p99"].kind, Value::Null);
    EXPECT_EQ(series[2]["ratio_p99_to_baseline"].kind, Value::Null);
    EXPECT_EQ(series[2]["failed"].n, 7);
    EXPECT_EQ(series[2]["over_1ms_cpu_held"].kind, Value::Null);  // not known

    const Value& costs = v["costs"];
    ASSERT_EQ(costs.items.size(), 2u);
    EXPECT_EQ(costs[0]["name"].s, "clock_gettime_monotonic");
    EXPECT_FALSE(costs[0].has("baseline_ns"));  // present only with a raw call to compare with
    EXPECT_EQ(costs[0]["slot"].kind, Value::Null);
    EXPECT_EQ(costs[1]["ns_per_call"].n, 22.34);
    EXPECT_EQ(costs[1]["baseline_ns"].n, 20.5);
    EXPECT_EQ(costs[1]["slot"].n, 0);
    EXPECT_EQ(v["notes"][0].s, "a note");
}

TEST(ProbeJson, TablesShowEverySeriesWithOneDecimal) {
    const qtools::ProbeReport report = SampleReport();
    const std::string t = qtools::FormatSeriesTable(report);
    for (const char* name : {"baseline", "plain-wait", "event-own-sem"}) EXPECT_NE(t.find(name), std::string::npos);
    EXPECT_NE(t.find("2500.0"), std::string::npos);
    EXPECT_NE(t.find("62.50x"), std::string::npos);
    EXPECT_NE(t.find("no samples; 7 calls failed"), std::string::npos);
    const std::string c = qtools::FormatCostTable(report);
    EXPECT_NE(c.find("22.3"), std::string::npos);
    EXPECT_NE(c.find("1.09x"), std::string::npos);
}

}  // namespace
