#include "SvgPlot.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <sstream>

namespace qtools {

namespace {

// Colours that stay apart from one another on white; the first is the
// baseline's when it comes first.
const char* const kColours[] = {"#222222", "#1f77b4", "#ff7f0e", "#2ca02c", "#d62728",
                                "#9467bd", "#8c564b", "#e377c2", "#17becf", "#bcbd22"};

std::string XmlEscape(const std::string& s) {
    std::string out;
    for (char c : s) {
        switch (c) {
            case '&': out += "&amp;"; break;
            case '<': out += "&lt;"; break;
            case '>': out += "&gt;"; break;
            case '"': out += "&quot;"; break;
            case '\'': out += "&apos;"; break;
            default: out += c;
        }
    }
    return out;
}

std::string Num(double v) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%.1f", v);
    return buf;
}

// "1 us", "10 us", "100 us", "1 ms", ... and "0.1 us" below one.
std::string DecadeLabelUs(int exponent) {
    const double v = std::pow(10.0, exponent);
    char buf[32];
    if (exponent < 0) {
        std::snprintf(buf, sizeof buf, "%g us", v);
    } else if (exponent < 3) {
        std::snprintf(buf, sizeof buf, "%.0f us", v);
    } else if (exponent < 6) {
        std::snprintf(buf, sizeof buf, "%.0f ms", v / 1e3);
    } else {
        std::snprintf(buf, sizeof buf, "%.0f s", v / 1e6);
    }
    return buf;
}

std::string DecadeLabelCount(int exponent) {
    char buf[32];
    if (exponent < 4) {
        std::snprintf(buf, sizeof buf, "%.0f", std::pow(10.0, exponent));
    } else {
        std::snprintf(buf, sizeof buf, "1e%d", exponent);
    }
    return buf;
}

}  // namespace

std::string CurveClass(const std::string& name) {
    std::string out;
    for (char c : name) {
        const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                        c == '-' || c == '_';
        out += ok ? c : '_';
    }
    return out.empty() ? "_" : out;
}

