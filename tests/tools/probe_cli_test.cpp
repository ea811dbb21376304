// quelta-probe as a user runs it: the main job as scripts/probe.sh starts it
// (its defaults, then the user's options, which win), a survey ended by a
// signal, every documented example, machine stalls, compare, a run without
// real-time privilege, the probe outside its build tree, and bad command
// lines refused before any survey.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <linux/capability.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
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
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"

using nlohmann::json;

namespace {

const std::string kProbe = std::string(QUELTA_BINARY_DIR) + "/tools/quelta-probe";
const char* const kSeries[] = {"baseline", "plain-wait", "tick", "event-own-sem", "event-timeout", "global-wait",
                               "callback-time"};

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

bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// The files scripts/probe.sh asks for, in build/.
const char* const kScriptFiles[] = {"probe.json", "probe.svg", "probe-histogram.txt", "probe-samples.csv",
                                    "probe-trace.json"};

// The probe's arguments as scripts/probe.sh passes them (read from its exec
// line), with `dir` for its build/ directory and the user's after its own.
std::vector<std::string> AsTheScriptRunsIt(const std::string& dir, const std::vector<std::string>& user) {
    const std::string script = ReadFile(std::string(QUELTA_SOURCE_DIR) + "/scripts/probe.sh");
    std::string line;
    for (std::size_t at = script.find("\nexec "); at != std::string::npos && line.find("\"$@\"") == std::string::npos;) {
        const std::size_t end = script.find('\n', at + 1);
        line += script.substr(at + 1, end - at - 1);
        at = end;
    }
    std::vector<std::string> args;
    std::istringstream words(line);
    for (std::string w; words >> w;) {
        w.erase(std::remove(w.begin(), w.end(), '"'), w.end());
        if (w == "$@") args.insert(args.end(), user.begin(), user.end());
        if (w == "exec" || w == "\\" || w == "$@" || w.find("/quelta-probe") != std::string::npos) continue;
        if (w.rfind("$root/build/", 0) == 0) w = dir + "/" + w.substr(12);
        args.push_back(w);
    }
    EXPECT_TRUE(args.size() > user.size() && std::equal(user.rbegin(), user.rend(), args.rbegin())) << line;
    return args;
}

// The documented examples: the lines of `text` from `section` on that are
// `lead` followed by a quelta-probe command, with the manual's escapes undone.
std::vector<std::string> Examples(const std::string& text, const std::string& section, const std::string& lead) {
    std::vector<std::string> out;
    for (const std::string& l : Lines(text.substr(std::min(text.find(section), text.size())))) {
        if (l.rfind(lead + "quelta-probe", 0) != 0) continue;
        std::string cmd = l.substr(lead.size());
        for (auto [from, to] : {std::pair{"\\-", "-"}, std::pair{"\\(aq", "'"}}) {
            for (std::size_t p; (p = cmd.find(from)) != std::string::npos;) cmd.replace(p, std::strlen(from), to);
        }
        out.push_back(cmd);
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
    }
    void TearDown() override {
        if (!dir_.empty()) {
            EXPECT_EQ(std::system(("rm -rf '" + dir_ + "'").c_str()), 0);
        }
    }

    // Runs `binary args...` with standard output and error in files; `child`
    // runs in the child before exec, `during` in the parent while it runs.
    ProbeRun Run(const std::vector<std::string>& args, const std::function<void()>& child = {},
                 const std::function<void(pid_t)>& during = {}, const std::string& binary = kProbe) {
        const std::string out = dir_ + "/stdout", err = dir_ + "/stderr";
        unlink(out.c_str());  // nothing of an earlier run for `during` to see
        unlink(err.c_str());
        const pid_t pid = fork();
        if (pid == 0) {
            const int in = open("/dev/null", O_RDONLY);
            const int o = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
            const int e = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
            dup2(in, 0), dup2(o, 1), dup2(e, 2);
            if (child) child();
            std::vector<char*> argv{const_cast<char*>(binary.c_str())};
            for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
            argv.push_back(nullptr);
            execv(binary.c_str(), argv.data());
            _exit(127);
        }
        ProbeRun r;
        if (pid < 0) return r;
        if (during) during(pid);
        int status = 0;
        waitpid(pid, &status, 0);
        r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        r.out = ReadFile(out);
        r.err = ReadFile(err);
        return r;
    }

    std::string dir_;
};

// The CSV's rows per series, after checking the header and every row's shape.
std::map<std::string, int> CsvCounts(const std::string& text) {
    const std::vector<std::string> lines = Lines(text);
    EXPECT_FALSE(lines.empty());
    if (lines.empty()) return {};
    EXPECT_EQ(lines[0], "time_s,series,lateness_us");
    std::map<std::string, int> counts;
    for (std::size_t i = 1; i < lines.size(); ++i) {
        char name[64];
        double t = 0, late = 0;
        const bool ok = std::sscanf(lines[i].c_str(), "%lf,%63[^,],%lf", &t, name, &late) == 3;
        EXPECT_TRUE(ok && t > -1.0) << lines[i];
        if (ok) ++counts[name];
    }
    return counts;
}

// The histogram file: rows 0 .. maxUs-1 with one column per series, then the
// summary; returns Total + Early Returns per column.
std::vector<long> HistogramCounts(const std::string& text, int maxUs) {
    int rows = 0;
    std::vector<long> total, early;
    for (const std::string& l : Lines(text)) {
        if (l.rfind("#", 0) != 0) {
            std::istringstream in(l);
            std::string bucket;
            in >> bucket;
            EXPECT_EQ(std::stoi(bucket), rows) << l;
            int columns = 0;
            for (long n; in >> n;) ++columns;
            EXPECT_EQ(columns, 7) << l;
            ++rows;
            continue;
        }
        for (auto [prefix, into] : {std::pair{"# Total:", &total}, std::pair{"# Early Returns:", &early}}) {
            if (l.rfind(prefix, 0) != 0) continue;
            std::istringstream in(l.substr(std::string(prefix).size()));
            for (long n; in >> n;) into->push_back(n);
        }
    }
    EXPECT_EQ(rows, maxUs);
    EXPECT_EQ(total.size(), 7u);
    EXPECT_EQ(early.size(), 7u);
    for (std::size_t i = 0; i < std::min(total.size(), early.size()); ++i) total[i] += early[i];
    return total;
}

// The main job with the user's options after the script's: a two-second
// survey on one CPU with every output elsewhere, the JSON to standard
// output, the tables to standard error. Every file agrees with the JSON; the
// machine's stalls are measured beside every series.
TEST_F(ProbeCli, SurveyWritesEveryOutput) {
    const bool realtime = testsupport::CanUseRealtime();
    const int cpu = static_cast<int>(sysconf(_SC_NPROCESSORS_ONLN)) - 1;
    const std::string svg = dir_ + "/p.svg", trace = dir_ + "/t.json", csv = dir_ + "/s.csv", hist = dir_ + "/h.txt";
    const ProbeRun r = Run(AsTheScriptRunsIt(dir_, {"--duration", "2", "--json", "-", "--svg", svg, "--trace", trace,
                                                    "--csv", csv, "--histogram", hist, "--histogram-max", "2000",
                                                    "--cpu", std::to_string(cpu), "--priority", "50"}));
    ASSERT_EQ(r.status, 0) << r.out << r.err;
    for (const char* f : kScriptFiles) EXPECT_FALSE(Exists(dir_ + "/" + f)) << f;  // every one overridden
    ASSERT_TRUE(json::accept(r.out)) << r.out;  // nothing but the JSON on standard output
    const json doc = json::parse(r.out);
    for (const char* text : {"baseline", "p99/base", "files:", svg.c_str(), trace.c_str(), csv.c_str(), hist.c_str(),
                             "standard output"}) {
        EXPECT_NE(r.err.find(text), std::string::npos) << text << "\n" << r.err;
    }
    EXPECT_EQ(r.err.find('\r'), std::string::npos);  // no progress line without a terminal
    EXPECT_EQ(doc["library"], std::string(QUELTA_BINARY_DIR) + "/libquelta.so.6");  // the one built here
    EXPECT_GE(doc["duration_s"].get<double>(), 2.0);
    EXPECT_LT(doc["duration_s"].get<double>(), 9.0);
    EXPECT_NE(doc["machine_noise"]["mode"], "off");
    EXPECT_GT(doc["machine_noise"]["measured_s"].get<double>(), 0.0);
    EXPECT_EQ(doc["survey_cpus"], json({cpu}));
    EXPECT_EQ(doc["machine"]["priority"], realtime ? 50 : 0);
    ASSERT_EQ(doc["series"].size(), 7u);
    std::map<std::string, long> counts;
    for (std::size_t i = 0; i < 7; ++i) {
        const json& s = doc["series"][i];
        EXPECT_EQ(s["name"], kSeries[i]);
        EXPECT_EQ(s["early"], 0) << kSeries[i];
        counts[kSeries[i]] = s["count"].get<long>();
        if (!realtime && i != 0 && i != 1) continue;
        EXPECT_TRUE(s["measured"].get<bool>()) << kSeries[i];
        EXPECT_GT(s["count"].get<long>(), 10) << kSeries[i];
        EXPECT_EQ(s["failed"], 0) << kSeries[i];
        EXPECT_GT(s["machine_stall_count"].get<long>(), 10) << kSeries[i];
    }
    EXPECT_GE(doc["costs"].size(), 7u);

    // CSV and histogram hold every sample of every series.
    const std::map<std::string, int> rows = CsvCounts(ReadFile(csv));
    const std::vector<long> columns = HistogramCounts(ReadFile(hist), 2000);
    for (std::size_t i = 0; i < 7; ++i) {
        const auto it = rows.find(kSeries[i]);
        EXPECT_EQ(it == rows.end() ? 0 : it->second, counts[kSeries[i]]) << kSeries[i];
        if (i < columns.size()) {
            EXPECT_EQ(columns[i], counts[kSeries[i]]) << kSeries[i];
        }
    }

    // The trace: every wait a span on the survey's CPU, with its deadline
    // and lateness; the late ones named so, and later than the baseline's p99.
    const json t = json::parse(ReadFile(trace));
    const double baseP99 = doc["series"][0]["p99"].get<double>();
    int spans = 0, late = 0;
    for (const json& e : t["traceEvents"]) {
        if (e["ph"] != "X") continue;
        ++spans;
        const std::string name = e["name"];
        ASSERT_TRUE(e["args"].contains("deadline_us") && e["args"].contains("lateness_us")) << e.dump();
        const double lateness = e["args"]["lateness_us"].get<double>();
        // The span's end comes from the log's stamps, the lateness from the
        // survey's own readings: the two agree loosely (a preempted or
        // instrumented run puts up to milliseconds between them).
        EXPECT_NEAR(e["args"]["deadline_us"].get<double>() + lateness, e["ts"].get<double>() + e["dur"].get<double>(),
                    10000.0) << e.dump();
        EXPECT_EQ(name.find(" LATE") != std::string::npos, lateness > baseP99) << e.dump();
        late += name.find(" LATE") != std::string::npos;
        if (name.rfind("callback-time", 0) != 0) {
            EXPECT_EQ(e["tid"], cpu) << e.dump();
        }
    }
    EXPECT_GT(spans, 60);
    EXPECT_LT(late, spans);

    const std::string plot = ReadFile(svg);
    int curves = 0;
    for (auto p = plot.find("<polyline"); p != std::string::npos; p = plot.find("<polyline", p + 1)) ++curves;
    EXPECT_EQ(curves, realtime ? 7 : 2);
}

// The README's long runs of the main job, ended by SIGINT or SIGTERM: the
// survey stops, the tables are printed and every file is written for what
// was measured.
TEST_F(ProbeCli, SignalEndsASurveyWithTheFilesWritten) {
    const std::string cpu = std::to_string(sysconf(_SC_NPROCESSORS_ONLN) - 1);
    const std::pair<int, std::vector<std::string>> forms[] = {
        {SIGINT, {"--duration", "12h", "--cpu", cpu, "--interval", "1"}},
        {SIGTERM, {"--duration", "0", "--interval", "1"}}};
    for (const auto& [sig, user] : forms) {
        SCOPED_TRACE(strsignal(sig));
        const std::string js = dir_ + "/probe.json", csv = dir_ + "/probe-samples.csv",
                          hist = dir_ + "/probe-histogram.txt", svg = dir_ + "/probe.svg",
                          trace = dir_ + "/probe-trace.json";
        for (const std::string& f : {js, csv, hist, svg, trace}) unlink(f.c_str());
        const auto start = std::chrono::steady_clock::now();
        const ProbeRun r = Run(AsTheScriptRunsIt(dir_, user), {}, [&](pid_t pid) {
            // Until the first summary line is out (or 30 s).
            for (int i = 0; i < 300 && ReadFile(dir_ + "/stdout").find("wakes,") == std::string::npos; ++i) {
                std::this_thread::sleep_for(std::chrono::milliseconds(100));
            }
            kill(pid, sig);
        });
        ASSERT_EQ(r.status, 0) << r.out << r.err;
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(60));
        EXPECT_NE(r.out.find("stopping the survey"), std::string::npos) << r.out;
        EXPECT_NE(r.out.find(" wakes, 0 early; worst us (last 1 s / all): baseline "), std::string::npos) << r.out;
        EXPECT_NE(r.out.find("p99/base"), std::string::npos) << r.out;
        const json doc = json::parse(ReadFile(js));
        EXPECT_EQ(doc["interrupted"], true);
        EXPECT_GT(doc["duration_s"].get<double>(), 0.5);
        EXPECT_TRUE(doc["costs"].empty());  // skipped after a signal
        long total = 0;
        for (const json& s : doc["series"]) total += s["count"].get<long>();
        EXPECT_GT(doc["series"][0]["count"].get<long>(), 10);
        int csvRows = 0;
        for (const auto& [name, n] : CsvCounts(ReadFile(csv))) csvRows += n;
        EXPECT_EQ(csvRows, total);
        long histTotal = 0;
        for (long n : HistogramCounts(ReadFile(hist), 10000)) histTotal += n;
        EXPECT_EQ(histTotal, total);
        EXPECT_NE(ReadFile(svg).find("curve-baseline"), std::string::npos);
        EXPECT_TRUE(json::accept(ReadFile(trace)));
    }
}

