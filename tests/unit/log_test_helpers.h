// Helpers for the log engine's tests: engines with a chosen CPU count, test
// threads that claim to run on a chosen CPU, and read-outs into vectors.
#ifndef QUELTA_TESTS_LOG_TEST_HELPERS_H
#define QUELTA_TESTS_LOG_TEST_HELPERS_H

#include <gtest/gtest.h>

#include <vector>

#include "engine/ClockTimeOps.h"
#include "log/tKPLogEngine.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace logtest {

inline thread_local int tFakeCpu = 0;  // what the CPU seam reports to this thread
inline int FakeCpuQuery() { return tFakeCpu; }

// An engine built as if `cpus` CPUs were online (it reads the count once).
inline tKPLogEngine* CreateWithCpus(int32_t cpus) {
    const int32_t saved = quelta::gCpuCount.load();
    quelta::gCpuCount.store(cpus);
    tKPLogEngine* engine = tKPLogEngine::Create();
    quelta::gCpuCount.store(saved);
    return engine;
}

inline ClockTime T(uint64_t v) { return quelta::FromU64(v); }
inline uint32_t Cpu(uint32_t event) { return (event >> 8) & 0xFFu; }  // the CPU the log put in

constexpr uint32_t kUntouched = 0xDEADBEEFu;

// A read-out through slot 23 into arrays with room for `room` entries (and
// one more word each, to show nothing is written beyond).
struct ReadOutResult {
    uint32_t count = 0;
    std::vector<uint32_t> low, high, events, data;
    uint64_t Time(size_t i) const { return (uint64_t(high[i]) << 32) | low[i]; }
    std::vector<uint32_t> Events() const { return {events.begin(), events.begin() + count}; }
    std::vector<uint32_t> Data() const { return {data.begin(), data.begin() + count}; }
    std::vector<uint64_t> Times() const {
        std::vector<uint64_t> out;
        for (uint32_t i = 0; i < count; ++i) out.push_back(Time(i));
        return out;
    }
};
inline ReadOutResult ReadOut(iKPLogEngine* log, uint32_t room) {
    ReadOutResult r;
    for (auto* v : {&r.low, &r.high, &r.events, &r.data}) v->assign(room + 1, kUntouched);
    r.count = room;
    log->ReadOutMerged(r.count, r.low.data(), r.high.data(), r.events.data(), r.data.data(), 0);
    return r;
}
inline uint32_t Held(iKPLogEngine* log) { return ReadOut(log, 100).count; }

// An engine of four fake CPUs; the test thread is on fake CPU 0.
class LogFixture : public ::testing::Test {
protected:
    static constexpr uint32_t kCpus = 4;

    void SetUp() override {
        quelta::gLogCpuQuery = FakeCpuQuery;
        engine = CreateWithCpus(kCpus);
        ASSERT_NE(engine, nullptr);
        log = engine;
    }
    void TearDown() override {
        delete log;
        quelta::gLogCpuQuery = savedQuery;
        tFakeCpu = 0;
    }
    // LogAt1 from fake CPU `cpu` at caller time `t`.
    void At(int cpu, uint64_t t, uint32_t event) {
        tFakeCpu = cpu;
        log->LogAt1(T(t), event);
        tFakeCpu = 0;
    }
    // Empties the log and switches recording on.
    void Restart() {
        log->Reconfigure();
        log->SetEnabled(1);
    }
    const quelta::LogCpuRecord& Record(uint32_t i) const { return engine->records[i]; }

    int (*savedQuery)() = quelta::gLogCpuQuery;
    tKPLogEngine* engine = nullptr;
    iKPLogEngine* log = nullptr;
};

}  // namespace logtest

#endif
