#include "SvgPlot.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <sstream>

namespace qtools {

namespace {

// Colours that stay apart from one another and from the baseline's black.
const char* const kColours[] = {"#1f77b4", "#ff7f0e", "#2ca02c", "#d62728", "#9467bd",
                                "#8c564b", "#e377c2", "#17becf", "#bcbd22"};
const char* const kBaselineColour = "#000000";

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

// "0.1 µs", "1 µs", ... "1 ms", ... "1 s".
std::string LatencyLabel(int exponent) {
    const double v = std::pow(10.0, exponent);
    char buf[32];
    if (exponent < 0) {
        std::snprintf(buf, sizeof buf, "%g µs", v);
    } else if (exponent < 3) {
        std::snprintf(buf, sizeof buf, "%.0f µs", v);
    } else if (exponent < 6) {
        std::snprintf(buf, sizeof buf, "%.0f ms", v / 1e3);
    } else {
        std::snprintf(buf, sizeof buf, "%.0f s", v / 1e6);
    }
    return buf;
}

// "100 %", "10 %", "1 %", "0.1 %", ...
std::string FractionLabel(int exponent) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%g %%", std::pow(10.0, exponent + 2));
    return buf;
}

std::string Us(double v) {
    char buf[32];
    if (v >= 1000.0) {
        std::snprintf(buf, sizeof buf, "%.2f ms", v / 1000.0);
    } else {
        std::snprintf(buf, sizeof buf, "%.1f µs", v);
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

std::string RenderTailPlot(const std::vector<PlotSeries>& series, const PlotOptions& options) {
    const int perDecade = std::max(4, options.pointsPerDecade);
    const double width = std::max(480, options.width);
    const double height = std::max(320, options.height);

    auto drawn = [](const PlotSeries& s) { return s.measured && s.histogram && s.histogram->count() > 0; };
    // x: whole decades from below the smallest first percentile (0.1 us at least) to
    // above the largest maximum, 1 us to 1 ms at least. y: 100 % down to a
    // decade below one sample of the largest series.
    double lo = 1.0, hi = 1000.0, most = 100.0;
    for (const PlotSeries& s : series) {
        if (!drawn(s)) continue;
        // The first percentile, not the minimum: a lone zero (the tick's
        // best, placed at the floor) would stretch the axis for nothing.
        lo = std::min(lo, std::max(0.1, s.histogram->Percentile(0.01)));
        hi = std::max(hi, s.histogram->max());
        most = std::max(most, static_cast<double>(s.histogram->count()));
    }
    const int xLo = static_cast<int>(std::floor(std::log10(lo) + 1e-9));
    int xHi = static_cast<int>(std::ceil(std::log10(hi) - 1e-9));
    if (xHi <= xLo) xHi = xLo + 1;
    const int yLo = -static_cast<int>(std::ceil(std::log10(most) - 1e-9));  // 10^yLo <= 1/most

    const double left = 90, right = width - 290, top = 66, bottom = height - 72;
    auto xOf = [&](double logUs) { return left + (logUs - xLo) / (xHi - xLo) * (right - left); };
    auto yOf = [&](double logFraction) { return top + (0.0 - logFraction) / (0.0 - yLo) * (bottom - top); };

    std::ostringstream o;
    o << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      << "<svg xmlns=\"http://www.w3.org/2000/svg\" width=\"" << width << "\" height=\"" << height
      << "\" viewBox=\"0 0 " << width << ' ' << height << "\" font-family=\"DejaVu Sans, Arial, sans-serif\">\n"
      << "<style>.grid{stroke:#e4e4e4;stroke-width:1}.guide{stroke:#999999;stroke-width:1;stroke-dasharray:5 4}"
         ".axis{stroke:#000000;stroke-width:1.2}.curve{fill:none;stroke-width:1.8;stroke-linejoin:round}"
         ".curve-baseline{stroke-width:3.2}"
         "text{font-size:12px;fill:#000000}.title{font-size:17px;font-weight:bold}"
         ".subtitle{font-size:12px;fill:#444444}.small{font-size:11px;fill:#555555}"
         ".off{fill:#999999}</style>\n"
      << "<rect x=\"0\" y=\"0\" width=\"" << width << "\" height=\"" << height << "\" fill=\"#ffffff\"/>\n"
      << "<text class=\"title\" x=\"" << left << "\" y=\"26\">" << XmlEscape(options.title) << "</text>\n";
    if (!options.subtitle.empty()) {
        o << "<text class=\"subtitle\" x=\"" << left << "\" y=\"46\">" << XmlEscape(options.subtitle) << "</text>\n";
    }

    // Grid and axes.
    o << "<g class=\"x-axis\">\n";
    for (int d = xLo; d <= xHi; ++d) {
        const double x = xOf(d);
        o << "<line class=\"grid\" x1=\"" << Num(x) << "\" y1=\"" << top << "\" x2=\"" << Num(x) << "\" y2=\""
          << bottom << "\"/>\n<line class=\"axis\" x1=\"" << Num(x) << "\" y1=\"" << bottom << "\" x2=\"" << Num(x)
          << "\" y2=\"" << bottom + 6 << "\"/>\n<text x=\"" << Num(x) << "\" y=\"" << bottom + 21
          << "\" text-anchor=\"middle\">" << LatencyLabel(d) << "</text>\n";
        for (int m = 2; d < xHi && m <= 9; ++m) {
            const double xm = xOf(d + std::log10(m));
            o << "<line class=\"axis\" x1=\"" << Num(xm) << "\" y1=\"" << bottom << "\" x2=\"" << Num(xm)
              << "\" y2=\"" << bottom + 3 << "\"/>\n";
        }
    }
    o << "<text x=\"" << Num((left + right) / 2) << "\" y=\"" << bottom + 46
      << "\" text-anchor=\"middle\">lateness x: actual wake-up minus intended time (log scale)</text>\n</g>\n"
      << "<g class=\"y-axis\">\n";
    for (int d = 0; d >= yLo; --d) {
        const double y = yOf(d);
        o << "<line class=\"grid\" x1=\"" << left << "\" y1=\"" << Num(y) << "\" x2=\"" << right << "\" y2=\""
          << Num(y) << "\"/>\n<line class=\"axis\" x1=\"" << left - 6 << "\" y1=\"" << Num(y) << "\" x2=\"" << left
          << "\" y2=\"" << Num(y) << "\"/>\n<text x=\"" << left - 10 << "\" y=\"" << Num(y + 4)
          << "\" text-anchor=\"end\">" << FractionLabel(d) << "</text>\n";
    }
    const double midY = (top + bottom) / 2;
    o << "<text x=\"22\" y=\"" << Num(midY) << "\" text-anchor=\"middle\" transform=\"rotate(-90 22 " << Num(midY)
      << ")\">wakes later than x (log scale)</text>\n"
      << "<line class=\"axis\" x1=\"" << left << "\" y1=\"" << bottom << "\" x2=\"" << right << "\" y2=\"" << bottom
      << "\"/>\n<line class=\"axis\" x1=\"" << left << "\" y1=\"" << top << "\" x2=\"" << left << "\" y2=\""
      << bottom << "\"/>\n</g>\n";
    // The 1 % line, on which the p99 markers sit, and the 0.1 % line.
    for (int d : {-2, -3}) {
        if (d < yLo) continue;
        const double y = yOf(d);
        o << "<line class=\"guide\" x1=\"" << left << "\" y1=\"" << Num(y) << "\" x2=\"" << right << "\" y2=\""
          << Num(y) << "\"/>\n<text class=\"small\" x=\"" << right - 4 << "\" y=\"" << Num(y - 4)
          << "\" text-anchor=\"end\">" << (d == -2 ? "p99: 1 in 100 later" : "p99.9: 1 in 1000 later")
          << "</text>\n";
    }

    // Curves: other series first, the baseline last so that it is on top.
    std::vector<std::size_t> order;
    for (std::size_t i = 0; i < series.size(); ++i) {
        if (drawn(series[i]) && series[i].name != "baseline") order.push_back(i);
    }
    for (std::size_t i = 0; i < series.size(); ++i) {
        if (drawn(series[i]) && series[i].name == "baseline") order.push_back(i);
    }
    std::vector<std::string> colour(series.size());
    for (std::size_t i = 0, c = 0; i < series.size(); ++i) {
        colour[i] = series[i].name == "baseline" ? kBaselineColour : kColours[c++ % std::size(kColours)];
    }
    o << "<g class=\"curves\">\n";
    for (std::size_t i : order) {
        const LatencyHistogram& h = *series[i].histogram;
        const double n = static_cast<double>(h.count());
        const double floorLog = std::log10(1.0 / n);
        auto level = [&](double us) {
            const uint64_t above = h.CountAbove(us);
            return above == 0 ? floorLog : std::log10(static_cast<double>(above) / n);
        };
        o << "<polyline class=\"curve curve-" << CurveClass(series[i].name) << "\" stroke=\"" << colour[i]
          << "\" points=\"";
        const double maxLog = std::log10(std::max(h.max(), std::pow(10.0, xLo)));
        double last = level(std::pow(10.0, xLo));
        o << Num(xOf(xLo)) << ',' << Num(yOf(last));
        for (int k = 1;; ++k) {
            double lx = xLo + static_cast<double>(k) / perDecade;
            const bool end = lx >= maxLog;
            if (end) lx = maxLog;
            const double f = end ? floorLog : level(std::pow(10.0, lx));
            if (f != last || end) {
                o << ' ' << Num(xOf(lx)) << ',' << Num(yOf(last));
                if (f != last) o << ' ' << Num(xOf(lx)) << ',' << Num(yOf(f));
                last = f;
            }
            if (end) break;
        }
        o << "\"><title>" << XmlEscape(series[i].name) << "</title></polyline>\n";
    }
    // p99 markers on the 1 % line: a diamond for the baseline, dots for the rest.
    for (std::size_t i : order) {
        const double p99 = series[i].histogram->Percentile(0.99);
        if (!(p99 > 0.0) || -2 < yLo) continue;
        const double x = xOf(std::log10(std::max(p99, std::pow(10.0, xLo)))), y = yOf(-2);
        const std::string cls = "p99 p99-" + CurveClass(series[i].name);
        if (series[i].name == "baseline") {
            o << "<polygon class=\"" << cls << "\" points=\"" << Num(x) << ',' << Num(y - 7) << ' ' << Num(x + 7)
              << ',' << Num(y) << ' ' << Num(x) << ',' << Num(y + 7) << ' ' << Num(x - 7) << ',' << Num(y)
              << "\" fill=\"#000000\" stroke=\"#ffffff\"/>\n";
        } else {
            o << "<circle class=\"" << cls << "\" cx=\"" << Num(x) << "\" cy=\"" << Num(y) << "\" r=\"4.5\" fill=\""
              << colour[i] << "\" stroke=\"#ffffff\"/>\n";
        }
    }
    o << "</g>\n";

    // Legend: the baseline first, then the others in their order.
    const LatencyHistogram* base = nullptr;
    for (const PlotSeries& s : series) {
        if (s.name == "baseline" && drawn(s)) base = s.histogram;
    }
    const double baseP99 = base ? base->Percentile(0.99) : 0.0;
    std::vector<std::size_t> legend;
    for (std::size_t i = 0; i < series.size(); ++i) {
        if (series[i].name == "baseline") legend.insert(legend.begin(), i);
        else legend.push_back(i);
    }
    const double lx = right + 22;
    double ly = top + 6;
    o << "<g class=\"legend\">\n<text x=\"" << lx << "\" y=\"" << Num(ly) << "\" font-weight=\"bold\">series"
      << "</text>\n<text x=\"" << width - 12 << "\" y=\"" << Num(ly) << "\" text-anchor=\"end\" font-weight=\"bold\">"
      << "p99 (× baseline)</text>\n";
    ly += 24;
    for (std::size_t i : legend) {
        const PlotSeries& s = series[i];
        const bool isBase = s.name == "baseline";
        if (drawn(s)) {
            const LatencyHistogram& h = *s.histogram;
            const double p99 = h.Percentile(0.99);
            o << "<line x1=\"" << lx << "\" y1=\"" << Num(ly - 4) << "\" x2=\"" << lx + 26 << "\" y2=\""
              << Num(ly - 4) << "\" stroke=\"" << colour[i] << "\" stroke-width=\"" << (isBase ? 3.2 : 2.2)
              << "\"/>\n<text x=\"" << lx + 34 << "\" y=\"" << Num(ly) << "\"" << (isBase ? " font-weight=\"bold\"" : "")
              << ">" << XmlEscape(s.name) << "</text>\n";
            std::string right = Us(p99);
            if (!isBase && baseP99 > 0.0) {
                char buf[32];
                std::snprintf(buf, sizeof buf, " (%.2f×)", p99 / baseP99);
                right += buf;
            }
            o << "<text x=\"" << width - 12 << "\" y=\"" << Num(ly) << "\" text-anchor=\"end\">" << right
              << "</text>\n";
            ly += 15;
            std::string sub = std::to_string(h.count()) + " wakes" + (isBase ? ", the machine's own limit" : "");
            o << "<text class=\"small\" x=\"" << lx + 34 << "\" y=\"" << Num(ly) << "\">" << XmlEscape(sub)
              << "</text>\n";
            if (h.early() > 0) {
                ly += 14;
                o << "<text class=\"small\" x=\"" << lx + 34 << "\" y=\"" << Num(ly) << "\" fill=\"#d62728\">"
                  << h.early() << " early, not plotted</text>\n";
            }
        } else {
            o << "<text class=\"off\" x=\"" << lx + 34 << "\" y=\"" << Num(ly) << "\">" << XmlEscape(s.name)
              << "</text>\n";
            ly += 15;
            o << "<text class=\"small off\" x=\"" << lx + 34 << "\" y=\"" << Num(ly) << "\">"
              << XmlEscape(s.note.empty() ? "no samples" : s.note) << "</text>\n";
        }
        ly += 22;
    }
    o << "<text class=\"small\" x=\"" << lx << "\" y=\"" << Num(std::max(ly + 6, bottom - 24)) << "\">"
      << "Lower and further left is better.</text>\n"
      << "<text class=\"small\" x=\"" << lx << "\" y=\"" << Num(std::max(ly + 20, bottom - 10)) << "\">"
      << "Markers: each series' p99.</text>\n";
    o << "</g>\n</svg>\n";
    return o.str();
}

}  // namespace qtools
