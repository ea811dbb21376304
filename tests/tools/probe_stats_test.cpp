// Latency histograms, the statistics and verdicts built on them, and the
// rebuilt lateness of the library's tick.
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <random>
#include <vector>

#include "LatencyHistogram.h"
#include "Stats.h"
#include "TickGrid.h"

using qtools::LatencyHistogram;
using qtools::Summarize;
using qtools::Summary;
using qtools::VerdictFor;

namespace {

std::vector<double> OneToN(int n) {
    std::vector<double> v;
    for (int i = 1; i <= n; ++i) v.push_back(i);
    return v;
}

Summary WithP99(double p99, double p50 = 1.0) {
    Summary s;
    s.count = 1000;
    s.min = 0.5;
    s.p50 = p50;
    s.p90 = s.p99 = s.p999 = s.max = p99;
    return s;
}

// Nearest rank, whatever the order of arrival: p99.9 of 1000 values is the
// 999th, not the maximum; with few values every percentile is a sample; the
// tenths of a microsecond survive.
TEST(ProbeStats, NearestRankPercentilesOnKnownData) {
    std::vector<double> shuffled = OneToN(100);
    std::shuffle(shuffled.begin(), shuffled.end(), std::mt19937(7));
    std::vector<double> tenths;
    for (int i = 1; i <= 10; ++i) tenths.push_back(12.0 + i / 10.0);  // 12.1 .. 13.0
    const std::pair<std::vector<double>, std::vector<double>> cases[] = {  // count min p50 p90 p99 p999 max
        {shuffled, {100, 1, 50, 90, 99, 100, 100}},
        {OneToN(1000), {1000, 1, 500, 900, 990, 999, 1000}},
        {{4, 1, 3, 2}, {4, 1, 2, 4, 4, 4, 4}},
        {{7.5}, {1, 7.5, 7.5, 7.5, 7.5, 7.5, 7.5}},
        {tenths, {10, 12.1, 12.5, 12.9, 13.0, 13.0, 13.0}}};
    for (const auto& [values, want] : cases) {
        const Summary s = Summarize(values);
        const std::vector<double> got{double(s.count), s.min, s.p50, s.p90, s.p99, s.p999, s.max};
        ASSERT_EQ(got.size(), want.size());
        for (std::size_t i = 0; i < got.size(); ++i) EXPECT_NEAR(got[i], want[i], 1e-9) << i;
        EXPECT_EQ(s.early, 0u);
    }
    EXPECT_DOUBLE_EQ(Summarize({1, 2, 3, 6}).mean, 3.0);
}

// Beyond 10 ms the buckets are logarithmic: percentiles within 1.2 %, the
// maximum exact; counts above a point exact at the fine buckets' edges.
TEST(ProbeStats, LongTailsAndCountsAbove) {
    LatencyHistogram h;
    for (int i = 0; i < 900; ++i) h.Add(50.0);
    for (int i = 1; i <= 100; ++i) h.Add(10000.0 * i);  // 10 ms .. 1 s
    EXPECT_EQ(h.count(), 1000u);
    EXPECT_DOUBLE_EQ(h.max(), 1e6);
    EXPECT_NEAR(h.Percentile(0.95), 500000.0, 500000.0 * 0.012);
    EXPECT_NEAR(h.Percentile(0.999), 990000.0, 990000.0 * 0.012);
    EXPECT_EQ(h.CountAbove(49.9), 1000u);
    EXPECT_EQ(h.CountAbove(50.0), 100u);
    EXPECT_EQ(h.CountAbove(5000.0), 100u);
    EXPECT_EQ(h.CountInFine(500, 501), 900u);  // 50.0 us in its 0.1 us bucket

    LatencyHistogram other;
    other.Add(-3.0);
    other.Add(2e9);  // beyond every bucket: still counted, still the maximum
    h.Merge(other);
    EXPECT_EQ(h.count(), 1002u);
    EXPECT_EQ(h.early(), 1u);
    EXPECT_DOUBLE_EQ(h.min(), -3.0);
    EXPECT_DOUBLE_EQ(h.max(), 2e9);
}

TEST(ProbeStats, EmptySeriesAndEarlyValues) {
    const Summary e = Summarize(std::vector<double>{});
    EXPECT_EQ(e.count, 0u);
    EXPECT_TRUE(std::isnan(e.min) && std::isnan(e.p99) && std::isnan(e.max) && std::isnan(e.mean));
    EXPECT_EQ(VerdictFor(e, WithP99(100), false), "no samples");
    EXPECT_TRUE(std::isnan(qtools::RatioP99(e, WithP99(100))));

    // Zero is on time; only values below it are early, and they override
    // the verdict, with by how much.
    const Summary s = Summarize({3, -0.5, 0, -12.25});
    EXPECT_EQ(s.early, 2u);
    EXPECT_EQ(s.min, -12.25);
    EXPECT_EQ(s.max, 3);
    const std::string v = VerdictFor(s, WithP99(100), false);
    EXPECT_EQ(v.rfind("FAILED: returned early 2 times", 0), 0u) << v;
    EXPECT_NE(v.find("12.2"), std::string::npos) << v;
    EXPECT_EQ(VerdictFor(s, s, true).rfind("MACHINE FAULT", 0), 0u);
}

TEST(ProbeStats, VerdictComparesP99WithTheBaseline) {
    const Summary base = WithP99(100, 50);
    EXPECT_EQ(VerdictFor(base, base, true), "the machine's own limit");
    const struct {
        double p99, p50;
        const char* verdict;
    } cases[] = {
        {80, 50, "as good as the machine"},
        {110, 50, "as good as the machine"},
        {140, 50, "within 1.5x of the machine"},
        {190, 50, "within 2x of the machine"},
        {300, 50, "worse than the machine: p99 3.0x the baseline's (+200.0 us)"},
        {100, 120, "as good as the machine; typical wake-up +70.0 us"},  // a slower typical wake-up
        {100, 60, "as good as the machine"},
    };
    for (const auto& c : cases) EXPECT_EQ(VerdictFor(WithP99(c.p99, c.p50), base, false), c.verdict) << c.p99;
    EXPECT_DOUBLE_EQ(qtools::RatioP99(WithP99(300), base), 3.0);
    // A tiny baseline: a few microseconds more is not "3x worse".
    EXPECT_EQ(VerdictFor(WithP99(6), WithP99(2), false), "as good as the machine");
    EXPECT_EQ(VerdictFor(base, base, false, 3), "as good as the machine; 3 calls failed");
}

// The machine explains a tail that stays within the baseline's typical
// wake-up plus the stall p99 around the series; said of the baseline and of
// series not as good as the machine, never without stall figures.
TEST(ProbeStats, StallsExplainATailOrNot) {
    const Summary base = WithP99(100, 50), none = Summarize(std::vector<double>{});
    const struct {
        Summary series, stall;
        bool isBaseline;
        int explained;
        const char* clause;
    } cases[] = {
        {WithP99(140), WithP99(90), false, 1, "; machine stalls explain the tail (stall p99 90.0 us around it)"},
        {WithP99(300), WithP99(100), false, 0, "; tail 150.0 us beyond machine stalls (stall p99 100.0 us around it)"},
        {base, WithP99(20), true, 0, "; tail 30.0 us beyond machine stalls (stall p99 20.0 us around it)"},
        {WithP99(105), WithP99(900), false, -1, ""},  // as good as the machine: nothing to explain
        {WithP99(300), none, false, -1, ""},
    };
    for (const auto& c : cases) {
        int explained = 7;
        EXPECT_EQ(qtools::StallClause(c.series, base, c.stall, c.isBaseline, explained), c.clause);
        EXPECT_EQ(explained, c.explained) << c.clause;
    }
}

// Tick times following the library's rule: each tick one period after the
// last, unless served more than a period late, when the grid restarts then.
struct TickRun {
    std::vector<uint64_t> times;
    std::vector<double> lateUs;  // the true lateness
    std::size_t restarts = 0;
};

TickRun Simulate(const std::vector<int64_t>& lateNs) {
    TickRun run;
    uint64_t due = 5000000000ull + 123456;
    for (int64_t late : lateNs) {
        const uint64_t now = due + static_cast<uint64_t>(late);
        run.times.push_back(now);
        run.lateUs.push_back(late / 1000.0);
        due += 1000000;
        if (due < now) due = now, ++run.restarts;
    }
    return run;
}

// Random lateness with the best tick at the floor; a tick 3.5 periods late
// (grid restarts); and a long stretch after a restart whose late tick's
// callback ran 20 us after its pass, placed by the floor too.
TEST(ProbeTickGrid, RecoversTheTrueLateness) {
    std::vector<int64_t> random;
    std::mt19937 rng(3);
    for (int k = 0; k < 2000; ++k) random.push_back(20000 + static_cast<int64_t>(rng() % 300000));
    random[700] = 20000;
    std::vector<int64_t> missed(40, 50000), stretch(400, 60000);
    missed[0] = 30000, missed[10] = 3500000, missed[11] = 4000;
    stretch[0] = 30000, stretch[50] = 2500000, stretch[51] = 3000, stretch[300] = 30000;
    const struct {
        std::vector<int64_t> late;
        double floorUs;
        std::size_t restarts, checkFrom, nudged;
    } cases[] = {{random, 20.0, 0, 0, 0}, {missed, 30.0, 1, 0, 0}, {stretch, 30.0, 1, 51, 50}};
    for (const auto& c : cases) {
        TickRun run = Simulate(c.late);
        ASSERT_EQ(run.restarts, c.restarts);
        if (c.nudged != 0) run.times[c.nudged] += 20000;
        const auto r = qtools::TickLateness(run.times, 1000000, c.floorUs);
        ASSERT_EQ(r.latenessUs.size(), c.late.size());
        EXPECT_EQ(r.restarts, c.restarts);
        for (std::size_t k = c.checkFrom; k < c.late.size(); ++k) ASSERT_NEAR(r.latenessUs[k], run.lateUs[k], 1e-6) << k;
    }
}

TEST(ProbeTickGrid, NeverShowsATickEarlyAndHandlesNoTicks) {
    EXPECT_TRUE(qtools::TickLateness({}, 1000000, 10.0).latenessUs.empty());
    // Irregular ticks whose grid cannot be fitted exactly: still no negative.
    std::vector<uint64_t> t{1000000000, 1001200000, 1001300000, 1003900000, 1003950000, 1005000000};
    const auto r = qtools::TickLateness(t, 1000000, std::nan(""));
    ASSERT_EQ(r.latenessUs.size(), t.size());
    for (double v : r.latenessUs) EXPECT_GE(v, 0.0);
}

}  // namespace
