// Recording never takes a page fault: the rings are written through when they
// are made, so a recorder's first pass over a fresh ring finds every page in
// place. Its own executable, so that the rings come from a heap (and, for the
// larger ones, from mappings) that nothing has touched before.
#include <sched.h>
#include <sys/resource.h>

#include <cstring>
#include <memory>
#include <string>
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
// nothing, in both banks and after a Configure to new, larger rings. Under an
// emulator the emulator's own work (translating code, growing its caches) is
// counted as the thread's faults now and then; a ring that is not written
// through faults on every fresh engine, so a clean run out of three decides.
TEST(LogFaults, RecordingOnFreshRingsTakesNoPageFault) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer writes its own per-thread trace on every access, faulting in pages";
#endif
    ASSERT_EQ(quelta::PalInitialize(), 1u);
    const int32_t cpus = quelta::PalGetCpuCount();
    constexpr uint32_t kRecords = 12000;
    {
        std::unique_ptr<iKPLogEngine> probe(tKPLogEngine::Create());
        ASSERT_NE(probe, nullptr);
        for (int32_t cpu = 0; cpu < cpus; ++cpu) {
            if (FaultsRecordingOn(probe.get(), cpu, 0) < 0) GTEST_SKIP() << "cannot pin a thread to CPU " << cpu;
        }
    }

    // One fresh engine through all three phases; what faulted, or "".
    auto faultsOnAFreshEngine = [&]() -> std::string {
        std::unique_ptr<iKPLogEngine> log(tKPLogEngine::Create());
        if (log == nullptr) return "no engine";
        std::string faulted;
        auto record = [&](const char* what) {
            for (int32_t cpu = 0; cpu < cpus; ++cpu) {
                const long faults = FaultsRecordingOn(log.get(), cpu, kRecords);
                if (faults != 0) {
                    faulted += std::string(what) + ", CPU " + std::to_string(cpu) + ": " + std::to_string(faults) + "; ";
                }
            }
        };
        log->SetEnabled(1);
        record("fresh engine");
        uint32_t none = 0;  // a read-out of 0 entries leaves the other bank active
        log->ReadOut7(none, nullptr, nullptr, nullptr, 0);
        record("second bank");
        if (log->Configure(20000) != 20000u) return "Configure(20000) refused";  // 400 kB rings: fresh mappings
        log->SetEnabled(1);
        record("after Configure");
        if (Held(log.get()) != 100u) faulted += "held " + std::to_string(Held(log.get())) + " entries, not 100; ";
        return faulted;
    };
    std::string faulted;
    for (int attempt = 0; attempt < 3; ++attempt) {
        faulted = faultsOnAFreshEngine();
        if (faulted.empty()) break;
    }
    EXPECT_EQ(faulted, "") << "minor faults while recording, in each of three fresh engines";
}

}  // namespace
