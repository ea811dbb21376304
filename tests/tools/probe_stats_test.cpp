// Statistics of a latency series, the verdict against the baseline, and the
// rebuilt lateness of the library's tick.
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <random>
#include <vector>

#include "Stats.h"
#include "TickGrid.h"

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
    s.p90 = p99;
    s.p99 = p99;
    s.p999 = p99;
    s.max = p99;
    return s;
}

TEST(ProbeStats, NearestRankPercentilesOnKnownData) {
    std::vector<double> v = OneToN(100);
    std::shuffle(v.begin(), v.end(), std::mt19937(7));  // order of arrival does not matter
    const Summary s = Summarize(v);
    EXPECT_EQ(s.count, 100u);
    EXPECT_EQ(s.min, 1);
    EXPECT_EQ(s.p50, 50);
    EXPECT_EQ(s.p90, 90);
    EXPECT_EQ(s.p99, 99);
    EXPECT_EQ(s.p999, 100);
    EXPECT_EQ(s.max, 100);
    EXPECT_EQ(s.early, 0u);

    // 1000 values: p99.9 is the 999th, not the maximum.
    const Summary k = Summarize(OneToN(1000));
    EXPECT_EQ(k.p999, 999);
    EXPECT_EQ(k.p99, 990);

    // Few values: every percentile is one of the samples.
    const Summary four = Summarize({4, 1, 3, 2});
    EXPECT_EQ(four.p50, 2);
    EXPECT_EQ(four.p90, 4);
    const Summary one = Summarize({7.5});
    EXPECT_EQ(one.min, 7.5);
    EXPECT_EQ(one.p50, 7.5);
    EXPECT_EQ(one.max, 7.5);
}

TEST(ProbeStats, EmptySeriesAndEarlyValues) {
    const Summary e = Summarize({});
    EXPECT_EQ(e.count, 0u);
    EXPECT_TRUE(std::isnan(e.min));
    EXPECT_TRUE(std::isnan(e.p99));
    EXPECT_TRUE(std::isnan(e.max));
    EXPECT_EQ(VerdictFor(e, WithP99(100), false), "no samples");
    EXPECT_TRUE(std::isnan(qtools::RatioP99(e, WithP99(100))));
    EXPECT_TRUE(std::isnan(qtools::PercentileOfSorted({}, 0.5)));

    // Zero is on time; only values below it are early.
    const Summary s = Summarize({3, -0.5, 0, -2});
    EXPECT_EQ(s.early, 2u);
    EXPECT_EQ(s.min, -2);
    EXPECT_EQ(s.max, 3);
}

TEST(ProbeStats, VerdictComparesP99WithTheBaseline) {
    const Summary base = WithP99(100, 50);
    EXPECT_EQ(VerdictFor(base, base, true), "the machine's own limit");
    EXPECT_EQ(VerdictFor(WithP99(80, 50), base, false), "as good as the machine");
    EXPECT_EQ(VerdictFor(WithP99(110, 50), base, false), "as good as the machine");
    EXPECT_EQ(VerdictFor(WithP99(140, 50), base, false), "within 1.5x of the machine");
    EXPECT_EQ(VerdictFor(WithP99(190, 50), base, false), "within 2x of the machine");
    EXPECT_EQ(VerdictFor(WithP99(300, 50), base, false),
              "worse than the machine: p99 3.0x the baseline's (+200.0 us)");
    EXPECT_DOUBLE_EQ(qtools::RatioP99(WithP99(300), base), 3.0);

    // A tiny baseline: a few microseconds more is not "3x worse".
    EXPECT_EQ(VerdictFor(WithP99(6), WithP99(2), false), "as good as the machine");

    // A slower typical wake-up is named even when the tail is fine.
    EXPECT_EQ(VerdictFor(WithP99(100, 120), base, false), "as good as the machine; typical wake-up +70.0 us");
    EXPECT_EQ(VerdictFor(WithP99(100, 60), base, false), "as good as the machine");

    EXPECT_EQ(VerdictFor(WithP99(100, 50), base, false, 3), "as good as the machine; 3 calls failed");
}

