// The trace exporter on fixed read-outs: one track per CPU taken from bits
// 8-15 of the event word, times in microseconds from the first entry,
// begin/end pairs joined into spans.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "TraceExport.h"

using Value = nlohmann::json;
using qtools::TracePhase;

namespace {

// A read-out as the log engine returns it (ascending time).
struct Entries {
    std::vector<uint32_t> lo, hi, ev, data;
    void Add(uint64_t t, uint32_t event, uint32_t d = 0xFFFFFFFFu) {
        lo.push_back(static_cast<uint32_t>(t));
        hi.push_back(static_cast<uint32_t>(t >> 32));
        ev.push_back(event);
        data.push_back(d);
    }
    qtools::LogReadOut View() const {
        qtools::LogReadOut r;
        r.count = static_cast<uint32_t>(ev.size());
        r.timeLow = lo.data(), r.timeHigh = hi.data(), r.events = ev.data(), r.data = data.data();
        return r;
    }
};

constexpr uint64_t kT0 = 3878268966793746343ull;  // a global-clock time: high word in use

Value Export(const Entries& e, const qtools::TraceDescribeFn& describe = qtools::DescribeEventWord,
             unsigned cpuCount = 0) {
    qtools::TraceExportOptions o;
    o.cpuCount = cpuCount;
    const std::string json = qtools::ExportChromeTrace(e.View(), describe, o);
    EXPECT_TRUE(Value::accept(json)) << json;
    return Value::parse(json, nullptr, false);
}

std::vector<const Value*> Events(const Value& doc, const std::string& ph) {
    std::vector<const Value*> out;
    for (const Value& e : doc["traceEvents"]) if (e["ph"] == ph) out.push_back(&e);
    return out;
}

using Track = std::pair<unsigned, std::string>;
std::vector<Track> Tracks(const Value& doc) {
    std::vector<Track> out;
    for (const Value* m : Events(doc, "M")) {
        if ((*m)["name"] == "thread_name") out.emplace_back((*m)["tid"].get<unsigned>(), (*m)["args"]["name"].get<std::string>());
    }
    return out;
}

TEST(ProbeTrace, InstantsOnePerEntryOnTheirCpuTrack) {
    Entries e;
    e.Add(kT0, 0x00010003u | (0u << 8));
    e.Add(kT0 + 2500, 0x00040007u | (1u << 8));
    e.Add(kT0 + 1000000, 0x12000000u | (3u << 8), 256);
    const Value doc = Export(e);

    const auto instants = Events(doc, "i");
    ASSERT_EQ(instants.size(), 3u);
    const double ts[] = {0.0, 2.5, 1000.0}, tid[] = {0, 1, 3};  // microseconds from the first entry
    for (int i = 0; i < 3; ++i) {
        const Value& in = *instants[i];
        EXPECT_TRUE(in["pid"] == 1 && in["tid"] == tid[i] && in["s"] == "t") << i;
        EXPECT_DOUBLE_EQ(in["ts"].get<double>(), ts[i]);
    }
    // The default names leave the CPU bits out.
    EXPECT_EQ((*instants[1])["name"], "event 0x00040007");
    EXPECT_EQ((*instants[2])["name"], "event 0x12000000");
    EXPECT_FALSE((*instants[0]).contains("args"));     // plain recording: no data
    EXPECT_EQ((*instants[2])["args"]["data"], 256);  // data words other than the plain one

    // One named track per CPU that appears; with a CPU count and nothing
    // read out, one per CPU still, in a valid trace.
    const std::vector<Track> want{{0, "CPU 0"}, {1, "CPU 1"}, {3, "CPU 3"}};
    EXPECT_EQ(Tracks(doc), want);
    const Value empty = Export(Entries{}, qtools::DescribeEventWord, 2);
    EXPECT_TRUE(Events(empty, "i").empty());
    EXPECT_EQ(Tracks(empty), std::vector<Track>({{0, "CPU 0"}, {1, "CPU 1"}}));
    EXPECT_EQ(empty["otherData"]["entries"], 0);
}


// Word layout of the caller: bits 0-7 a key, bits 16-23 1 = begin, 2 =
// end. Begins carry a deadline, ends a lateness; an end later than 5 us
// renames its span.
TEST(ProbeTrace, BeginAndEndBecomeOneSpanOnTheBeginsCpu) {
    auto describe = [](const qtools::TraceEntry& e) {
        qtools::TraceEventInfo info;
        const uint32_t kind = (e.event >> 16) & 0xFF;
        info.name = "wait " + std::to_string(e.event & 0xFF);
        info.phase = kind == 1 ? TracePhase::Begin : kind == 2 ? TracePhase::End : TracePhase::Instant;
        info.spanKey = e.event & 0xFF;
        if (kind == 1) info.args["deadline_us"] = e.tsUs + e.data / 1000.0;
        if (kind == 2) {
            info.args["lateness_us"] = e.data / 1000.0;
            info.name = e.data > 5000 ? info.name + " LATE" : "";  // empty: the begin's name
        }
        return info;
    };
    Entries e;
    e.Add(kT0, 0x00010005u, 20000);                     // begin key 5 on CPU 0, deadline 20 us on
    e.Add(kT0 + 4000, 0x00010006u | (1u << 8), 30000);  // begin key 6 on CPU 1
    e.Add(kT0 + 30000, 0x00020005u | (1u << 8), 10000); // end key 5 on CPU 1, 10 us late
    e.Add(kT0 + 31000, 0x00020009u, 0);                 // end without a begin
    e.Add(kT0 + 40000, 0x00020006u | (1u << 8), 2000);  // end key 6 on CPU 1, 2 us late
    e.Add(kT0 + 50000, 0x00010007u, 0);                 // begin never ended
    const Value doc = Export(e, describe, 2);

    const auto spans = Events(doc, "X");
    ASSERT_EQ(spans.size(), 2u);
    const struct { const char* name; double tid, ts, dur, deadline, late; } want[] = {
        {"wait 5 LATE", 0, 0, 30, 20, 10}, {"wait 6", 1, 4, 36, 34, 2}};
    for (int i = 0; i < 2; ++i) {
        const Value& sp = *spans[i];
        EXPECT_EQ(sp["name"], want[i].name);
        EXPECT_EQ(sp["tid"], want[i].tid);
        EXPECT_DOUBLE_EQ(sp["ts"].get<double>(), want[i].ts);
        EXPECT_DOUBLE_EQ(sp["dur"].get<double>(), want[i].dur);
        EXPECT_DOUBLE_EQ(sp["args"]["deadline_us"].get<double>(), want[i].deadline);
        EXPECT_DOUBLE_EQ(sp["args"]["lateness_us"].get<double>(), want[i].late);
    }
    EXPECT_EQ((*spans[0])["args"]["end_cpu"], 1);  // ended on another CPU
    EXPECT_FALSE((*spans[1])["args"].contains("end_cpu"));

    // The lone end and the lone begin are kept as instants.
    const auto instants = Events(doc, "i");
    ASSERT_EQ(instants.size(), 2u);
    EXPECT_DOUBLE_EQ((*instants[0])["ts"].get<double>(), 31.0);
    EXPECT_EQ((*instants[1])["name"], "wait 7");
}

}  // namespace
