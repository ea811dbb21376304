// Lateness of the library's 1 ms tick, rebuilt from the moments at which the
// tick callback ran.
//
// The intended tick times (the library's tick grid) are not visible from
// outside the library, only the moments at which each tick was served. The
// grid is rebuilt by the library's own rule: each tick is due one period
// after the previous one, and when a tick is served more than a period late
// the grid restarts from that moment, so the next tick is due at once.
// A stretch of the grid that starts at the first tick has an unknown phase;
// it is placed so that the stretch's best tick is exactly `floorUs` late
// (the probe passes the machine's best wake-up, the baseline's minimum).
// Stretches that start at a restart are anchored on the late tick itself;
// as the callback runs a little after the pass that restarted the grid, a
// long stretch (100 ticks or more) is moved later, if need be, until its best
// tick other than the first is `floorUs` late as well. No stretch is left
// showing a tick before its grid.
#ifndef QUELTA_TOOLS_TICKGRID_H
#define QUELTA_TOOLS_TICKGRID_H

#include <cstddef>
#include <cstdint>
#include <vector>

namespace qtools {

struct TickLatenessResult {
    std::vector<double> latenessUs;  // one per tick, in the order given
    std::size_t restarts = 0;        // times the grid restarted (a tick > 1 period late)
};

// times: CLOCK_MONOTONIC ns at which consecutive tick callbacks ran.
TickLatenessResult TickLateness(const std::vector<uint64_t>& times, uint64_t periodNs,
                                double floorUs);

}  // namespace qtools

#endif
