// The trace exporter on fixed read-outs: one track per CPU taken from bits
// 8-15 of the event word, times in microseconds from the first entry,
// begin/end pairs joined into spans.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "TraceExport.h"
#include "probe_json_reader.h"

using probejson::Value;
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
    Value v;
    EXPECT_TRUE(probejson::Parse(json, v)) << json;
    return v;
}

std::vector<const Value*> Events(const Value& doc, const std::string& ph) {
    std::vector<const Value*> out;
    for (const Value& e : doc["traceEvents"].items) if (e["ph"].s == ph) out.push_back(&e);
    return out;
}

using Track = std::pair<unsigned, std::string>;
std::vector<Track> Tracks(const Value& doc) {
    std::vector<Track> out;
    for (const Value* m : Events(doc, "M")) {
        if ((*m)["name"].s == "thread_name") out.emplace_back(unsigned((*m)["tid"].n), (*m)["args"]["name"].s);
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
        EXPECT_TRUE(in["pid"].n == 1 && in["tid"].n == tid[i] && in["s"].s == "t") << i;
        EXPECT_DOUBLE_EQ(in["ts"].n, ts[i]);
    }
    // The default names leave the CPU bits out.
    EXPECT_EQ((*instants[1])["name"].s, "event 0x00040007");
    EXPECT_EQ((*instants[2])["name"].s, "event 0x12000000");
    EXPECT_FALSE((*instants[0]).has("args"));             // plain recording: no data
    EXPECT_EQ((*instants[2])["args"]["data"].n, 256);  // data words other than the plain one

    // One named track per CPU that appears; with a CPU count and nothing
    // read out, one per CPU still, in a valid trace.
    const std::vector<Track> want{{0, "CPU 0"}, {1, "CPU 1"}, {3, "CPU 3"}};
    EXPECT_EQ(Tracks(doc), want);
    const Value empty = Export(Entries{}, qtools::DescribeEventWord, 2);
    EXPECT_TRUE(Events(empty, "i").empty());
    EXPECT_EQ(Tracks(empty), std::vector<Track>({{0, "CPU 0"}, {1, "CPU 1"}}));
    EXPECT_EQ(empty["otherData"]["entries"].n, 0);
}


TEST(ProbeTrace, BeginAndEndBecomeOneSpanOnTheBeginsCpu) {
    // Word layout of the caller: bits 0-7 a key, bits 16-23 1 = begin, 2 = end.
    auto describe = [](uint32_t w) {
        qtools::TraceEventInfo info;
        const uint32_t kind = (w >> 16) & 0xFF;
        info.name = "wait " + std::to_string(w & 0xFF);
        info.phase = kind == 1 ? TracePhase::Begin : kind == 2 ? TracePhase::End : TracePhase::Instant;
        info.spanKey = w & 0xFF;
        return info;
    };
    Entries e;
    e.Add(kT0, 0x00010005u);                        // begin key 5 on CPU 0
    e.Add(kT0 + 4000, 0x00010006u | (1u << 8));     // begin key 6 on CPU 1
    e.Add(kT0 + 30000, 0x00020005u | (1u << 8));    // end key 5 on CPU 1
    e.Add(kT0 + 31000, 0x00020009u);                // end without a begin
    e.Add(kT0 + 40000, 0x00020006u | (1u << 8));    // end key 6 on CPU 1
    e.Add(kT0 + 50000, 0x00010007u);                // begin never ended
    const Value doc = Export(e, describe, 2);

    const auto spans = Events(doc, "X");
    ASSERT_EQ(spans.size(), 2u);
    const struct { const char* name; double tid, ts, dur; } want[] = {{"wait 5", 0, 0, 30}, {"wait 6", 1, 4, 36}};
    for (int i = 0; i < 2; ++i) {
        const Value& sp = *spans[i];
        EXPECT_EQ(sp["name"].s, want[i].name);
        EXPECT_EQ(sp["tid"].n, want[i].tid);
        EXPECT_DOUBLE_EQ(sp["ts"].n, want[i].ts);
        EXPECT_DOUBLE_EQ(sp["dur"].n, want[i].dur);
    }
    EXPECT_EQ((*spans[0])["args"]["end_cpu"].n, 1);  // ended on another CPU
    EXPECT_FALSE((*spans[1]).has("args"));

    // The lone end and the lone begin are kept as instants.
    const auto instants = Events(doc, "i");
    ASSERT_EQ(instants.size(), 2u);
    EXPECT_EQ((*instants[0])["name"].s, "wait 9");
    EXPECT_DOUBLE_EQ((*instants[0])["ts"].n, 31.0);
    EXPECT_EQ((*instants[1])["name"].s, "wait 7");
}

}  // namespace
