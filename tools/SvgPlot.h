// A latency histogram as a standalone SVG image: x is the lateness in
// microseconds on a logarithmic axis (log-spaced buckets), y the number of
// samples per bucket on a logarithmic axis; one curve per series, a legend,
// axes with labels and decade ticks.
//
// Each curve is one <polyline> with class "curve curve-<name>" (the name with
// every character outside [A-Za-z0-9_-] replaced by '_'); nothing else in the
// image is a polyline or a path, so a reader can count the curves.
#ifndef QUELTA_TOOLS_SVGPLOT_H
#define QUELTA_TOOLS_SVGPLOT_H

#include <string>
#include <vector>

namespace qtools {

struct PlotSeries {
    std::string name;
    std::vector<double> valuesUs;  // lateness samples in microseconds
};

struct PlotOptions {
    std::string title = "Wake-up lateness";
    std::string subtitle;
    int width = 960;
    int height = 600;
    int bucketsPerDecade = 10;
};

// Class-name form of a series name.
std::string CurveClass(const std::string& name);

std::string RenderLatencyHistogram(const std::vector<PlotSeries>& series,
                                   const PlotOptions& options = PlotOptions());

}  // namespace qtools

#endif
