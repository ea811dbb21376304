#include "probe/Costs.h"

#include <time.h>

#include <algorithm>
#include <cstdint>
#include <vector>

#include "probe/Survey.h"

namespace qprobe {

namespace {

constexpr int kBatches = 25;
constexpr int kCallsPerBatch = 20000;
constexpr uint32_t kReadOutEntries = 10000;
constexpr int kReadOutBatches = 11;

// Keeps results alive so that no call is optimised away.
volatile uint32_t gSink;

uint64_t NowNs() {
    timespec t{};
    clock_gettime(CLOCK_MONOTONIC, &t);
    return static_cast<uint64_t>(t.tv_sec) * 1000000000ull + static_cast<uint64_t>(t.tv_nsec);
}

double Median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    const std::size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2.0;
}

template <class Body>
double NsPerCall(Body&& body) {
    for (int i = 0; i < kCallsPerBatch / 10; ++i) body();  // warm caches and code
    std::vector<double> perCall;
    perCall.reserve(kBatches);
    for (int b = 0; b < kBatches; ++b) {
        const uint64_t t0 = NowNs();
        for (int i = 0; i < kCallsPerBatch; ++i) body();
        const uint64_t t1 = NowNs();
        perCall.push_back(static_cast<double>(t1 - t0) / kCallsPerBatch);
    }
    return Median(perCall);
}

qtools::CostResult Cost(const char* name, const char* label, int slot, double ns, double baseline = -1.0) {
    qtools::CostResult c;
    c.name = name;
    c.label = label;
    c.slot = slot;
    c.nsPerCall = ns;
    c.baselineNs = baseline;
    return c;
}

}  // namespace

std::vector<qtools::CostResult> MeasureCosts(const LoadedQuelta& lib) {
    iKPusTimingEngine* engine = lib.engine();
    iKPLogEngine* log = lib.log();
    std::vector<qtools::CostResult> out;

    const double rawMono = NsPerCall([] {
        timespec t;
        clock_gettime(CLOCK_MONOTONIC, &t);
        gSink = static_cast<uint32_t>(t.tv_nsec);
    });
    const double rawReal = NsPerCall([] {
        timespec t;
        clock_gettime(CLOCK_REALTIME, &t);
        gSink = static_cast<uint32_t>(t.tv_nsec);
    });
    out.push_back(Cost("clock_gettime_monotonic", "clock_gettime(CLOCK_MONOTONIC)", -1, rawMono));
    out.push_back(Cost("clock_gettime_realtime", "clock_gettime(CLOCK_REALTIME)", -1, rawReal));

    out.push_back(Cost("read_monotonic0", "engine ReadMonotonic0 (slot 0)", 0, NsPerCall([engine] {
                           ClockTime t;
                           engine->ReadMonotonic0(t);
                           gSink = t.low;
                       }),
                       rawMono));
    out.push_back(Cost("read_global2", "engine ReadGlobal2 (slot 2)", 2, NsPerCall([engine] {
                           ClockTime t;
                           engine->ReadGlobal2(t);
                           gSink = t.low;
                       }),
                       rawReal));
    ClockTime mono;
    engine->ReadMonotonic0(mono);
    out.push_back(Cost("monotonic_to_global", "engine MonotonicToGlobal (slot 15)", 15, NsPerCall([engine, &mono] {
                           const ClockTime g = engine->MonotonicToGlobal(mono);
                           gSink = g.low;
                       })));

    // Recording, switched on; the rings wrap, which costs nothing extra.
    log->SetEnabled(1);
    ClockTime stamp;
    engine->ReadGlobal2(stamp);
    const uint32_t word = EventWord(kSurveyItself, kKindCost);
    out.push_back(Cost("log_at1", "log LogAt1 (slot 1)", 1, NsPerCall([log, &stamp, word] {
                           log->LogAt1(stamp, word);
                       })));
    out.push_back(Cost("log_now5", "log LogNow5 (slot 5)", 5, NsPerCall([log, word] { log->LogNow5(word); }),
                       rawReal));

    // Read-out: the newest entries again and again (a read-out does not
    // consume them).
    log->SetEnabled(0);
    std::vector<uint32_t> lo(kReadOutEntries), hi(kReadOutEntries), ev(kReadOutEntries), da(kReadOutEntries);
    std::vector<double> perEntry;
    for (int b = 0; b < kReadOutBatches; ++b) {
        uint32_t count = kReadOutEntries;
        const uint64_t t0 = NowNs();
        log->ReadOutMerged(count, lo.data(), hi.data(), ev.data(), da.data(), 0);
        const uint64_t t1 = NowNs();
        if (count > 0) perEntry.push_back(static_cast<double>(t1 - t0) / count);
    }
    if (!perEntry.empty()) {
        out.push_back(Cost("readout_merged_per_entry", "log ReadOutMerged, per entry (slot 23)", 23,
                           Median(perEntry)));
    }
    return out;
}

}  // namespace qprobe
