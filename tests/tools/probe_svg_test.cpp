// The latency histogram: well-formed XML, exactly one curve per series (the
// baseline included), coordinates inside the image, labelled axes.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "SvgPlot.h"

using qtools::PlotSeries;

namespace {

// Python's XML parser accepts it (true when there is no python3).
bool WellFormed(const std::string& svg) {
    if (std::system("command -v python3 >/dev/null 2>&1") != 0) return true;
    char path[] = "/tmp/probe_svg_XXXXXX";
    close(mkstemp(path));
    std::ofstream(path) << svg;
    const int status = std::system(
        (std::string("python3 -c 'import xml.dom.minidom,sys; xml.dom.minidom.parse(sys.argv[1])' ") + path).c_str());
    unlink(path);
    return status == 0;
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

// Ordinary series; then an empty baseline, a name needing escapes, early and
// huge values.
TEST(ProbeSvg, OneCurvePerSeriesInsideTheImage) {
    const struct {
        std::vector<PlotSeries> series;
        std::vector<const char*> has;
    } cases[] = {
        {{{"baseline", Spread(20, 900, 500)}, {"plain-wait", Spread(25, 1500, 500)}, {"tick", Spread(0, 4000, 3000)}},
         {"curve curve-baseline\"", "curve curve-plain-wait\"", "curve curve-tick\"", "lateness",
          "samples per bucket", ">1 us<", ">10 ms<", ">1000<"}},  // 3000 samples need the 1000 line
        {{{"baseline", {}}, {"a <b> & \"c\"", {-3.0, 5.0, 7.0}}, {"huge", {2.5e6}}},
         {"curve curve-baseline\"", "curve curve-a__b_____c_\"", "a &lt;b&gt; &amp; &quot;c&quot;",
          "1 early, not plotted", ">10 s<"}},
    };
    const qtools::PlotOptions options;
    for (const auto& c : cases) {
        const std::string svg = qtools::RenderLatencyHistogram(c.series, options);
        EXPECT_TRUE(WellFormed(svg));
        EXPECT_EQ(Count(svg, "<polyline"), 3);
        EXPECT_EQ(Count(svg, "<path"), 0);
        for (const char* text : c.has) EXPECT_EQ(Count(svg, text) > 0, true) << text;
        for (const char* curve : {"curve curve-baseline\"", "curve curve-a__b_____c_\"", "curve curve-tick\""}) {
            EXPECT_LE(Count(svg, curve), 1) << curve;
        }
        const auto pts = CurvePoints(svg);
        ASSERT_GT(pts.size(), 3u);
        for (const auto& [x, y] : pts) {
            EXPECT_TRUE(x >= 0 && x <= options.width && y >= 0 && y <= options.height) << x << "," << y;
        }
    }
}

}  // namespace
