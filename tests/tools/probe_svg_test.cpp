// The latency histogram: well-formed XML, exactly one curve per series (the
// baseline included), coordinates inside the image, labelled axes.
#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "SvgPlot.h"

using qtools::PlotSeries;

namespace {

// Parses the file with Python's XML parser; "skip" when there is no python3.
std::string XmlCheck(const std::string& svg) {
    if (std::system("command -v python3 >/dev/null 2>&1") != 0) return "skip";
    char path[] = "/tmp/probe_svg_XXXXXX";
    const int fd = mkstemp(path);
    if (fd < 0) return "mkstemp failed";
    close(fd);
    std::ofstream(path) << svg;
    const std::string cmd = std::string("python3 -c 'import xml.dom.minidom,sys; xml.dom.minidom.parse(sys.argv[1])' ") +
                            path + " 2>&1";
    FILE* p = popen(cmd.c_str(), "r");
    std::string out;
    char buf[256];
    while (p && fgets(buf, sizeof buf, p)) out += buf;
    const int status = p ? pclose(p) : -1;
    unlink(path);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? "ok" : "invalid: " + out;
}

int Count(const std::string& s, const std::string& what) {
    int n = 0;
    for (std::size_t p = s.find(what); p != std::string::npos; p = s.find(what, p + 1)) ++n;
    return n;
}

// Every x,y pair of every polyline.
std::vector<std::pair<double, double>> CurvePoints(const std::string& svg) {
    std::vector<std::pair<double, double>> pts;
    const std::regex points("points=\"([^\"]*)\"");
    const std::regex pair("(-?[0-9.]+),(-?[0-9.]+)");
    for (std::sregex_iterator it(svg.begin(), svg.end(), points), end; it != end; ++it) {
        const std::string list = (*it)[1];
        for (std::sregex_iterator p(list.begin(), list.end(), pair); p != end; ++p) {
            pts.emplace_back(std::stod((*p)[1]), std::stod((*p)[2]));
        }
    }
    return pts;
}

std::vector<double> Spread(double from, double to, int n) {
    std::vector<double> v;
    for (int i = 0; i < n; ++i) v.push_back(from + (to - from) * i / (n - 1));
    return v;
}

TEST(ProbeSvg, OneCurvePerSeriesInsideTheImage) {
    std::vector<PlotSeries> series{{"baseline", Spread(20, 900, 500)},
                                   {"plain-wait", Spread(25, 1500, 500)},
                                   {"tick", Spread(0, 4000, 3000)}};
    qtools::PlotOptions options;
    const std::string svg = qtools::RenderLatencyHistogram(series, options);
    const std::string check = XmlCheck(svg);
    EXPECT_TRUE(check == "ok" || check == "skip") << check;

    EXPECT_EQ(Count(svg, "<polyline"), 3);
    EXPECT_EQ(Count(svg, "<path"), 0);
    for (const char* c : {"curve curve-baseline\"", "curve curve-plain-wait\"", "curve curve-tick\""}) {
        EXPECT_EQ(Count(svg, c), 1) << c;
    }
    const auto pts = CurvePoints(svg);
    ASSERT_GT(pts.size(), 6u);
    for (const auto& [x, y] : pts) {
        EXPECT_GE(x, 0);
        EXPECT_LE(x, options.width);
        EXPECT_GE(y, 0);
        EXPECT_LE(y, options.height);
    }
    // Axes: labels and decade ticks up to the largest value (4 ms).
    EXPECT_NE(svg.find("lateness"), std::string::npos);
    EXPECT_NE(svg.find("samples per bucket"), std::string::npos);
    EXPECT_NE(svg.find(">1 us<"), std::string::npos);
    EXPECT_NE(svg.find(">10 ms<"), std::string::npos);
    EXPECT_NE(svg.find(">1000<"), std::string::npos);  // 3000 samples need the 1000 line
}

TEST(ProbeSvg, AwkwardNamesEmptySeriesAndEarlyValues) {
    std::vector<PlotSeries> series{{"baseline", {}},
                                   {"a <b> & \"c\"", {-3.0, 5.0, 7.0}},
                                   {"huge", {2.5e6}}};
    const std::string svg = qtools::RenderLatencyHistogram(series);
    const std::string check = XmlCheck(svg);
    EXPECT_TRUE(check == "ok" || check == "skip") << check;
    EXPECT_EQ(Count(svg, "<polyline"), 3);
    EXPECT_EQ(Count(svg, "curve curve-baseline\""), 1);
    EXPECT_EQ(Count(svg, "curve curve-a__b_____c_\""), 1);
    EXPECT_NE(svg.find("a &lt;b&gt; &amp; &quot;c&quot;"), std::string::npos);
    EXPECT_NE(svg.find("1 early, not plotted"), std::string::npos);
    EXPECT_NE(svg.find(">10 s<"), std::string::npos);  // 2.5 s needs the axis to 10 s
    for (const auto& [x, y] : CurvePoints(svg)) {
        EXPECT_GE(x, 0);
        EXPECT_GE(y, 0);
    }
}

}  // namespace
