// Helpers shared by the log engine's tests: engines with a chosen number of
// CPUs, threads that pretend to run on a chosen CPU, and read-outs into
// vectors.
#ifndef QUELTA_TESTS_LOG_TEST_HELPERS_H
#define QUELTA_TESTS_LOG_TEST_HELPERS_H

#include <gtest/gtest.h>

#include <cstdint>
#include <vector>

#include "engine/ClockTimeOps.h"
#include "log/tKPLogEngine.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace logtest {

// The CPU each test thread claims to run on, reported through the engine's
// CPU seam.
inline thread_local int tFakeCpu = 0;
inline int FakeCpuQuery() { return tFakeCpu; }

// Installs the fake CPU seam for the lifetime of the object.
class FakeCpus {
public:
    FakeCpus() : saved_(quelta::gLogCpuQuery) { quelta::gLogCpuQuery = FakeCpuQuery; }
    ~FakeCpus() {
        quelta::gLogCpuQuery = saved_;
        tFakeCpu = 0;
    }
    FakeCpus(const FakeCpus&) = delete;
    FakeCpus& operator=(const FakeCpus&) = delete;

private:
    int (*saved_)();
};

// Builds an engine as if the machine had `cpus` CPUs online (the engine reads
// the count once, at construction).
inline quelta::tKPLogEngine* CreateWithCpus(int32_t cpus) {
    const int32_t saved = quelta::gCpuCount.load();
    quelta::gCpuCount.store(cpus);
    quelta::tKPLogEngine* engine = quelta::tKPLogEngine::Create();
    quelta::gCpuCount.store(saved);
    return engine;
}

inline ClockTime T(uint64_t v) { return quelta::FromU64(v); }

struct ReadOutResult {
    uint32_t count = 0;
    std::vector<uint32_t> low, high, events, data;
    uint64_t Time(size_t i) const { return (uint64_t(high[i]) << 32) | low[i]; }
};

constexpr uint32_t kUntouched = 0xDEADBEEFu;

// Reads out through slot 23 (or slot 7 without data) into arrays of `room`
// entries pre-filled with kUntouched; the vectors keep the whole room so that
// tests can check what lies beyond `count`.
inline ReadOutResult ReadOut(iKPLogEngine* log, uint32_t room, bool withData = true) {
    ReadOutResult r;
    r.low.assign(room + 1, kUntouched);
    r.high.assign(room + 1, kUntouched);
    r.events.assign(room + 1, kUntouched);
    r.data.assign(room + 1, kUntouched);
    r.count = room;
    if (withData) {
        log->ReadOutMerged(r.count, r.low.data(), r.high.data(), r.events.data(), r.data.data(), 0);
    } else {
        log->ReadOut7(r.count, r.low.data(), r.high.data(), r.events.data(), 0);
    }
    return r;
}

// Events (with the CPU bits) of a read-out, oldest first.
inline std::vector<uint32_t> Events(const ReadOutResult& r) {
    return std::vector<uint32_t>(r.events.begin(), r.events.begin() + r.count);
}

inline std::vector<uint64_t> Times(const ReadOutResult& r) {
    std::vector<uint64_t> out;
    for (uint32_t i = 0; i < r.count; ++i) out.push_back(r.Time(i));
    return out;
}

// Fixture: an engine of four fake CPUs with small rings, the test thread on
// fake CPU 0.
class LogFixture : public ::testing::Test {
protected:
    static constexpr uint32_t kCpus = 4;

    void SetUp() override {
        engine = CreateWithCpus(kCpus);
        ASSERT_NE(engine, nullptr);
        ASSERT_EQ(engine->CpuCount(), kCpus);
        log = engine;
    }
    void TearDown() override { delete log; }

    // Records on fake CPU `cpu` at caller time `t`.
    void At(int cpu, uint64_t t, uint32_t event) {
        tFakeCpu = cpu;
        log->LogAt1(T(t), event);
        tFakeCpu = 0;
    }

    FakeCpus fake;
    quelta::tKPLogEngine* engine = nullptr;
    iKPLogEngine* log = nullptr;
};

}  // namespace logtest

#endif
