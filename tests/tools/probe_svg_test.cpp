// The tail plot: well-formed XML, one curve per measured series with the
// baseline drawn last (on top), curves that fall from left to right and stay
// inside the image, a p99 marker per series at its p99, labelled axes, and
// series that were not measured named without a curve.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <cstdlib>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "SvgPlot.h"

using qtools::LatencyHistogram;
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

std::vector<std::pair<double, double>> Points(const std::string& list) {
    std::vector<std::pair<double, double>> pts;
    const std::regex pair("(-?[0-9.]+),(-?[0-9.]+)");
    for (std::sregex_iterator p(list.begin(), list.end(), pair), end; p != end; ++p) {
        pts.emplace_back(std::stod((*p)[1]), std::stod((*p)[2]));
    }
    return pts;
}

// Curve class -> its points, in document order.
std::vector<std::pair<std::string, std::vector<std::pair<double, double>>>> Curves(const std::string& svg) {
    std::vector<std::pair<std::string, std::vector<std::pair<double, double>>>> out;
    const std::regex curve("<polyline class=\"curve curve-([^\"]*)\"[^>]*points=\"([^\"]*)\"");
    for (std::sregex_iterator it(svg.begin(), svg.end(), curve), end; it != end; ++it) {
        out.emplace_back((*it)[1], Points((*it)[2]));
    }
    return out;
}

LatencyHistogram Spread(double from, double to, int n) {
    LatencyHistogram h;
    for (int i = 0; i < n; ++i) h.Add(from + (to - from) * i / (n - 1));
    return h;
}

TEST(ProbeSvg, TailPlotWithTheBaselineOnTop) {
    const LatencyHistogram base = Spread(20, 900, 500), wait = Spread(25, 1500, 500), tick = Spread(0, 4000, 3000);
    LatencyHistogram odd;
    for (double v : {-3.0, 5.0, 7.0, 2.5e6}) odd.Add(v);
    const std::vector<PlotSeries> series{{"baseline", &base, true, ""},
                                         {"plain-wait", &wait, true, ""},
                                         {"tick", &tick, true, ""},
                                         {"a <b> & \"c\"", &odd, true, ""},
                                         {"event-own-sem", nullptr, false, "not measured: no timer"}};
    const qtools::PlotOptions options;
    const std::string svg = qtools::RenderTailPlot(series, options);
    EXPECT_TRUE(WellFormed(svg));

    const auto curves = Curves(svg);
    ASSERT_EQ(curves.size(), 4u);  // not the series that was not measured
    EXPECT_EQ(Count(svg, "<polyline"), 4);
    EXPECT_EQ(curves.back().first, "baseline");  // drawn last: on top
    EXPECT_EQ(curves[2].first, "a__b_____c_");
    for (const char* text : {"a &lt;b&gt; &amp; &quot;c&quot;", "1 early, not plotted", "not measured: no timer",
                             "event-own-sem", "lateness x", "wakes later than x", ">1 µs<", ">1 s<", ">100 %<",
                             ">1 %<", ">0.01 %<"}) {
        EXPECT_GT(Count(svg, text), 0) << text;
    }
    // Each curve falls (y grows downwards) as x grows, inside the image.
    for (const auto& [name, pts] : curves) {
        ASSERT_GT(pts.size(), 3u) << name;
        for (std::size_t i = 0; i < pts.size(); ++i) {
            const auto [x, y] = pts[i];
            EXPECT_TRUE(x >= 0 && x <= options.width && y >= 0 && y <= options.height) << name << " " << x << "," << y;
            if (i > 0) {
                EXPECT_GE(x, pts[i - 1].first) << name;
                EXPECT_GE(y, pts[i - 1].second) << name;
            }
        }
    }
    // A p99 marker per drawn series, on the 1 % line where that series'
    // curve crosses it: the baseline's (p99 891.2 us) left of plain-wait's.
    EXPECT_EQ(Count(svg, "class=\"p99 p99-"), 4);
    const std::regex circle("class=\"p99 p99-plain-wait\" cx=\"([0-9.]+)\"");
    const std::regex diamond("class=\"p99 p99-baseline\" points=\"([0-9.]+),");
    std::smatch c, d;
    ASSERT_TRUE(std::regex_search(svg, c, circle));
    ASSERT_TRUE(std::regex_search(svg, d, diamond));
    EXPECT_LT(std::stod(d[1]), std::stod(c[1]));
    EXPECT_NE(svg.find("891.2 µs"), std::string::npos);     // the baseline's p99 in the legend
    EXPECT_NE(svg.find("1.49 ms (1.67×)"), std::string::npos);  // plain-wait's, and its ratio
}

}  // namespace
