// quelta-probe as a user runs it: a short survey with every output file, and
// the errors and exit statuses of bad command lines.
#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
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
    const std::string cmd = kProbe + " " + args + " 2>&1 </dev/null";
    FILE* p = popen(cmd.c_str(), "r");
    if (p == nullptr) return r;
    char buf[512];
    while (fgets(buf, sizeof buf, p)) r.output += buf;
    const int s = pclose(p);
    r.status = WIFEXITED(s) ? WEXITSTATUS(s) : -1;
    return r;
}

bool Exists(const std::string& path) {
    struct stat st{};
    return stat(path.c_str(), &st) == 0 && st.st_size > 0;
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
    if (realtime) {
        ASSERT_EQ(r.status, 0) << r.output;
    } else {
        ASSERT_TRUE(r.status == 0 || r.status == 3) << r.output;
    }
    EXPECT_NE(r.output.find("baseline"), std::string::npos) << r.output;
    EXPECT_NE(r.output.find("ns/call"), std::string::npos) << r.output;
    EXPECT_EQ(r.output.find('\r'), std::string::npos);  // no progress line without a terminal
    ASSERT_TRUE(Exists(json) && Exists(svg) && Exists(trace));

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
    if (realtime) {
        EXPECT_GT(ticks, 100);
    }
    EXPECT_EQ(tracks, static_cast<int>(doc["machine"]["cpus"].n));

    const std::string svgText = probejson::ReadFile(svg);
    EXPECT_EQ(svgText.rfind("<?xml", 0), 0u);
    int curves = 0;
    for (std::size_t p = svgText.find("<polyline"); p != std::string::npos; p = svgText.find("<polyline", p + 1)) {
        ++curves;
    }
    EXPECT_EQ(curves, 7);
    if (std::system("command -v python3 >/dev/null 2>&1") == 0) {
        const std::string cmd = "python3 -c 'import xml.dom.minidom,sys; xml.dom.minidom.parse(sys.argv[1])' " + svg;
        EXPECT_EQ(std::system(cmd.c_str()), 0);
    }
}

TEST_F(ProbeCli, UsageErrorsExitWithOne) {
    struct Case {
        const char* args;
        const char* message;
    } cases[] = {
        {"--duration 0", "out of range"},
        {"--duration 3601", "out of range"},
        {"--duration 2x", "whole number"},
        {"--duration", "needs a value"},
        {"--bogus", "unknown option '--bogus'"},
        {"extra", "unexpected argument 'extra'"},
    };
    for (const Case& c : cases) {
        const ProbeRun r = Probe(c.args);
        EXPECT_EQ(r.status, 1) << c.args << ": " << r.output;
        EXPECT_NE(r.output.find(c.message), std::string::npos) << c.args << ": " << r.output;
        EXPECT_NE(r.output.find("--help"), std::string::npos) << c.args;
    }
}

TEST_F(ProbeCli, LibraryProblemsExitWithTwo) {
    ProbeRun r = Probe("--library " + dir_ + "/missing/libquelta.so.6");
    EXPECT_EQ(r.status, 2) << r.output;
    EXPECT_NE(r.output.find("No such file"), std::string::npos) << r.output;

    const std::string notLib = dir_ + "/not-a-library.so";
    FILE* f = fopen(notLib.c_str(), "w");
    ASSERT_NE(f, nullptr);
    fputs("not an ELF file\n", f);
    fclose(f);
    r = Probe("--library " + notLib);
    EXPECT_EQ(r.status, 2) << r.output;
    EXPECT_NE(r.output.find("cannot load library"), std::string::npos) << r.output;

    r = Probe("--library libm.so.6");  // loads, but is not this library
    EXPECT_EQ(r.status, 2) << r.output;
    EXPECT_NE(r.output.find("lacks symbol"), std::string::npos) << r.output;
}

TEST_F(ProbeCli, UnwritableOutputExitsWithFourBeforeSurveying) {
    const ProbeRun r = Probe("--duration 1 --json " + dir_ + "/no/such/dir/p.json");
    EXPECT_EQ(r.status, 4) << r.output;
    EXPECT_NE(r.output.find("--json"), std::string::npos) << r.output;
    EXPECT_EQ(r.output.find("baseline"), std::string::npos);  // no survey ran
}

TEST_F(ProbeCli, HelpReadsLikeAManualPage) {
    const ProbeRun r = Probe("--help");
    EXPECT_EQ(r.status, 0);
    for (const char* section : {"NAME", "SYNOPSIS", "DESCRIPTION", "OPTIONS", "OUTPUT", "EXIT STATUS", "EXAMPLES"}) {
        EXPECT_NE(("\n" + r.output).find(std::string("\n") + section + "\n"), std::string::npos) << section;
    }
    EXPECT_EQ(r.output.rfind("NAME\n", 0), 0u);
}

}  // namespace