std::string RenderLatencyHistogram(const std::vector<PlotSeries>& series,
                                   const PlotOptions& options) {
    const int perDecade = std::max(1, options.bucketsPerDecade);
    const double width = std::max(320, options.width);
    const double height = std::max(240, options.height);

    // The x range covers every positive sample, in whole decades, at least
    // 1 us to 1 ms. Samples at or below the low edge (zero included) fall
    // into the first bucket; negative ones (early returns) are counted apart
    // and named in the legend.
    double lo = 1.0, hi = 1000.0;
    for (const PlotSeries& s : series) {
        for (double v : s.valuesUs) {
            if (!std::isfinite(v)) continue;
            if (v > 0.0) lo = std::min(lo, std::max(v, 0.01));
            hi = std::max(hi, v);
        }
    }
    const int xDecadeLo = static_cast<int>(std::floor(std::log10(lo)));
    int xDecadeHi = static_cast<int>(std::ceil(std::log10(hi)));
    if (std::pow(10.0, xDecadeHi) <= hi) ++xDecadeHi;  // the top edge is exclusive
    const int buckets = (xDecadeHi - xDecadeLo) * perDecade;

    struct Curve {
        std::vector<double> counts;
        std::size_t early = 0;
        std::size_t total = 0;
    };
    std::vector<Curve> curves(series.size());
    double maxCount = 1.0;
    for (std::size_t i = 0; i < series.size(); ++i) {
        Curve& c = curves[i];
        c.counts.assign(static_cast<std::size_t>(buckets), 0.0);
        for (double v : series[i].valuesUs) {
            if (!std::isfinite(v)) continue;
            ++c.total;
            if (v < 0.0) {
                ++c.early;
                continue;
            }
            int b = 0;
            if (v > 0.0) {
                b = static_cast<int>(std::floor((std::log10(v) - xDecadeLo) * perDecade));
            }
            b = std::clamp(b, 0, buckets - 1);
            c.counts[static_cast<std::size_t>(b)] += 1.0;
        }
        for (double n : c.counts) maxCount = std::max(maxCount, n);
    }
    const int yDecadeHi = std::max(1, static_cast<int>(std::ceil(std::log10(maxCount) + 1e-9)));

    // Plot area.
    const double left = 80, right = width - 230, top = 60, bottom = height - 70;
    auto xOf = [&](double logUs) {
        return left + (logUs - xDecadeLo) / (xDecadeHi - xDecadeLo) * (right - left);
    };
    // Count 0 sits on the axis, one half-decade below the count 1 line.
    auto yOf = [&](double count) {
        const double l = count >= 1.0 ? std::log10(count) : -0.5;
        return bottom - (l + 0.5) / (yDecadeHi + 0.5) * (bottom - top);
    };

    std::ostringstream o;
    o << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      << "<svg xmlns=\"http://www.w3.org/2000/svg\" width=\"" << width << "\" height=\"" << height
      << "\" viewBox=\"0 0 " << width << ' ' << height << "\" font-family=\"sans-serif\">\n"
      << "<style>.grid{stroke:#dddddd;stroke-width:1}.axis{stroke:#000000;stroke-width:1.2}"
         ".curve{fill:none;stroke-width:1.8;stroke-linejoin:round}"
         "text{font-size:12px;fill:#000000}.title{font-size:16px;font-weight:bold}"
         ".subtitle{font-size:12px;fill:#444444}</style>\n"
      << "<rect x=\"0\" y=\"0\" width=\"" << width << "\" height=\"" << height << "\" fill=\"#ffffff\"/>\n"
      << "<text class=\"title\" x=\"" << left << "\" y=\"24\">" << XmlEscape(options.title) << "</text>\n";
    if (!options.subtitle.empty()) {
        o << "<text class=\"subtitle\" x=\"" << left << "\" y=\"44\">" << XmlEscape(options.subtitle)
          << "</text>\n";
    }

    // Grid, ticks and labels.
    o << "<g class=\"x-axis\">\n";
    for (int d = xDecadeLo; d <= xDecadeHi; ++d) {
        const double x = xOf(d);
        o << "<line class=\"grid\" x1=\"" << Num(x) << "\" y1=\"" << top << "\" x2=\"" << Num(x)
          << "\" y2=\"" << bottom << "\"/>\n"
          << "<line class=\"axis\" x1=\"" << Num(x) << "\" y1=\"" << bottom << "\" x2=\"" << Num(x)
          << "\" y2=\"" << bottom + 6 << "\"/>\n"
          << "<text x=\"" << Num(x) << "\" y=\"" << bottom + 20 << "\" text-anchor=\"middle\">"
          << DecadeLabelUs(d) << "</text>\n";
        if (d < xDecadeHi) {
            for (int m = 2; m <= 9; ++m) {  // minor ticks at 2..9 x the decade
                const double xm = xOf(d + std::log10(m));
                o << "<line class=\"axis\" x1=\"" << Num(xm) << "\" y1=\"" << bottom << "\" x2=\""
                  << Num(xm) << "\" y2=\"" << bottom + 3 << "\"/>\n";
            }
        }
    }
    o << "<text x=\"" << Num((left + right) / 2) << "\" y=\"" << bottom + 44
      << "\" text-anchor=\"middle\">lateness (actual wake-up minus intended time), log scale</text>\n"
      << "</g>\n<g class=\"y-axis\">\n";
    for (int d = 0; d <= yDecadeHi; ++d) {
        const double y = yOf(std::pow(10.0, d));
        o << "<line class=\"grid\" x1=\"" << left << "\" y1=\"" << Num(y) << "\" x2=\"" << right
          << "\" y2=\"" << Num(y) << "\"/>\n"
          << "<line class=\"axis\" x1=\"" << left - 6 << "\" y1=\"" << Num(y) << "\" x2=\"" << left
          << "\" y2=\"" << Num(y) << "\"/>\n"
          << "<text x=\"" << left - 10 << "\" y=\"" << Num(y + 4) << "\" text-anchor=\"end\">"
          << DecadeLabelCount(d) << "</text>\n";
    }
    o << "<text x=\"20\" y=\"" << Num((top + bottom) / 2) << "\" text-anchor=\"middle\" transform=\"rotate(-90 20 "
      << Num((top + bottom) / 2) << ")\">samples per bucket, log scale</text>\n"
      << "<line class=\"axis\" x1=\"" << left << "\" y1=\"" << bottom << "\" x2=\"" << right << "\" y2=\""
      << bottom << "\"/>\n"
      << "<line class=\"axis\" x1=\"" << left << "\" y1=\"" << top << "\" x2=\"" << left << "\" y2=\""
      << bottom << "\"/>\n</g>\n";

    // Curves: a step outline over the buckets, starting and ending on the axis.
    o << "<g class=\"curves\">\n";
    for (std::size_t i = 0; i < series.size(); ++i) {
        const char* colour = kColours[i % (sizeof kColours / sizeof kColours[0])];
        o << "<polyline class=\"curve curve-" << CurveClass(series[i].name) << "\" stroke=\"" << colour
          << "\" points=\"";
        const std::vector<double>& counts = curves[i].counts;
        double lastY = yOf(0.0);
        o << Num(xOf(xDecadeLo)) << ',' << Num(lastY);
        for (int b = 0; b < buckets; ++b) {
            const double y = yOf(counts[static_cast<std::size_t>(b)]);
            const double x0 = xOf(xDecadeLo + static_cast<double>(b) / perDecade);
            const double x1 = xOf(xDecadeLo + static_cast<double>(b + 1) / perDecade);
            if (y != lastY) o << ' ' << Num(x0) << ',' << Num(lastY) << ' ' << Num(x0) << ',' << Num(y);
            if (b == buckets - 1) {
                o << ' ' << Num(x1) << ',' << Num(y);
                if (y != yOf(0.0)) o << ' ' << Num(x1) << ',' << Num(yOf(0.0));
            }
            lastY = y;
        }
        o << "\"><title>" << XmlEscape(series[i].name) << "</title></polyline>\n";
    }
    o << "</g>\n";

    // Legend.
    o << "<g class=\"legend\">\n";
    const double lx = right + 20;
    double ly = top + 10;
    for (std::size_t i = 0; i < series.size(); ++i) {
        const char* colour = kColours[i % (sizeof kColours / sizeof kColours[0])];
        o << "<line x1=\"" << lx << "\" y1=\"" << Num(ly - 4) << "\" x2=\"" << lx + 24 << "\" y2=\""
          << Num(ly - 4) << "\" stroke=\"" << colour << "\" stroke-width=\"3\"/>\n"
          << "<text x=\"" << lx + 32 << "\" y=\"" << Num(ly) << "\">" << XmlEscape(series[i].name) << " ("
          << curves[i].total << ")</text>\n";
        if (curves[i].early > 0) {
            ly += 16;
            o << "<text x=\"" << lx + 32 << "\" y=\"" << Num(ly) << "\" fill=\"#d62728\">" << curves[i].early
              << " early, not plotted</text>\n";
        }
        ly += 22;
    }
    o << "</g>\n</svg>\n";
    return o.str();
}

}  // namespace qtools
