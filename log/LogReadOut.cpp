// The log engine's read-out: the newest entries of all CPUs, merged in time
// order.
//
// The bank being written is frozen by pointing the recorders at the other
// bank; its rings are then read from their newest entry backwards, and each
// output entry is the latest of the rings' current heads (chosen by the
// tournament tree of LogMerge), so the caller's arrays fill from the top down
// and end up in ascending time order. Recorders take no lock: one that chose
// its ring before the switch may still be writing while we read, so entries
// can be missed or overwritten, but an entry torn by such a write fails its
// check word and is left out, and every index read from a shared word is
// checked against the ring it is used on.
#include <cstring>

#include "engine/ClockTimeOps.h"
#include "log/LogHandOff.h"
#include "log/tKPLogEngine.h"

namespace quelta {

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;

// Moves `copied` words from index `from` down to index 0 (regions may overlap).
void MoveDown(uint32_t* array, uint32_t from, uint32_t copied) {
    if (array != nullptr) std::memmove(array, array + from, copied * sizeof(uint32_t));
}

}  // namespace

}  // namespace quelta

using namespace quelta;

void tKPLogEngine::ReadOut7(uint32_t& count, uint32_t timeLow[], uint32_t timeHigh[],
                            uint32_t events[], uint32_t last) {
    ReadOutMerged(count, timeLow, timeHigh, events, nullptr, last);
}

// `last` is part of the runtime's call but carries nothing the read-out uses.
void tKPLogEngine::ReadOutMerged(uint32_t& count, uint32_t timeLow[], uint32_t timeHigh[],
                                 uint32_t events[], uint32_t data[], uint32_t /*last*/) {
    LogMaintenanceGuard guard(maintenanceLock);
    const uint32_t n = cpuCount;

    // Empty the other bank and send the recorders there; the bank they were
    // writing is now frozen for reading.
    const uint32_t frozen = activeBank.load(kRelaxed) != 0 ? n : 0;
    const uint32_t other = frozen == 0 ? n : 0;
    for (uint32_t i = 0; i < n; ++i) {
        records[other + i].writeIndex.store(0, kRelaxed);
        records[other + i].wrapCount.store(0, kRelaxed);
    }
    // The switch is a sequentially consistent store so that it is visible
    // before the cursors below are read: with a plain store the processor may
    // read the write indices first while the store still waits in its buffer,
    // and recorders would go on filling the frozen rings under the read for
    // that long. One barrier per read-out; recording stays free of them.
    activeBank.store(other, std::memory_order_seq_cst);

    // The write indices and wrap counts first, then one acquire fence, then
    // the entries they publish (see LogHandOff.h). (Each pair waits in its
    // leaf's pos and remaining until the cursors are set.)
    for (uint32_t i = 0; i < n; ++i) {
        const LogPublished published = LoadPublished(records[frozen + i]);
        merge.Leaf(i).pos = published.writeIndex;
        merge.Leaf(i).remaining = published.wrapCount;
    }
    AfterPublishedLoads<StdAtomics>();

    // Cursors: each ring is read from its newest entry towards older ones.
    uint64_t total = 0;
    for (uint32_t i = 0; i < n; ++i) {
        LogCpuRecord& record = records[frozen + i];
        LogMergeLeaf& leaf = merge.Leaf(i);
        const LogRing ring = LockedRing(record);
        const LogCursor cursor = StartCursor(LogPublished{leaf.pos, leaf.remaining}, ring.capacity);
        record.readPos.store(cursor.pos, kRelaxed);
        record.readRemaining.store(cursor.remaining, kRelaxed);
        leaf.entries = ring.entries;
        leaf.capacity = ring.capacity;
        leaf.pos = cursor.pos;
        leaf.remaining = cursor.remaining;
        total += cursor.remaining;
    }

    if (count > total) count = static_cast<uint32_t>(total);
    const uint32_t m = count;
    // Nothing to copy: the recorders stay on the emptied bank, so the log
    // starts afresh from here (the next read-out empties the frozen bank).
    if (m == 0) return;

    for (uint32_t i = 0; i < n; ++i) merge.LoadHead(i);
    merge.Build();
    uint32_t k = m;
    while (k > 0) {
        // The latest head; ties go to the lower CPU index. A head stamped 0
        // (or with high word 0xFFFFFFFF, which orders before 0) is never
        // chosen: when only such heads are left, stop here rather than hand
        // out an entry that is not the latest.
        const uint64_t key = merge.WinnerKey();
        if (key == kLogNoHead) break;
        const uint32_t best = merge.WinnerLeaf();
        const LogMergeLeaf& head = merge.Leaf(best);
        const uint64_t time = key - OrderKey(0);

        --k;
        timeLow[k] = static_cast<uint32_t>(time);
        timeHigh[k] = static_cast<uint32_t>(time >> 32);
        // Bits 8-15 name the CPU; only its low 8 bits fit there.
        events[k] = (head.event & ~0xFF00u) | ((best & 0xFFu) << 8);
        if (data != nullptr) data[k] = head.data;
        merge.Advance();
    }

    // The cursors where the merge left them.
    for (uint32_t i = 0; i < n; ++i) {
        records[frozen + i].readPos.store(merge.Leaf(i).pos, kRelaxed);
        records[frozen + i].readRemaining.store(merge.Leaf(i).remaining, kRelaxed);
    }

    // A stopped merge (or one that left torn entries out) filled only indices
    // k..m-1. Move them down so that the caller's arrays always hold `count`
    // entries at 0..count-1, oldest first.
    if (k > 0) {
        const uint32_t copied = m - k;
        MoveDown(timeLow, k, copied);
        MoveDown(timeHigh, k, copied);
        MoveDown(events, k, copied);
        MoveDown(data, k, copied);
        count = copied;
    }

    // Recording resumes in the bank it was writing, untouched by the read.
    activeBank.store(frozen, kRelaxed);
}
