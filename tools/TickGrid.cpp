#include "TickGrid.h"

#include <algorithm>
#include <cmath>

namespace qtools {

namespace {

// Follows the grid from `anchor` (the due time of the first tick) and writes
// the lateness of every tick in ns. Returns the index at which each stretch
// starts (0 first, then one per restart).
std::vector<std::size_t> FollowGrid(const std::vector<uint64_t>& t, uint64_t period, int64_t anchor,
                                    std::vector<int64_t>& late) {
    std::vector<std::size_t> starts{0};
    late.assign(t.size(), 0);
    int64_t due = anchor;
    for (std::size_t k = 0; k < t.size(); ++k) {
        if (k > 0) {
            due += static_cast<int64_t>(period);
            const int64_t previous = static_cast<int64_t>(t[k - 1]);
            if (due < previous) {  // missed: the grid restarts there
                due = previous;
                starts.push_back(k);
            }
        }
        late[k] = static_cast<int64_t>(t[k]) - due;
    }
    return starts;
}

int64_t MinOf(const std::vector<int64_t>& v, std::size_t from, std::size_t to) {
    return *std::min_element(v.begin() + static_cast<std::ptrdiff_t>(from),
                             v.begin() + static_cast<std::ptrdiff_t>(to));
}

// Stretches at least this many ticks long have a best tick that can be
// taken as being as late as the machine's best wake-up.
constexpr std::size_t kLongStretch = 100;

std::size_t StretchEnd(const std::vector<std::size_t>& starts, std::size_t s, std::size_t n) {
    return s + 1 < starts.size() ? starts[s + 1] : n;
}

}  // namespace

TickLatenessResult TickLateness(const std::vector<uint64_t>& times, uint64_t periodNs,
                                double floorUs) {
    TickLatenessResult result;
    if (times.empty() || periodNs == 0) return result;
    if (!(floorUs >= 0.0)) floorUs = 0.0;  // NaN or negative: no floor
    const int64_t floorNs = static_cast<int64_t>(std::llround(floorUs * 1000.0));
    const std::size_t n = times.size();

    // Place the first stretch's phase: following the grid from a different
    // anchor can find restarts elsewhere, so repeat until the phase holds.
    std::vector<int64_t> late;
    std::vector<std::size_t> starts;
    int64_t shift = 0;
    for (int round = 0; round < 16; ++round) {
        starts = FollowGrid(times, periodNs, static_cast<int64_t>(times[0]) - shift, late);
        const int64_t firstMin = MinOf(late, 0, StretchEnd(starts, 0, n));
        if (firstMin == floorNs) break;
        shift += floorNs - firstMin;
    }

    result.restarts = starts.size() - 1;
    result.latenessUs.resize(n);
    for (std::size_t s = 0; s < starts.size(); ++s) {
        const std::size_t from = starts[s], to = StretchEnd(starts, s, n);
        int64_t lift = 0;
        if (s > 0 && to - from >= kLongStretch) {
            // Anchored on the late tick's callback, which ran a little after
            // the pass that restarted the grid: the stretch can only be later
            // than it looks. Its best tick (not the one due at once) goes to
            // the floor, as in the first stretch.
            lift = std::max<int64_t>(0, floorNs - MinOf(late, from + 1, to));
        }
        const int64_t low = MinOf(late, from, to) + lift;
        if (low < 0) lift -= low;
        for (std::size_t k = from; k < to; ++k) {
            result.latenessUs[k] = static_cast<double>(late[k] + lift) / 1000.0;
        }
    }
    return result;
}

}  // namespace qtools
