#include "TraceExport.h"

#include <cmath>
#include <cstdio>
#include <map>
#include <set>
#include <vector>

namespace qtools {

namespace {

using json = nlohmann::ordered_json;
constexpr int kPid = 1;

uint64_t TimeOf(const LogReadOut& r, uint32_t i) {
    return (static_cast<uint64_t>(r.timeHigh[i]) << 32) | r.timeLow[i];
}

// Microseconds with three decimals: the log's nanoseconds, no more.
double MicrosSince(uint64_t t, uint64_t origin) {
    const double ns = t >= origin ? static_cast<double>(t - origin) : -static_cast<double>(origin - t);
    return std::round(ns) / 1000.0;
}

json Event(const TraceEventInfo& info, const char* phase, uint32_t cpu, double ts) {
    return json{{"name", info.name}, {"cat", info.category}, {"ph", phase},
                {"pid", kPid},       {"tid", cpu},           {"ts", ts}};
}

}  // namespace

TraceEventInfo DescribeEventWord(const TraceEntry& e) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "event 0x%08x", static_cast<unsigned>(e.event & ~0xFF00u));
    TraceEventInfo info;
    info.name = buf;
    if (e.data != kLogNoData) info.args["data"] = e.data;
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

    // One event per line: a large trace stays readable with line tools, and
    // each event is serialised on its own rather than held as one tree.
    std::string out = "{\"traceEvents\":[\n";
    bool first = true;
    auto emit = [&](const json& e) {
        if (!first) out += ",\n";
        first = false;
        out += e.dump();
    };

    emit(json{{"name", "process_name"}, {"ph", "M"}, {"pid", kPid}, {"tid", 0},
              {"args", {{"name", options.processName}}}});
    for (uint32_t c : cpus) {
        emit(json{{"name", "thread_name"}, {"ph", "M"}, {"pid", kPid}, {"tid", c},
                  {"args", {{"name", "CPU " + std::to_string(c)}}}});
        emit(json{{"name", "thread_sort_index"}, {"ph", "M"}, {"pid", kPid}, {"tid", c},
                  {"args", {{"sort_index", c}}}});
    }

    auto entry = [&](uint32_t i) {
        TraceEntry e;
        e.event = r.events[i];
        e.data = r.data != nullptr ? r.data[i] : kLogNoData;
        e.tsUs = MicrosSince(TimeOf(r, i), origin);
        return e;
    };
    auto instant = [&](uint32_t i, const TraceEventInfo& info) {
        json e = Event(info, "i", TraceCpuOf(r.events[i]), MicrosSince(TimeOf(r, i), origin));
        e["s"] = "t";
        if (!info.args.empty()) e["args"] = info.args;
        emit(e);
    };

    struct Open {
        uint32_t index;
        TraceEventInfo info;
    };
    std::map<uint32_t, Open> open;  // span key -> its unmatched begin
    for (uint32_t i = 0; i < count; ++i) {
        TraceEventInfo info = describe(entry(i));
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
                open.emplace(info.spanKey, Open{i, std::move(info)});
                break;
            }
            case TracePhase::End: {
                auto it = open.find(info.spanKey);
                if (it == open.end()) {
                    instant(i, info);
                    break;
                }
                const uint32_t b = it->second.index;
                const TraceEventInfo& begin = it->second.info;
                const double ts = MicrosSince(TimeOf(r, b), origin);
                const uint32_t beginCpu = TraceCpuOf(r.events[b]);
                const uint32_t endCpu = TraceCpuOf(r.events[i]);
                TraceEventInfo span = info.name.empty() ? begin : info;
                json e = Event(span, "X", beginCpu, ts);
                e["dur"] = std::round((MicrosSince(TimeOf(r, i), origin) - ts) * 1000.0) / 1000.0;
                json args = begin.args;
                for (auto& [k, v] : info.args.items()) args[k] = v;
                if (endCpu != beginCpu) args["end_cpu"] = endCpu;
                if (!args.empty()) e["args"] = std::move(args);
                emit(e);
                open.erase(it);
                break;
            }
        }
    }
    for (auto& [key, o] : open) instant(o.index, o.info);

    out += "\n],\n\"displayTimeUnit\":\"ns\",\n\"otherData\":";
    out += json{{"clock", options.clockNote}, {"origin_ns", origin}, {"entries", count}}.dump();
    out += "}\n";
    return out;
}

}  // namespace qtools