// Every example of --help and of the manual page (the same ones) runs as
// written, in an empty directory; a survey is shortened by a --duration 1
// after the example's own options, which wins.
TEST_F(ProbeCli, EveryDocumentedExampleRuns) {
    const std::vector<std::string> help = Examples(Run({"--help"}).out, "\nEXAMPLES\n", "    ");
    const std::vector<std::string> page =
        Examples(ReadFile(std::string(QUELTA_SOURCE_DIR) + "/docs/quelta-probe.1"), ".SH EXAMPLES", ".B ");
    EXPECT_EQ(help, page);
    ASSERT_GE(help.size(), 5u);
    for (std::string cmd : help) {
        const std::size_t compare = cmd.find(" compare "), pipe = cmd.find(" | ");
        if (compare == std::string::npos) {
            cmd.insert(std::min(pipe, cmd.size()), " --duration 1");
        } else {  // the two surveys it compares: the one an earlier example saved
            std::istringstream files(cmd.substr(compare + 9));
            for (std::string f; files >> f;) {
                EXPECT_EQ(std::system(("cd '" + dir_ + "' && { [ -e '" + f + "' ] || cp probe.json '" + f + "'; }").c_str()),
                          0) << f;
            }
        }
        const int status = std::system(("cd '" + dir_ + "' && PATH='" + QUELTA_BINARY_DIR + "/tools':\"$PATH\" && (" +
                                        cmd + ") >out.txt 2>&1").c_str());
        EXPECT_EQ(status, 0) << cmd << "\n" << ReadFile(dir_ + "/out.txt");
    }
}