TEST(ProbeStats, EarlyReturnOverridesTheVerdict) {
    Summary s = Summarize({-12.25, 5, 6});
    const std::string v = VerdictFor(s, WithP99(100), false);
    EXPECT_EQ(v.rfind("FAILED: returned early 1 times", 0), 0u) << v;
    EXPECT_NE(v.find("12.2"), std::string::npos) << v;  // by how much
    EXPECT_EQ(VerdictFor(s, s, true).rfind("MACHINE FAULT", 0), 0u);
}

// Tick times as the library would produce them, following its rule: each
// tick one period after the last, unless served more than a period late,
// when the grid restarts at that moment. `late[k]` is the true lateness.
struct TickRun {
    std::vector<uint64_t> times;
    std::vector<double> lateUs;
    std::size_t restarts = 0;
};

TickRun Simulate(const std::vector<int64_t>& lateNs) {
    constexpr uint64_t P = 1000000;
    TickRun run;
    uint64_t due = 5000000000ull + 123456;
    for (std::size_t k = 0; k < lateNs.size(); ++k) {
        const uint64_t now = due + static_cast<uint64_t>(lateNs[k]);
        run.times.push_back(now);
        run.lateUs.push_back(lateNs[k] / 1000.0);
        due += P;
        if (due < now) {
            due = now;
            ++run.restarts;
        }
    }
    return run;
}

TEST(ProbeTickGrid, RecoversLatenessWhenTheBestTickIsAtTheFloor) {
    std::vector<int64_t> late;
    std::mt19937 rng(3);
    for (int k = 0; k < 2000; ++k) late.push_back(20000 + static_cast<int64_t>(rng() % 300000));
    late[700] = 20000;  // the best tick, as late as the floor
    const TickRun run = Simulate(late);
    const auto r = qtools::TickLateness(run.times, 1000000, 20.0);
    ASSERT_EQ(r.latenessUs.size(), late.size());
    EXPECT_EQ(r.restarts, 0u);
    for (std::size_t k = 0; k < late.size(); ++k) EXPECT_NEAR(r.latenessUs[k], run.lateUs[k], 1e-6) << k;
}

TEST(ProbeTickGrid, FollowsTheRestartAfterAMissedTick) {
    // Tick 10 is 3.5 periods late: the next one is due at once, and the grid
    // goes on from that moment.
    std::vector<int64_t> late(40, 50000);
    late[0] = 30000;
    late[10] = 3500000;
    late[11] = 4000;
    const TickRun run = Simulate(late);
    ASSERT_EQ(run.restarts, 1u);
    const auto r = qtools::TickLateness(run.times, 1000000, 30.0);
    EXPECT_EQ(r.restarts, 1u);
    for (std::size_t k = 0; k < late.size(); ++k) EXPECT_NEAR(r.latenessUs[k], run.lateUs[k], 1e-6) << k;
}

TEST(ProbeTickGrid, PlacesALongStretchAfterARestartByTheFloorToo) {
    // The late tick's callback ran 20 us after its pass, so the restarted
    // grid looks 20 us later than it is; the stretch's best tick is at the
    // floor (30 us) like the first stretch's.
    std::vector<int64_t> late(400, 60000);
    late[0] = 30000;
    late[50] = 2500000;
    late[51] = 3000;
    late[300] = 30000;
    TickRun run = Simulate(late);
    run.times[50] += 20000;
    const auto r = qtools::TickLateness(run.times, 1000000, 30.0);
    EXPECT_EQ(r.restarts, 1u);
    for (std::size_t k = 51; k < late.size(); ++k) EXPECT_NEAR(r.latenessUs[k], run.lateUs[k], 1e-6) << k;
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
