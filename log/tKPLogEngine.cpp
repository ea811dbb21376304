// The log engine: construction, configuration, enabling and recording.
// The read-out lives in LogReadOut.cpp.
#include "log/tKPLogEngine.h"

#include <sched.h>
#include <time.h>

#include <cstdint>
#include <new>

#include "engine/LibraryFrame.h"
#include "engine/tKPusTimingEngine.h"
#include "log/LogHandOff.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace quelta {

namespace {

int QueryCpu() { return sched_getcpu(); }

// Records beyond this many CPUs per bank would never be told apart by the
// platform layer's CPU sets either; a larger count folds into these.
constexpr uint32_t kLogMaxCpus = 1024;

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;

// Empties a record's ring; the ring itself stays.
void ClearRecord(LogCpuRecord& record) {
    record.writeIndex.store(0, kRelaxed);
    record.wrapCount.store(0, kRelaxed);
}

// A heap ring of `capacity` entries behind its header, every page written;
// null when the allocator refuses it or when it is too large to ask for.
LogEntry* AllocateRing(uint32_t capacity) {
    if (capacity >= kLogMaxRingEntries) return nullptr;
    if (capacity > (SIZE_MAX - sizeof(LogRingHeader)) / sizeof(LogEntry)) return nullptr;  // 32-bit
    void* block = PalMemAlloc(sizeof(LogRingHeader) + size_t(capacity) * sizeof(LogEntry));
    if (block == nullptr) return nullptr;
    return BuildRing<StdAtomics>(block, capacity);
}

void FreeRing(LogEntry* entries) { PalMemFree(RingHeaderOf(entries)); }

}  // namespace

int (*gLogCpuQuery)() = QueryCpu;

void ReadLogClock(ClockTime& out) {
    tKPusTimingEngine* engine = gEngine.load(std::memory_order_acquire);
    if (engine != nullptr) {
        engine->ReadGlobal7(out);
        return;
    }
    timespec ts{};
    clock_gettime(CLOCK_REALTIME, &ts);
    const uint64_t ns = static_cast<uint64_t>(static_cast<int64_t>(ts.tv_sec)) * 1000000000ull +
                        static_cast<uint64_t>(ts.tv_nsec);
    out = FromU64(ns);
}

}  // namespace quelta

using namespace quelta;

void* tKPLogEngine::operator new(size_t bytes) noexcept { return PalMemAlloc(bytes); }

void tKPLogEngine::operator delete(void* p) noexcept { PalMemFree(p); }

tKPLogEngine* tKPLogEngine::Create() {
    tKPLogEngine* engine = new tKPLogEngine();
    if (engine == nullptr) return nullptr;
    if (engine->records == nullptr) {
        delete engine;
        return nullptr;
    }
    return engine;
}

tKPLogEngine::tKPLogEngine()
    : enabled(0),
      enableCount(0),
      enableValue(1),
      capacityPerCpu(0),
      activeBank(0),
      records(nullptr),
      cpuCount(1) {
    // A failed CPU query leaves one record per bank; everything then folds
    // into it (see FoldCpuIndex).
    const int32_t n = PalGetCpuCount();
    if (n > 1) cpuCount = static_cast<uint32_t>(n) < kLogMaxCpus ? static_cast<uint32_t>(n) : kLogMaxCpus;

    // One allocation: the records, then the read-out's scratch.
    const uint32_t recordCount = 2 * cpuCount;
    const size_t align = LogMerge::kScratchAlign;
    const size_t scratchOffset = (sizeof(LogCpuRecord) * recordCount + align - 1) / align * align;
    void* memory = PalMemAlloc(scratchOffset + LogMerge::ScratchBytes(cpuCount));
    if (memory == nullptr) return;  // Create reports the failure
    LogCpuRecord* array = static_cast<LogCpuRecord*>(memory);
    for (uint32_t i = 0; i < recordCount; ++i) {
        LogCpuRecord* record = new (&array[i]) LogCpuRecord;
        record->capacity.store(0, kRelaxed);
        record->entries.store(nullptr, kRelaxed);
        ClearRecord(*record);
        ClearEntries(record->inlineEntries, kLogInlineSlots);
        record->readPos.store(0, kRelaxed);
        record->readRemaining.store(0, kRelaxed);
    }
    merge.Bind(static_cast<char*>(memory) + scratchOffset, cpuCount);
    records = array;
    capacityPerCpu.store(Configure(-1), kRelaxed);
}

tKPLogEngine::~tKPLogEngine() {
    if (records == nullptr) return;
    capacityPerCpu.store(Configure(0), kRelaxed);
    PalMemFree(records);
    records = nullptr;
    pthread_mutex_destroy(&maintenanceLock);
}

iKPLogEngine* tKPLogEngine::CreateLogEngine() { return Create(); }