// A stall the test makes itself: the whole probe stopped for 60 ms, six
// times (longer than this VM's own stalls of one CPU, up to some 20 ms). The
// thread spinning on a spare CPU sees each stop as a stall that long and
// charges it to the sample it delayed: only series with a sample that late
// are charged one.
TEST_F(ProbeCli, AStoppedMachineShowsAsStalls) {
    const long cpus = sysconf(_SC_NPROCESSORS_ONLN);
    if (cpus < 2 || !testsupport::CanUseRealtime()) GTEST_SKIP() << "needs two CPUs and SCHED_FIFO";
    const ProbeRun r = Run({"--duration", "4", "--cpu", std::to_string(cpus - 1), "--noise", "0", "--json", "-"}, {},
                           [&](pid_t pid) {
                               for (int i = 0; i < 300 && ReadFile(dir_ + "/stderr").empty(); ++i) {
                                   std::this_thread::sleep_for(std::chrono::milliseconds(100));
                               }
                               std::this_thread::sleep_for(std::chrono::milliseconds(1000));  // surveying
                               for (int i = 0; i < 6; ++i) {
                                   kill(pid, SIGSTOP);
                                   std::this_thread::sleep_for(std::chrono::milliseconds(60));
                                   kill(pid, SIGCONT);
                                   std::this_thread::sleep_for(std::chrono::milliseconds(50));
                               }
                           });
    ASSERT_EQ(r.status, 0) << r.err;
    const json doc = json::parse(r.out);
    EXPECT_EQ(doc["machine_noise"]["mode"], "spare-cpu");
    EXPECT_EQ(doc["machine_noise"]["cpu"], 0);
    EXPECT_GE(doc["machine_noise"]["stall_max"].get<double>(), 50000.0) << doc["machine_noise"].dump();
    // At least one series is charged a stop through a sample the stop made
    // late. (A stop that lands while a series computes, between its wake and
    // its record, is charged to that sample without making it late: under a
    // sanitizer that computing is long enough to be hit.)
    int charged = 0;
    for (const json& s : doc["series"]) {
        // A series with no sample in the run (a loaded machine) has no figures.
        if (s["name"] == "tick" || !s["machine_stall_max"].is_number() || !s["max"].is_number() ||
            s["machine_stall_max"].get<double>() < 50000.0) {
            continue;
        }
        charged += s["max"].get<double>() >= 40000.0;
    }
    EXPECT_GE(charged, 1) << r.out;
}

