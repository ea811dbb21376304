#include "TraceExport.h"

#include <cstdio>
#include <map>
#include <set>
#include <vector>

#include "JsonWriter.h"

namespace qtools {

namespace {

constexpr int kPid = 1;
constexpr uint32_t kNoData = 0xFFFFFFFFu;

uint64_t TimeOf(const LogReadOut& r, uint32_t i) {
    return (static_cast<uint64_t>(r.timeHigh[i]) << 32) | r.timeLow[i];
}

double MicrosSince(uint64_t t, uint64_t origin) {
    return t >= origin ? static_cast<double>(t - origin) / 1000.0
                       : -static_cast<double>(origin - t) / 1000.0;
}

void Common(JsonWriter& w, const TraceEventInfo& info, const char* phase, uint32_t cpu, double ts) {
    w.Key("name").String(info.name);
    w.Key("cat").String(info.category);
    w.Key("ph").String(phase);
    w.Key("pid").Integer(kPid);
    w.Key("tid").Unsigned(cpu);
    w.Key("ts").Number(ts, 3);
}

}  // namespace

TraceEventInfo DescribeEventWord(uint32_t eventWord) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "event 0x%08x", static_cast<unsigned>(eventWord & ~0xFF00u));
    TraceEventInfo info;
    info.name = buf;
    return info;
}

std::string ExportChromeTrace(const LogReadOut& r, const TraceDescribeFn& describe,
                              const TraceExportOptions& options) {
    const bool usable = r.count > 0 && r.timeLow && r.timeHigh && r.events;
    const uint32_t count = usable ? r.count : 0;

    uint64_t origin = 0;
    std::set<uint32_t> cpus;
    for (unsigned c = 0; c < options.cpuCount; ++c) cpus.insert(c);
    for (uint32_t i = 0; i < count; ++i) {
        const uint64_t t = TimeOf(r, i);
        if (i == 0 || t < origin) origin = t;
        cpus.insert(TraceCpuOf(r.events[i]));
    }

    std::vector<std::string> events;
    auto emit = [&](const JsonWriter& w) { events.push_back(w.str()); };

    {
        JsonWriter w(0);
        w.BeginObject().Key("name").String("process_name").Key("ph").String("M");
        w.Key("pid").Integer(kPid).Key("tid").Integer(0);
        w.Key("args").BeginObject().Key("name").String(options.processName).EndObject().EndObject();
        emit(w);
    }
    for (uint32_t c : cpus) {
        JsonWriter w(0);
        w.BeginObject().Key("name").String("thread_name").Key("ph").String("M");
        w.Key("pid").Integer(kPid).Key("tid").Unsigned(c);
        w.Key("args").BeginObject().Key("name").String("CPU " + std::to_string(c)).EndObject().EndObject();
        emit(w);
        JsonWriter s(0);
        s.BeginObject().Key("name").String("thread_sort_index").Key("ph").String("M");
        s.Key("pid").Integer(kPid).Key("tid").Unsigned(c);
        s.Key("args").BeginObject().Key("sort_index").Unsigned(c).EndObject().EndObject();
        emit(s);
    }

    auto instant = [&](uint32_t i, const TraceEventInfo& info) {
        JsonWriter w(0);
        w.BeginObject();
        Common(w, info, "i", TraceCpuOf(r.events[i]), MicrosSince(TimeOf(r, i), origin));
        w.Key("s").String("t");
        if (r.data != nullptr && r.data[i] != kNoData) {
            w.Key("args").BeginObject().Key("data").Unsigned(r.data[i]).EndObject();
        }
        w.EndObject();
        emit(w);
    };

    struct Open {
        uint32_t index;
        TraceEventInfo info;
    };
    std::map<uint32_t, Open> open;  // span key -> its unmatched begin
    for (uint32_t i = 0; i < count; ++i) {
        TraceEventInfo info = describe(r.events[i]);
        switch (info.phase) {
            case TracePhase::Instant:
                instant(i, info);
                break;
            case TracePhase::Begin: {
                auto it = open.find(info.spanKey);
                if (it != open.end()) {
                    instant(it->second.index, it->second.info);
                    open.erase(it);
                }
                open.emplace(info.spanKey, Open{i, info});
                break;
            }
            case TracePhase::End: {
                auto it = open.find(info.spanKey);
                if (it == open.end()) {
                    instant(i, info);
                    break;
                }
                const uint32_t b = it->second.index;
                const double ts = MicrosSince(TimeOf(r, b), origin);
                const uint32_t beginCpu = TraceCpuOf(r.events[b]);
                const uint32_t endCpu = TraceCpuOf(r.events[i]);
                JsonWriter w(0);
                w.BeginObject();
                Common(w, it->second.info, "X", beginCpu, ts);
                w.Key("dur").Number(MicrosSince(TimeOf(r, i), origin) - ts, 3);
                const bool data = r.data != nullptr && r.data[i] != kNoData;
                if (endCpu != beginCpu || data) {
                    w.Key("args").BeginObject();
                    if (endCpu != beginCpu) w.Key("end_cpu").Unsigned(endCpu);
                    if (data) w.Key("data").Unsigned(r.data[i]);
                    w.EndObject();
                }
                w.EndObject();
                emit(w);
                open.erase(it);
                break;
            }
        }
    }
    for (auto& [key, o] : open) instant(o.index, o.info);

    std::string out = "{\"traceEvents\":[\n";
    for (std::size_t i = 0; i < events.size(); ++i) {
        out += events[i];
        out += i + 1 < events.size() ? ",\n" : "\n";
    }
    out += "],\n\"displayTimeUnit\":\"ns\",\n\"otherData\":{\"clock\":\"";
    out += JsonEscape(options.clockNote);
    out += "\",\"origin_ns\":" + std::to_string(origin) + ",\"entries\":" + std::to_string(count) + "}}\n";
    return out;
}

}  // namespace qtools
