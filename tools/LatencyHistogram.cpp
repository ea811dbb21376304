#include "LatencyHistogram.h"

#include <algorithm>
#include <cmath>
#include <limits>

namespace qtools {

namespace {

constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();
constexpr double kFineLimitUs = static_cast<double>(LatencyHistogram::kFineBuckets) / LatencyHistogram::kFinePerUs;
constexpr int kCoarseBuckets = LatencyHistogram::kCoarsePerDecade * LatencyHistogram::kCoarseDecades;

int CoarseIndex(double us) {
    const double k = std::floor((std::log10(us) - std::log10(kFineLimitUs)) * LatencyHistogram::kCoarsePerDecade);
    if (!(k >= 0.0)) return 0;
    return k >= kCoarseBuckets ? kCoarseBuckets - 1 : static_cast<int>(k);
}

double CoarseLowerEdge(int k) {
    return kFineLimitUs * std::pow(10.0, static_cast<double>(k) / LatencyHistogram::kCoarsePerDecade);
}

}  // namespace

int64_t TenthsOfUs(double us) { return std::llround(us * LatencyHistogram::kFinePerUs); }

LatencyHistogram::LatencyHistogram() : fine_(kFineBuckets, 0), coarse_(kCoarseBuckets, 0) {}

void LatencyHistogram::Add(double us) {
    if (!std::isfinite(us)) return;
    if (count_ == 0) {
        min_ = max_ = us;
    } else {
        min_ = std::min(min_, us);
        max_ = std::max(max_, us);
    }
    ++count_;
    sum_ += us;
    if (us < 0.0) {
        ++early_;
        return;
    }
    const int64_t t = TenthsOfUs(us);
    if (t < kFineBuckets) {
        ++fine_[static_cast<std::size_t>(t)];
    } else {
        ++coarse_[static_cast<std::size_t>(CoarseIndex(us))];
    }
}

void LatencyHistogram::Merge(const LatencyHistogram& o) {
    if (o.count_ == 0) return;
    if (count_ == 0) {
        min_ = o.min_;
        max_ = o.max_;
    } else {
        min_ = std::min(min_, o.min_);
        max_ = std::max(max_, o.max_);
    }
    count_ += o.count_;
    early_ += o.early_;
    sum_ += o.sum_;
    for (std::size_t i = 0; i < fine_.size(); ++i) fine_[i] += o.fine_[i];
    for (std::size_t i = 0; i < coarse_.size(); ++i) coarse_[i] += o.coarse_[i];
}

double LatencyHistogram::min() const { return count_ ? min_ : kNaN; }
double LatencyHistogram::max() const { return count_ ? max_ : kNaN; }
double LatencyHistogram::mean() const { return count_ ? sum_ / static_cast<double>(count_) : kNaN; }

double LatencyHistogram::Percentile(double fraction) const {
    if (count_ == 0) return kNaN;
    const double n = static_cast<double>(count_);
    // The small epsilon keeps 0.9 * 100 from becoming rank 91.
    double rank = std::ceil(fraction * n - 1e-9);
    rank = std::clamp(rank, 1.0, n);
    const uint64_t r = static_cast<uint64_t>(rank);
    if (r == 1 || r <= early_) return min_;
    if (r == count_) return max_;
    uint64_t seen = early_;
    double v = max_;
    bool found = false;
    for (std::size_t b = 0; b < fine_.size() && !found; ++b) {
        seen += fine_[b];
        if (seen >= r) {
            v = static_cast<double>(b) / kFinePerUs;
            found = true;
        }
    }
    for (std::size_t k = 0; k < coarse_.size() && !found; ++k) {
        seen += coarse_[k];
        if (seen >= r) {  // the bucket's geometric middle
            v = CoarseLowerEdge(static_cast<int>(k)) * std::pow(10.0, 0.5 / kCoarsePerDecade);
            found = true;
        }
    }
    return std::clamp(v, min_, max_);
}

uint64_t LatencyHistogram::CountAbove(double us) const {
    if (count_ == 0) return 0;
    if (us < 0.0) {
        // Early values are not placed; those above `us` are not known one by
        // one, so all of them count when the minimum is above it.
        uint64_t placed = count_ - early_;
        return placed + (min_ > us ? early_ : 0);
    }
    uint64_t above = 0;
    const int64_t t = TenthsOfUs(us);
    if (t < kFineBuckets) {
        for (std::size_t b = static_cast<std::size_t>(t) + 1; b < fine_.size(); ++b) above += fine_[b];
        for (uint64_t c : coarse_) above += c;
        return above;
    }
    for (int k = CoarseIndex(us) + 1; k < kCoarseBuckets; ++k) above += coarse_[static_cast<std::size_t>(k)];
    return above;
}

uint64_t LatencyHistogram::CountInFine(int fromTenths, int toTenths) const {
    uint64_t n = 0;
    const int lo = std::max(0, fromTenths), hi = std::min(kFineBuckets, toTenths);
    for (int b = lo; b < hi; ++b) n += fine_[static_cast<std::size_t>(b)];
    return n;
}

}  // namespace qtools
