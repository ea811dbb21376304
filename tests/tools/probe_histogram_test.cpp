// The per-microsecond histogram file, in the layout real-time latency tools
// write: a row per microsecond, a column per series, '#' summary lines.
#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <vector>

#include "HistogramFile.h"

namespace {

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> out;
    std::istringstream in(text);
    for (std::string l; std::getline(in, l);) out.push_back(l);
    return out;
}

std::string LineStarting(const std::vector<std::string>& lines, const std::string& prefix) {
    for (const std::string& l : lines) {
        if (l.rfind(prefix, 0) == 0) return l;
    }
    return "";
}

TEST(ProbeHistogramFile, RowsColumnsAndSummary) {
    qtools::LatencyHistogram a, b, off;
    for (double v : {0.4, 0.96, 1.0, 1.94, 2.0, 4.99, 7.0}) a.Add(v);  // 0.96 and 1.94 in row 1, 4.99 in 5
    for (double v : {3.0, 12.0, 9000.0, -1.5}) b.Add(v);                // 12 and 9000 overflow; one early
    off.Add(1.0);                                                       // not measured: shown as zeros
    const std::string text = qtools::FormatHistogramFile(
        {{"baseline", &a, true}, {"plain-wait", &b, true}, {"tick", &off, false}}, 10, "title here");
    const std::vector<std::string> lines = Lines(text);

    EXPECT_EQ(lines.front(), "# title here");
    EXPECT_EQ(LineStarting(lines, "# columns:"), "# columns: us baseline plain-wait tick");
    EXPECT_EQ(LineStarting(lines, "# not measured"), "# not measured (all zero): tick");
    std::vector<std::string> rows;
    for (const std::string& l : lines) {
        if (l[0] != '#') rows.push_back(l);
    }
    ASSERT_EQ(rows.size(), 10u);  // 0 .. 9 us
    const char* want[] = {"000000\t000001\t000000\t000000", "000001\t000003\t000000\t000000",
                          "000002\t000001\t000000\t000000", "000003\t000000\t000001\t000000",
                          "000004\t000000\t000000\t000000", "000005\t000001\t000000\t000000",
                          "000006\t000000\t000000\t000000", "000007\t000001\t000000\t000000"};
    for (std::size_t i = 0; i < std::size(want); ++i) EXPECT_EQ(rows[i], want[i]) << i;
    EXPECT_EQ(rows[9], "000009\t000000\t000000\t000000");

    EXPECT_EQ(LineStarting(lines, "# Total:"), "# Total: 000000007 000000003 000000000");
    EXPECT_EQ(LineStarting(lines, "# Min Latencies:"), "# Min Latencies: 00000 00003 00000");
    EXPECT_EQ(LineStarting(lines, "# Avg Latencies:"), "# Avg Latencies: 00003 02253 00000");
    EXPECT_EQ(LineStarting(lines, "# Max Latencies:"), "# Max Latencies: 00007 09000 00000");
    EXPECT_EQ(LineStarting(lines, "# Histogram Overflows:"), "# Histogram Overflows: 000000000 000000002 000000000");
    EXPECT_EQ(LineStarting(lines, "# Early Returns:"), "# Early Returns: 00000 00001 00000");
    // The summary comes after the rows.
    EXPECT_EQ(lines.back().rfind("# Early Returns:", 0), 0u);
}

}  // namespace
