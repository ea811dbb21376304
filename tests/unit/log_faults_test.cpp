// Recording never takes a page fault: the rings are written through when they
// are made, so a recorder's first pass over a fresh ring finds every page in
// place. Its own executable, so that the rings come from a heap (and, for the
// larger ones, from mappings) that nothing has touched before.
#include <sched.h>
#include <sys/resource.h>

#include <cstring>
#include <memory>
#include <thread>

#include "log_test_helpers.h"

using namespace logtest;

namespace {

// Minor faults of a thread pinned to `cpu` while `records` LogAt1 go into
// that CPU's ring of `log`; -1 when it cannot be pinned there.
long FaultsRecordingOn(iKPLogEngine* log, int32_t cpu, uint32_t records) {
    long faults = -1;
    std::thread([&] {
        if (quelta::PalSetAffinityOne(cpu) != 0 || sched_getcpu() != cpu) return;
        // The thread's own first touches are not the log's: its stack, the
        // calls used below, and the recording code itself, which an emulator
        // translates on first use (recorded into another engine, wrapping).
        volatile char stack[64 * 1024];
        std::memset(const_cast<char*>(stack), 1, sizeof stack);
        static iKPLogEngine* const warm = [] {
            iKPLogEngine* engine = tKPLogEngine::Create();
            engine->Configure(4);
            engine->SetEnabled(1);
            return engine;
        }();
        for (uint32_t i = 0; i < 10; ++i) warm->LogAt1(T(i + 1), i);
        rusage before, after;
        getrusage(RUSAGE_THREAD, &before);
        getrusage(RUSAGE_THREAD, &before);
        for (uint32_t i = 0; i < records; ++i) log->LogAt1(T(1000 + i), i);
        getrusage(RUSAGE_THREAD, &after);
        faults = after.ru_minflt - before.ru_minflt;
    }).join();
    return faults;
}

// 12,000 records on every CPU (each 5000-entry ring wraps twice) must fault
// nothing, in both banks and after a Configure to new, larger rings.
TEST(LogFaults, RecordingOnFreshRingsTakesNoPageFault) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer writes its own per-thread trace on every access, faulting in pages";
#endif
    ASSERT_EQ(quelta::PalInitialize(), 1u);
    const int32_t cpus = quelta::PalGetCpuCount();
    std::unique_ptr<iKPLogEngine> log(tKPLogEngine::Create());
    ASSERT_NE(log, nullptr);
    constexpr uint32_t kRecords = 12000;

    auto expectNoFaults = [&](const char* what) {
        for (int32_t cpu = 0; cpu < cpus; ++cpu) {
            EXPECT_EQ(FaultsRecordingOn(log.get(), cpu, kRecords), 0) << what << ", CPU " << cpu;
        }
    };
    for (int32_t cpu = 0; cpu < cpus; ++cpu) {
        if (FaultsRecordingOn(log.get(), cpu, 0) < 0) GTEST_SKIP() << "cannot pin a thread to CPU " << cpu;
    }
    log->SetEnabled(1);
    expectNoFaults("fresh engine");

    uint32_t none = 0;  // a read-out of 0 entries leaves the other bank active
    log->ReadOut7(none, nullptr, nullptr, nullptr, 0);
    expectNoFaults("second bank");

    ASSERT_EQ(log->Configure(20000), 20000u);  // 400 kB rings: fresh mappings
    log->SetEnabled(1);
    expectNoFaults("after Configure");
    EXPECT_EQ(Held(log.get()), 100u);
}

}  // namespace
