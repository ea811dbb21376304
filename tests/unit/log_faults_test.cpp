// Recording never takes a page fault: rings are written through when they are
// made. Its own executable, so that the rings come from a heap (and, for the
// larger ones, from mappings) that nothing has touched before.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/resource.h>

#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "engine/ClockTimeOps.h"
#include "log/tKPLogEngine.h"
#include "tLinux/PalThreads.h"

namespace {

// Minor faults of a thread pinned to `cpu` while `records` LogAt1 go into
// that CPU's ring (time 1024 i + cpu); -1 when it cannot be pinned there.
long FaultsRecordingOn(iKPLogEngine* log, int32_t cpu, uint32_t records) {
    long faults = -1;
    std::thread([&] {
        if (quelta::PalSetAffinityOne(cpu) != 0 || sched_getcpu() != cpu) return;
        // Its own first touches (stack, code an emulator translates) are not the log's.
        volatile char stack[64 * 1024];
        for (volatile char& c : stack) c = 1;
        static iKPLogEngine* const warm = tKPLogEngine::Create();
        warm->SetEnabled(1), warm->LogAt1(quelta::FromU64(1), 0);
        rusage before, after;
        getrusage(RUSAGE_THREAD, &before), getrusage(RUSAGE_THREAD, &before);  // the first call may fault
        for (uint32_t i = 1; i <= records; ++i) log->LogAt1(quelta::FromU64(1024ull * i + cpu), i);
        getrusage(RUSAGE_THREAD, &after);
        faults = after.ru_minflt - before.ru_minflt;
    }).join();
    return faults;
}

// 12,000 records on every CPU (each 5000-entry ring wraps twice) fault
// nothing, in both banks and after a Configure to new, larger rings; the real
// CPU query tags each entry with its CPU. An emulator's own work is now and
// then counted as the thread's faults, so one clean engine of three decides.
TEST(LogFaults, RecordingOnFreshRingsTakesNoPageFault) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer writes its own per-thread trace on every access, faulting in pages";
#endif
    ASSERT_EQ(quelta::PalInitialize(), 1u);
    const int32_t cpus = quelta::PalGetCpuCount();
    std::string faulted = "not run";
    for (int attempt = 0; attempt < 3 && !faulted.empty(); ++attempt) {
        faulted.clear();
        std::unique_ptr<iKPLogEngine> log(tKPLogEngine::Create());
        log->SetEnabled(1);
        for (const std::string phase : {"fresh engine", "second bank", "after Configure"}) {
            uint32_t none = 0;  // a read-out of 0 entries leaves the other bank active
            if (phase[0] == 's') log->ReadOut7(none, nullptr, nullptr, nullptr, 0);
            if (phase[0] == 'a') {  // 400 kB rings: fresh mappings
                ASSERT_EQ(log->Configure(20000), 20000u);
                log->SetEnabled(1);
            }
            for (int32_t cpu = 0; cpu < cpus; ++cpu) {
                const long n = FaultsRecordingOn(log.get(), cpu, 12000);
                if (n < 0) GTEST_SKIP() << "cannot pin a thread to CPU " << cpu;
                if (n != 0) faulted += phase + ", CPU " + std::to_string(cpu) + ": " + std::to_string(n) + "; ";
            }
        }
        uint32_t count = static_cast<uint32_t>(cpus);  // each CPU's newest entry, in CPU order
        std::vector<uint32_t> low(count), high(count), events(count);
        log->ReadOut7(count, low.data(), high.data(), events.data(), 0);
        ASSERT_EQ(count, static_cast<uint32_t>(cpus));
        for (int32_t cpu = 0; cpu < cpus; ++cpu) EXPECT_EQ((events[cpu] >> 8) & 0xFF, static_cast<uint32_t>(cpu));
    }
    EXPECT_EQ(faulted, "") << "minor faults while recording, in each of three fresh engines";
}

}  // namespace
