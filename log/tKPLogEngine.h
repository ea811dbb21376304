// tKPLogEngine: the per-CPU event log.
//
// Any thread records time-stamped events into the ring of the CPU it runs on,
// without a lock and without allocating; a read-out merges the newest entries
// of all CPUs in time order. Two banks of rings let the read-out redirect the
// recorders while it reads. The runtime reaches the object only through the
// virtual slots of iKPLogEngine.
#ifndef QUELTA_LOG_TKPLOGENGINE_H
#define QUELTA_LOG_TKPLOGENGINE_H

#include <pthread.h>

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "log/LogMerge.h"
#include "log/LogRecords.h"
#include "quelta/iKPLogEngine.h"

namespace quelta {

// Which CPU the calling thread runs on (sched_getcpu). A seam so that tests
// can place recordings on chosen records or return failures; set it only
// while no thread records.
extern int (*gLogCpuQuery)();

// Folds what the CPU query said into a record index below cpuCount (which is
// at least 1): a failed query (negative) lands on record 0, and a CPU that
// came online after the engine was built (index >= cpuCount) shares the
// record of index mod cpuCount. A recorder therefore never leaves its bank.
inline uint32_t FoldCpuIndex(int cpu, uint32_t cpuCount) {
    if (cpu < 0) return 0;
    uint32_t index = static_cast<uint32_t>(cpu);
    return index < cpuCount ? index : index % cpuCount;
}

// The time the log stamps its entries with: the global clock read through the
// timing engine's ReadGlobal7 when there is an engine, else CLOCK_REALTIME in
// nanoseconds (offset 0), since the log engine is built before the timing
// engine and may be used without one.
void ReadLogClock(ClockTime& out);

// Holds a log engine's maintenance lock for a scope.
class LogMaintenanceGuard {
public:
    explicit LogMaintenanceGuard(pthread_mutex_t& m) : m_(m) { pthread_mutex_lock(&m_); }
    ~LogMaintenanceGuard() { pthread_mutex_unlock(&m_); }
    LogMaintenanceGuard(const LogMaintenanceGuard&) = delete;
    LogMaintenanceGuard& operator=(const LogMaintenanceGuard&) = delete;

private:
    pthread_mutex_t& m_;
};

}  // namespace quelta

// The class lives in the global namespace, like the interface it implements:
// its run-time type name is the runtime's plain `tKPLogEngine`. It stays out
// of the dynamic symbol table (hidden visibility and the version script).
class tKPLogEngine final : public iKPLogEngine {
public:
    // Builds an engine with 5000-entry rings (fewer if their allocation
    // fails), every page of them written already. Returns null when the
    // object or its record array cannot be allocated; nothing is left
    // allocated then.
    static tKPLogEngine* Create();

    ~tKPLogEngine() override;

    // --- slots 0-23 (see iKPLogEngine) ---
    uint32_t Configure(int32_t capacity) override;
    void LogAt1(const ClockTime& time, uint32_t event) override;
    void LogAt2(const ClockTime& time, uint32_t event) override;
    void StampAndLog3(ClockTime& time, uint32_t event) override;
    void StampAndLog4(ClockTime& time, uint32_t event) override;
    void LogNow5(uint32_t event) override;
    void LogNow6(uint32_t event) override;
    void ReadOut7(uint32_t& count, uint32_t timeLow[], uint32_t timeHigh[],
                  uint32_t events[], uint32_t last) override;
    void SetEnabledWord(uint32_t value) override;
    void NoOperation9() override;
    void NoOperation10() override;
    void SetEnabled(uint32_t n) override;
    void AdjustEnabled(int32_t delta) override;
    void SetEnableValue(uint32_t value) override;
    iKPLogEngine* CreateLogEngine() override;
    void LogAtIfKey15(const ClockTime& time, uint32_t event, uint32_t key) override;
    void LogAtIfKey16(const ClockTime& time, uint32_t event, uint32_t key) override;
    void LogNowIfKey17(uint32_t event, uint32_t key) override;
    void LogNowIfKey18(uint32_t event, uint32_t key) override;
    void Reconfigure() override;
    void LogAtWithData(const ClockTime& time, uint32_t data, uint32_t event) override;
    void LogNowData256(uint32_t event) override;
    void LogNowData0(uint32_t event) override;
    void ReadOutMerged(uint32_t& count, uint32_t timeLow[], uint32_t timeHigh[],
                       uint32_t events[], uint32_t data[], uint32_t last) override;

    // The library's allocation point; a failed allocation yields null and the
    // constructor is not run.
    static void* operator new(size_t bytes) noexcept;
    static void operator delete(void* p) noexcept;

    // Number of records per bank (the CPU count when the engine was built).
    uint32_t CpuCount() const { return cpuCount; }

    // Fields, in order. Words that recorders, read-outs and the enable
    // operations share are relaxed atomics.
    std::atomic<uint32_t> enabled;       // 0 off, else the key
    std::atomic<int32_t> enableCount;
    std::atomic<uint32_t> enableValue;
    std::atomic<uint32_t> capacityPerCpu;
    std::atomic<uint32_t> activeBank;    // 0 or cpuCount
    quelta::LogCpuRecord* records;       // 2 x cpuCount, bank 0 then bank 1

private:
    // Only Create builds engines: it discards one whose record array could
    // not be had, so every engine in use has its records.
    tKPLogEngine();

    // The CPU count is read once: the record array was sized with it, and a
    // later answer (the platform layer asks again after a failed query) must
    // never index beyond the array.
    uint32_t cpuCount;

    // Serialises read-outs and reconfigurations with each other (never the
    // recorders): two read-outs at once would share the records' cursors and
    // empty each other's banks.
    pthread_mutex_t maintenanceLock = PTHREAD_MUTEX_INITIALIZER;

    // The read-out's selection over the frozen bank, in the same allocation
    // as the records (sized for cpuCount rings when the engine is built);
    // used only under maintenanceLock.
    quelta::LogMerge merge;

    void Record(const ClockTime& time, uint32_t event, uint32_t data);
};

#endif
