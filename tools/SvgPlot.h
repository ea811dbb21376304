// The survey's picture as a standalone SVG image: a tail plot. For every
// series, the fraction of its wakes that came later than x, over the lateness
// x; both axes logarithmic. A curve further left and lower is better; the
// machine's own limit (the series named "baseline") is drawn last, on top,
// black and thick, so every other curve reads against it. Each series has a
// marker at its p99 on the 1 % line, and the legend gives count, p99 and the
// ratio to the baseline's p99. Series that were not measured are named in the
// legend, greyed, without a curve.
//
// Each curve is one <polyline class="curve curve-<name>"> (the name with
// every character outside [A-Za-z0-9_-] replaced by '_'); nothing else is a
// polyline. Each p99 marker is one element with class "p99 p99-<name>".
#ifndef QUELTA_TOOLS_SVGPLOT_H
#define QUELTA_TOOLS_SVGPLOT_H

#include <string>
#include <vector>

#include "LatencyHistogram.h"

namespace qtools {

struct PlotSeries {
    std::string name;
    const LatencyHistogram* histogram = nullptr;
    bool measured = true;
    std::string note;  // shown in the legend for a series not measured
};

struct PlotOptions {
    std::string title = "Wake-up lateness";
    std::string subtitle;
    int width = 980;
    int height = 620;
    int pointsPerDecade = 40;
};

// Class-name form of a series name.
std::string CurveClass(const std::string& name);

std::string RenderTailPlot(const std::vector<PlotSeries>& series, const PlotOptions& options = PlotOptions());

}  // namespace qtools

#endif