uint32_t tKPLogEngine::Configure(int32_t capacity) {
    LogMaintenanceGuard guard(maintenanceLock);
    enabled.store(0, kRelaxed);
    const uint32_t cap = capacity == -1 ? kLogDefaultCapacity : static_cast<uint32_t>(capacity);
    // Recorders that passed the enabled test just before get a moment to
    // finish before their rings are emptied or freed.
    PalSleepMilliseconds(1);
    if (records == nullptr) return cap;

    bool failed = false;
    const uint32_t recordCount = 2 * cpuCount;
    for (uint32_t i = 0; i < recordCount; ++i) {
        LogCpuRecord& record = records[i];
        ClearRecord(record);
        const LogRing kept = LockedRing(record);
        if (kept.capacity == cap) {
            // The same ring, written through once more: whatever the system
            // did with its pages since (swapped them out, say) is undone here
            // and not on a recorder's path.
            ClearEntries(kept.entries, kept.capacity);
            continue;
        }

        // Detach the old ring before freeing it. (Recorders take the bound
        // of a heap ring from its own header, never from the record.)
        record.entries.store(record.inlineEntries, kRelaxed);
        record.capacity.store(kLogInlineCapacity, kRelaxed);
        if (kept.entries != nullptr && kept.entries != record.inlineEntries) FreeRing(kept.entries);
        ClearEntries(record.inlineEntries, kLogInlineSlots);
        if (cap == 0) continue;

        LogEntry* ring = AllocateRing(cap);
        if (ring == nullptr) {
            failed = true;
            continue;
        }
        PublishRing(record, ring, cap);
    }
    return failed ? kLogInlineCapacity : cap;
}

void tKPLogEngine::Reconfigure() {
    capacityPerCpu.store(Configure(static_cast<int32_t>(capacityPerCpu.load(kRelaxed))), kRelaxed);
}

// --- recording -------------------------------------------------------------

// One entry into the ring of the CPU the caller runs on (see RecordEntry):
// no lock, no allocation, no atomic read-modify-write.
void tKPLogEngine::Record(const ClockTime& time, uint32_t event, uint32_t data) {
    if (enabled.load(kRelaxed) == 0) return;
    const uint32_t cpu = FoldCpuIndex(gLogCpuQuery(), cpuCount);
    const uint32_t bank = activeBank.load(kRelaxed) != 0 ? cpuCount : 0;
    RecordEntry(records[bank + cpu], time.low, time.high, event, data);
}

void tKPLogEngine::LogAt1(const ClockTime& time, uint32_t event) { Record(time, event, kLogNoData); }

void tKPLogEngine::LogAt2(const ClockTime& time, uint32_t event) { Record(time, event, kLogNoData); }

// The stamping operations read the clock before the enabled test: the caller
// gets the time back even while recording is off.
void tKPLogEngine::StampAndLog3(ClockTime& time, uint32_t event) {
    ReadLogClock(time);
    Record(time, event, kLogNoData);
}

void tKPLogEngine::StampAndLog4(ClockTime& time, uint32_t event) {
    ReadLogClock(time);
    Record(time, event, kLogNoData);
}

void tKPLogEngine::LogNow5(uint32_t event) {
    ClockTime now;
    ReadLogClock(now);
    Record(now, event, kLogNoData);
}

void tKPLogEngine::LogNow6(uint32_t event) {
    ClockTime now;
    ReadLogClock(now);
    Record(now, event, kLogNoData);
}

void tKPLogEngine::LogAtWithData(const ClockTime& time, uint32_t data, uint32_t event) {
    Record(time, event, data);
}

void tKPLogEngine::LogNowData256(uint32_t event) {
    ClockTime now;
    ReadLogClock(now);
    Record(now, event, 256);
}

void tKPLogEngine::LogNowData0(uint32_t event) {
    ClockTime now;
    ReadLogClock(now);
    Record(now, event, 0);
}

// The keyed operations go on only when the key equals the enabled word; the
// recording itself tests for 0 again, so a key of 0 never records.
void tKPLogEngine::LogAtIfKey15(const ClockTime& time, uint32_t event, uint32_t key) {
    if (enabled.load(kRelaxed) != key) return;
    Record(time, event, kLogNoData);
}

void tKPLogEngine::LogAtIfKey16(const ClockTime& time, uint32_t event, uint32_t key) {
    if (enabled.load(kRelaxed) != key) return;
    Record(time, event, kLogNoData);
}

void tKPLogEngine::LogNowIfKey17(uint32_t event, uint32_t key) {
    if (enabled.load(kRelaxed) != key) return;
    LogNow5(event);
}

void tKPLogEngine::LogNowIfKey18(uint32_t event, uint32_t key) {
    if (enabled.load(kRelaxed) != key) return;
    LogNow6(event);
}

// --- enabling ----------------------------------------------------------------

void tKPLogEngine::SetEnabledWord(uint32_t value) { enabled.store(value, kRelaxed); }

void tKPLogEngine::NoOperation9() {}

void tKPLogEngine::NoOperation10() {}

void tKPLogEngine::SetEnabled(uint32_t n) {
    enableCount.store(static_cast<int32_t>(n), kRelaxed);
    enabled.store(n != 0 ? enableValue.load(kRelaxed) : 0, kRelaxed);
}

// Nests: recording stays on while more switch-ons than switch-offs are
// outstanding. The count moves with one atomic add so that nested calls from
// several threads are never lost (wrapping, like the plain 32-bit word).
void tKPLogEngine::AdjustEnabled(int32_t delta) {
    const uint32_t count = static_cast<uint32_t>(enableCount.fetch_add(delta, kRelaxed)) +
                           static_cast<uint32_t>(delta);
    enabled.store(static_cast<int32_t>(count) > 0 ? enableValue.load(kRelaxed) : 0, kRelaxed);
}

void tKPLogEngine::SetEnableValue(uint32_t value) {
    enableValue.store(value, kRelaxed);
    enabled.store(value, kRelaxed);
}
