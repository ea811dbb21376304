// quelta-probe as a user runs it: a short survey with every output file, and
// the errors and exit statuses of bad command lines.
#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <string>

#include "TestSupport.h"
#include "probe_json_reader.h"

using probejson::Value;

namespace {

const std::string kProbe = std::string(QUELTA_BINARY_DIR) + "/tools/quelta-probe";

struct ProbeRun {
    int status = -1;
    std::string output;  // stdout and stderr
};

ProbeRun Probe(const std::string& args) {
    ProbeRun r;
    FILE* p = popen((kProbe + " " + args + " 2>&1 </dev/null").c_str(), "r");
    if (p == nullptr) return r;
    char buf[512];
    while (fgets(buf, sizeof buf, p)) r.output += buf;
    const int s = pclose(p);
    r.status = WIFEXITED(s) ? WEXITSTATUS(s) : -1;
    return r;
}

class ProbeCli : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(access(kProbe.c_str(), X_OK), 0) << kProbe << " is not built";
        char tmpl[] = "/tmp/probe_cli_XXXXXX";
        ASSERT_NE(mkdtemp(tmpl), nullptr);
        dir_ = tmpl;
    }
    void TearDown() override {
        if (!dir_.empty()) std::system(("rm -rf '" + dir_ + "'").c_str());
    }
    std::string dir_;
};

TEST_F(ProbeCli, ShortSurveyWritesEveryOutput) {
    const std::string json = dir_ + "/p.json", svg = dir_ + "/p.svg", trace = dir_ + "/t.json";
    const ProbeRun r = Probe("--duration 2 --json " + json + " --svg " + svg + " --trace " + trace);
    // Without real-time privilege the library's timer thread does not serve,
    // and its event waits return at once: the probe reports that (status 3).
    const bool realtime = testsupport::CanUseRealtime();
    ASSERT_TRUE(r.status == 0 || (!realtime && r.status == 3)) << r.output;
    EXPECT_NE(r.output.find("baseline"), std::string::npos) << r.output;
    EXPECT_NE(r.output.find("ns/call"), std::string::npos) << r.output;
    EXPECT_EQ(r.output.find('\r'), std::string::npos);  // no progress line without a terminal
    Value doc;
    ASSERT_TRUE(probejson::Parse(probejson::ReadFile(json), doc));
    EXPECT_EQ(doc["schema"].s, "quelta-probe/1");
    EXPECT_GE(doc["duration_s"].n, 2.0);
    EXPECT_GE(doc["machine"]["cpus"].n, 1);
    const char* names[] = {"baseline", "plain-wait", "tick", "event-own-sem", "event-timeout", "global-wait",
                           "callback-time"};
    ASSERT_EQ(doc["series"].items.size(), 7u);
    for (std::size_t i = 0; i < 7; ++i) {
        const Value& s = doc["series"][i];
        EXPECT_EQ(s["name"].s, names[i]);
        if (!realtime) continue;
        EXPECT_GT(s["count"].n, 10) << names[i];
        EXPECT_EQ(s["early"].n, 0) << names[i];
        EXPECT_EQ(s["failed"].n, 0) << names[i];
        EXPECT_GE(s["min"].n, 0) << names[i];
        EXPECT_LE(s["p50"].n, s["p99"].n);
    }
    ASSERT_GE(doc["costs"].items.size(), 7u);
    for (const Value& c : doc["costs"].items) EXPECT_GT(c["ns_per_call"].n, 0) << c["name"].s;

    Value t;
    ASSERT_TRUE(probejson::Parse(probejson::ReadFile(trace), t));
    int spans = 0, tracks = 0, ticks = 0;
    for (const Value& e : t["traceEvents"].items) {
        spans += e["ph"].s == "X";
        tracks += e["ph"].s == "M" && e["name"].s == "thread_name";
        ticks += e["ph"].s == "i" && e["name"].s == "tick";
    }
    EXPECT_GT(spans, 60);  // every sample a span
    EXPECT_TRUE(!realtime || ticks > 100) << ticks;
    EXPECT_EQ(tracks, static_cast<int>(doc["machine"]["cpus"].n));

    const std::string svgText = probejson::ReadFile(svg);
    EXPECT_EQ(svgText.rfind("<?xml", 0), 0u);
    int curves = 0;
    for (auto p = svgText.find("<polyline"); p != std::string::npos; p = svgText.find("<polyline", p + 1)) ++curves;
    EXPECT_EQ(curves, 7);
}

// --help prints a manual page; bad usage exits with 1 and points at --help,
// library problems with 2, an unwritable output with 4: none runs a survey.
TEST_F(ProbeCli, ErrorsExitWithTheirStatus) {
    const std::string notLib = dir_ + "/not-a-library.so";
    std::ofstream(notLib) << "not an ELF file\n";
    const struct {
        std::string args;
        int status;
        const char* message;
    } cases[] = {
        {"--help", 0, "\nEXIT STATUS\n"},
        {"--duration 0", 1, "out of range"},
        {"--duration 3601", 1, "out of range"},
        {"--duration 2x", 1, "whole number"},
        {"--duration", 1, "needs a value"},
        {"--bogus", 1, "unknown option '--bogus'"},
        {"extra", 1, "unexpected argument 'extra'"},
        {"--library " + dir_ + "/missing/libquelta.so.6", 2, "No such file"},
        {"--library " + notLib, 2, "cannot load library"},
        {"--library libm.so.6", 2, "lacks symbol"},  // loads, but is not this library
        {"--duration 1 --json " + dir_ + "/no/such/dir/p.json", 4, "--json"},
    };
    for (const auto& c : cases) {
        const ProbeRun r = Probe(c.args);
        EXPECT_EQ(r.status, c.status) << c.args << ": " << r.output;
        EXPECT_NE(r.output.find(c.message), std::string::npos) << c.args << ": " << r.output;
        EXPECT_TRUE(c.status != 1 || r.output.find("--help") != std::string::npos) << c.args;
        EXPECT_TRUE(c.status == 0 ? r.output.rfind("NAME\n", 0) == 0 : r.output.find("ns/call") == std::string::npos)
            << c.args;
    }
}

}  // namespace