// Two saved surveys side by side: p50, p99 and max of each series with B/A,
// and the machines' stalls; a file that is missing, not JSON or of another
// schema is refused.
TEST_F(ProbeCli, CompareShowsTwoSurveysSideBySide) {
    auto survey = [this](const char* file, const char* schema, const std::string& series, const char* noise) {
        std::ofstream(dir_ + "/" + file) << "{\"schema\": \"" << schema << "\", \"machine\": {\"cpus\": 2}, "
                                         << noise << "\"series\": [" << series << "]}";
        return dir_ + "/" + file;
    };
    const std::string a = survey("a.json", "quelta-probe/1",
                                 R"({"name": "baseline", "p50": 10, "p99": 20, "max": 40},
                                    {"name": "tick", "p50": 5, "p99": null, "max": 9})", "");
    const std::string b = survey("b.json", "quelta-probe/1",
                                 R"({"name": "baseline", "p50": 12, "p99": 30, "max": 20},
                                    {"name": "global-wait", "p50": 1, "p99": 2, "max": 3})",
                                 R"("machine_noise": {"mode": "windows", "stall_p99": 35, "stall_max": 2100},)");
    const std::string other = survey("other.json", "quelta-probe/2", "", "");
    std::ofstream(dir_ + "/bad.json") << "{\"schema\": ";
    const ProbeRun r = Run({"compare", a, b});
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<std::vector<std::string>> rows;
    for (const std::string& l : Lines(r.out)) {
        std::istringstream in(l);
        rows.emplace_back(std::istream_iterator<std::string>(in), std::istream_iterator<std::string>());
    }
    const std::vector<std::vector<std::string>> want = {
        {"baseline", "10.0", "12.0", "1.20x", "20.0", "30.0", "1.50x", "40.0", "20.0", "0.50x"},
        {"tick", "5.0", "-", "-", "-", "-", "-", "9.0", "-", "-", "only", "in", "A"},
        {"global-wait", "-", "1.0", "-", "-", "2.0", "-", "-", "3.0", "-", "only", "in", "B"}};
    for (const auto& row : want) EXPECT_NE(std::find(rows.begin(), rows.end(), row), rows.end()) << row[0] << r.out;
    EXPECT_NE(r.out.find("(us): A not measured, B 35.0 / 2100.0"), std::string::npos) << r.out;

    const std::pair<std::vector<std::string>, const char*> errors[] = {
        {{"compare", a}, "needs two files"},
        {{"compare", a, dir_ + "/missing.json"}, "missing.json: No such file"},
        {{"compare", dir_ + "/bad.json", b}, "bad.json: not a JSON document"},
        {{"compare", a, other}, "other.json: schema 'quelta-probe/2', but this quelta-probe reads 'quelta-probe/1'"}};
    for (const auto& [args, message] : errors) {
        const ProbeRun e = Run(args);
        EXPECT_EQ(e.status, 1) << message;
        EXPECT_NE(e.err.find(message), std::string::npos) << e.err;
    }
}

