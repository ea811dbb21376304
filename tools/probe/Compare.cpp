#include "probe/Compare.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <fstream>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "ProbeReport.h"
#include "probe/ProbeOptions.h"

namespace qprobe {

namespace {

using json = nlohmann::json;
using qtools::Cell;

const char kUsage[] = "usage: quelta-probe compare A.json B.json  (files written by quelta-probe --json)\n";

// A survey's document, or false with the reason (naming the file) in `why`.
bool Load(const std::string& path, json& doc, std::string& why) {
    std::ifstream in(path);
    if (!in) {
        why = path + ": " + std::strerror(errno);
        return false;
    }
    doc = json::parse(in, nullptr, false);
    if (doc.is_discarded() || !doc.is_object()) {
        why = path + ": not a JSON document written by quelta-probe --json";
        return false;
    }
    const json schema = doc.value("schema", json());
    if (!schema.is_string()) {
        why = path + ": no \"schema\": not written by quelta-probe --json";
        return false;
    }
    if (schema != qtools::kProbeSchema) {
        why = path + ": schema '" + schema.get<std::string>() + "', but this quelta-probe reads '" +
              qtools::kProbeSchema + "'";
        return false;
    }
    if (!doc.value("series", json()).is_array()) {
        why = path + ": schema '" + qtools::kProbeSchema + "' but no \"series\" list";
        return false;
    }
    return true;
}

double Number(const json& object, const char* key) {
    const json v = object.is_object() ? object.value(key, json()) : json();
    return v.is_number() ? v.get<double>() : NAN;
}

const json* FindSeries(const json& doc, const std::string& name) {
    for (const json& s : doc["series"]) {
        if (s.is_object() && s.value("name", json()) == name) return &s;
    }
    return nullptr;
}


// One line on where and how a survey ran.
std::string Describe(const char* label, const std::string& path, const json& doc) {
    const json m = doc.value("machine", json::object());
    auto text = [](const json& o, const char* key) {
        const json v = o.is_object() ? o.value(key, json()) : json();
        return v.is_string() ? v.get<std::string>() : std::string("?");
    };
    std::string sched = m.value("realtime", false) ? "SCHED_FIFO " + Cell(Number(m, "priority"), "%.0f")
                                                   : std::string("not real-time");
    return std::string(label) + " = " + path + ": " + Cell(Number(doc, "duration_s")) + " s, " +
           Cell(Number(m, "cpus"), "%.0f") + " CPUs, " + text(m, "arch") + ", kernel " + text(m, "kernel") + ", " +
           sched + ", " + text(doc, "library") + "\n";
}

}  // namespace

int RunCompare(int argc, char** argv, FILE* out, FILE* err) {
    for (int i = 0; i < argc; ++i) {
        if (std::strcmp(argv[i], "-h") == 0 || std::strcmp(argv[i], "--help") == 0) {
            std::fputs(kUsage, out);
            return kExitOk;
        }
    }
    if (argc != 2) {
        std::fprintf(err, "quelta-probe compare: needs two files, got %d\n%s", argc, kUsage);
        return kExitUsage;
    }
    json a, b;
    std::string why;
    if (!Load(argv[0], a, why) || !Load(argv[1], b, why)) {
        std::fprintf(err, "quelta-probe compare: %s\n%s", why.c_str(), kUsage);
        return kExitUsage;
    }

    // Every series of A in its order, then those only B has.
    std::vector<std::string> names;
    for (const json* doc : {&a, &b}) {
        for (const json& s : (*doc)["series"]) {
            const json name = s.is_object() ? s.value("name", json()) : json();
            if (!name.is_string()) continue;
            const std::string n = name.get<std::string>();
            if (std::find(names.begin(), names.end(), n) == names.end()) names.push_back(n);
        }
    }
    std::vector<std::vector<std::string>> rows{
        {"series", "p50 A", "p50 B", "B/A", "p99 A", "p99 B", "B/A", "max A", "max B", "B/A", ""}};
    for (const std::string& name : names) {
        const json* sa = FindSeries(a, name);
        const json* sb = FindSeries(b, name);
        std::vector<std::string> row{name};
        for (const char* key : {"p50", "p99", "max"}) {
            const double va = sa ? Number(*sa, key) : NAN, vb = sb ? Number(*sb, key) : NAN;
            row.push_back(Cell(va));
            row.push_back(Cell(vb));
            row.push_back(va > 0 ? Cell(vb / va, "%.2fx") : "-");
        }
        row.push_back(!sa ? "only in B" : !sb ? "only in A" : "");
        rows.push_back(row);
    }
    std::string text = Describe("A", argv[0], a) + Describe("B", argv[1], b) +
                       "\nLateness in microseconds, side by side; B/A below 1 is better in B\n" +
                       qtools::FormatColumns(rows);
    // The machine's own stalls, where the surveys measured them: a B that
    // looks worse on a noisier machine is not a worse library.
    text += "\nmachine stalls, longest per window p99 / max (us):";
    for (const auto& [label, doc] : {std::pair{"A", &a}, std::pair{"B", &b}}) {
        const json noise = doc->value("machine_noise", json());
        const std::string mode = noise.is_object() ? noise.value("mode", std::string("off")) : "off";
        text += std::string(" ") + label + " " +
                (mode == "off" ? "not measured"
                               : Cell(Number(noise, "stall_p99")) + " / " + Cell(Number(noise, "stall_max")));
        text += label[0] == 'A' ? "," : "\n";
    }
    std::fputs(text.c_str(), out);
    return kExitOk;
}

}  // namespace qprobe