// capset(2) without libcap: drop one capability from what an exec keeps.
void DropCapability(int cap) {
    prctl(PR_CAPBSET_DROP, cap, 0, 0, 0);
    prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0);
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2] = {};
    if (syscall(SYS_capget, &header, data) != 0) return;
    for (auto& d : data) {
        const unsigned bit = 1u << (cap % 32);
        if (&d - data == cap / 32) d.inheritable &= ~bit, d.permitted &= ~bit, d.effective &= ~bit;
    }
    syscall(SYS_capset, &header, data);
}

// A user without real-time privilege (no CAP_SYS_NICE, RLIMIT_RTPRIO 0): the
// library has no timer thread, as documented; the probe measures the
// baseline and the plain waits, shows the rest as not measured, and exits 0.
TEST_F(ProbeCli, WithoutRealtimePrivilegeThePlainSeriesAreMeasured) {
    const std::string js = dir_ + "/p.json";
    const ProbeRun r = Run({"--duration", "1", "--json", js}, [] {
        const rlimit none{0, 0};
        setrlimit(RLIMIT_RTPRIO, &none);
        DropCapability(CAP_SYS_NICE);
    });
    ASSERT_EQ(r.status, 0) << r.out << r.err;
    EXPECT_EQ(r.out.find("FAILURE"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("not measured: needs real-time privilege"), std::string::npos) << r.out;
    const json doc = json::parse(ReadFile(js));
    EXPECT_EQ(doc["machine"]["realtime"], false);
    EXPECT_EQ(doc["timer_running"], false);
    for (std::size_t i = 0; i < 7; ++i) {
        const json& s = doc["series"][i];
        const bool plain = i <= 1;
        EXPECT_EQ(s["measured"], plain) << kSeries[i];
        EXPECT_EQ(s["early"], 0) << kSeries[i];
        if (plain) EXPECT_GT(s["count"].get<long>(), 10) << kSeries[i];
        else EXPECT_EQ(s["count"], 0) << kSeries[i];
    }
}

// Outside its build tree the probe loads libquelta.so.6 through the dynamic
// loader's search, as an installed probe does; nothing points at the build.
TEST_F(ProbeCli, OutsideTheBuildTreeTheLoaderFindsTheLibrary) {
    ASSERT_EQ(mkdir((dir_ + "/bin").c_str(), 0755), 0);
    ASSERT_EQ(mkdir((dir_ + "/lib").c_str(), 0755), 0);
    const std::string probe = dir_ + "/bin/quelta-probe";
    ASSERT_EQ(std::system(("cp '" + kProbe + "' '" + probe + "' && cp -L '" + QUELTA_BINARY_DIR +
                           "/libquelta.so.6' '" + dir_ + "/lib/'").c_str()), 0);
    const ProbeRun missing = Run({"--duration", "1"}, [] { unsetenv("LD_LIBRARY_PATH"); }, {}, probe);
    if (missing.status == 2) {  // no system-wide library: it says what it looked for
        EXPECT_NE(missing.err.find("cannot load library 'libquelta.so.6'"), std::string::npos) << missing.err;
    }
    const std::string lib = dir_ + "/lib";
    const ProbeRun found = Run({"--duration", "1", "--json", "-", "--no-realtime"},
                               [lib] { setenv("LD_LIBRARY_PATH", lib.c_str(), 1); }, {}, probe);
    ASSERT_EQ(found.status, 0) << found.err;
    EXPECT_EQ(json::parse(found.out)["library"], lib + "/libquelta.so.6");
}

// Bad command lines exit 1 and point at --help, library problems 2, outputs
// that cannot be written 4: all before any survey, leaving no files behind.
TEST_F(ProbeCli, ErrorsExitWithTheirStatusBeforeAnySurvey) {
    const std::string notLib = dir_ + "/not-a-library.so";
    std::ofstream(notLib) << "not an ELF file\n";
    const std::string left = dir_ + "/left.json";
    const struct {
        std::vector<std::string> args;
        int status;
        const char* message;
    } cases[] = {
        {{"--help"}, 0, "\nEXIT STATUS\n"},
        {{"--version"}, 0, "quelta-probe 6."},
        {{"--duration", "2x"}, 1, "--duration"},
        {{"--duration", "31d"}, 1, "30 d"},
        {{"--duration"}, 1, "--duration"},
        {{"--bogus"}, 1, "--bogus"},
        {{"extra"}, 1, "extra"},
        {{"--cpu", "3-1"}, 1, "--cpu"},
        {{"--cpu", "1023"}, 1, "not online"},
        {{"--priority", "99"}, 1, "--priority"},
        {{"--priority", "5", "--no-realtime"}, 1, "contradict"},
        {{"--histogram-max", "10001"}, 1, "--histogram-max"},
        {{"--noise", "0"}, 1, "needs --cpu"},
        {{"--noise", "spare"}, 1, "--noise"},
        {{"--json", "-", "--csv", "-"}, 1, "only one output"},
        {{"--library", dir_ + "/missing/libquelta.so.6", "--json", left}, 2, "No such file"},
        {{"--library", notLib}, 2, "cannot load library"},
        {{"--library", "libm.so.6"}, 2, "lacks symbol"},  // loads, but is not this library
        {{"--json", dir_ + "/no/such/dir/p.json"}, 4, "--json"},
        {{"--csv", left, "--histogram", dir_}, 4, "is a directory"},
    };
    for (const auto& c : cases) {
        std::string line;
        for (const std::string& a : c.args) line += a + " ";
        const ProbeRun r = Run(c.args);
        const std::string all = r.out + r.err;
        EXPECT_EQ(r.status, c.status) << line << ": " << all;
        EXPECT_NE(all.find(c.message), std::string::npos) << line << ": " << all;
        EXPECT_TRUE(c.status != 1 || r.err.find("--help") != std::string::npos) << line;
        EXPECT_EQ(all.find("p99/base"), std::string::npos) << line;  // no survey ran
        EXPECT_FALSE(Exists(left)) << line;                           // nor left a file
    }
}

// Every option is accepted, and named in --help and in the manual page, which
// the build installs compressed and which renders without warnings.
TEST_F(ProbeCli, ManualPageAndHelpNameEveryOption) {
    const std::string help = Run({"--help"}).out;
    const std::string page = ReadFile(std::string(QUELTA_SOURCE_DIR) + "/docs/quelta-probe.1");
    const std::pair<const char*, const char*> options[] = {
        {"--duration", "5"}, {"--interval", "5"}, {"--cpu", "0"}, {"--priority", "5"}, {"--no-realtime", nullptr},
        {"--library", "x"},  {"--json", "x"},     {"--svg", "x"}, {"--trace", "x"},    {"--csv", "x"},
        {"--histogram", "x"}, {"--histogram-max", "5"}, {"--noise", "off"}, {"--help", nullptr},
        {"--version", nullptr}};
    for (const auto& [name, value] : options) {
        EXPECT_NE(help.find(name), std::string::npos) << name;
        std::string roff;
        for (char ch : std::string(name)) roff += ch == '-' ? "\\-" : std::string(1, ch);
        EXPECT_NE(page.find(roff), std::string::npos) << name;
        std::vector<std::string> args{name};
        if (value) args.push_back(value);
        if (std::string(name) != "--help") args.push_back("--version");  // parsed, then nothing runs
        EXPECT_EQ(Run(args).status, 0) << name;
    }
    const std::string gz = std::string(QUELTA_BINARY_DIR) + "/tools/quelta-probe.1.gz";
    ASSERT_TRUE(Exists(gz));
    EXPECT_EQ(std::system(("gzip -dc '" + gz + "' | cmp -s - '" + QUELTA_SOURCE_DIR + "/docs/quelta-probe.1'").c_str()),
              0);
    if (std::system("command -v man >/dev/null 2>&1") == 0) {
        const std::string warn = dir_ + "/man.txt";
        EXPECT_EQ(std::system(("LC_ALL=C.UTF-8 MANROFFSEQ='' MANWIDTH=80 man --warnings -E UTF-8 -l -Tutf8 -Z '" +
                               std::string(QUELTA_SOURCE_DIR) + "/docs/quelta-probe.1' >/dev/null 2>'" + warn + "'")
                                  .c_str()),
                  0);
        EXPECT_EQ(ReadFile(warn), "");
    }
}

}  // namespace
