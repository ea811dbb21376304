// How the log's rings and entries pass between threads without a lock: the
// recorder's and the read-out's halves of each hand-off, written once over
// the atomics policy (tLinux/PalAtomic.h). The log engine uses them with
// StdAtomics; tests/models checks the same steps under the C++ memory model.
//
// Entries. A recorder writes the entry's words (and, on a wrap, the wrap
// count), then a store fence, then the write index. A read-out loads every
// frozen ring's write index and wrap count, then one acquire fence, then the
// entries. So every slot it goes on to read (those below the index, and on a
// wrapped ring the rest) was written in this round of the ring, or is being
// written now and fails its check word; it is never a slot claimed but not
// yet written, which would still hold an entry of an earlier round, seconds
// old, with a valid check word. The wrap count is loaded before the fence,
// with the index: loaded after it, it could come from a later recording than
// the index did, and open slots above the index whose entries that fence
// does not cover.
//
// Rings. Configure builds a heap ring (its header with the bound, then its
// entries, every word written) and publishes the pointer with a release
// store. A recorder loads the pointer and reads the bound through it: the
// address dependency keeps that read after the pointer's (see
// StdAtomics::kDependency), so it finds the bound written before the ring
// was published.
#ifndef QUELTA_LOG_LOGHANDOFF_H
#define QUELTA_LOG_LOGHANDOFF_H

#include <cstdint>
#include <new>

#include "log/LogRecords.h"

namespace quelta {

// --- rings -------------------------------------------------------------------

// Writes every word of `count` entries. This is also what puts a new ring's
// pages in place: a heap block is only address space until first written,
// and the first write to each page would otherwise fault on a recorder's
// path (one fault per page, each costing that recorder microseconds).
template <class A>
void ClearEntries(BasicLogEntry<A>* entries, uint32_t count) {
    for (uint32_t i = 0; i < count; ++i) {
        BasicLogEntry<A>& entry = entries[i];
        A::Store(entry.timeLow, 0u, A::kRelaxed);
        A::Store(entry.timeHigh, 0u, A::kRelaxed);
        A::Store(entry.event, 0u, A::kRelaxed);
        A::Store(entry.data, 0u, A::kRelaxed);
        A::Store(entry.check, 0u, A::kRelaxed);
    }
}

// Builds a heap ring of `capacity` entries in `block` (room for the header
// and the entries): the header with its bound, then every entry written.
// Returns the entries.
template <class A>
BasicLogEntry<A>* BuildRing(void* block, uint32_t capacity) {
    auto* header = new (block) BasicLogRingHeader<A>;
    A::Store(header->capacity, capacity, A::kRelaxed);
    auto* entries = reinterpret_cast<BasicLogEntry<A>*>(header + 1);
    for (uint32_t i = 0; i < capacity; ++i) new (&entries[i]) BasicLogEntry<A>;
    ClearEntries(entries, capacity);
    return entries;
}

// Configure: hands a built heap ring to the recorders of `record`. Release:
// the header and the entries before the pointer.
template <class A>
QUELTA_HANDOFF void PublishRing(BasicLogCpuRecord<A>& record, BasicLogEntry<A>* entries, uint32_t capacity) {
    A::Store(record.capacity, capacity, A::kRelaxed);
    A::Store(record.entries, entries, A::kRelease);
}

// The ring a recorder writes into. Configure may swap rings at any moment
// (recorders take no lock), so the bound must belong to the array it is used
// on: the inline ring's size is known from its address, a heap ring's is
// read from its own header through the pointer just loaded.
template <class A>
QUELTA_HANDOFF BasicLogRing<A> RecorderRing(BasicLogCpuRecord<A>& record) {
    BasicLogEntry<A>* entries = A::Load(record.entries, A::kDependency);
    if (entries == record.inlineEntries) return BasicLogRing<A>{entries, kLogInlineCapacity};
    if (entries == nullptr) return BasicLogRing<A>{nullptr, 0};
    return BasicLogRing<A>{entries, A::Load(RingHeaderOf(entries)->capacity, A::kRelaxed)};
}

// --- entries -----------------------------------------------------------------

// One entry into the ring `record` holds for recorders. No lock, no
// read-modify-write: word loads and stores, and one store fence (a store
// barrier on ARMv7, nothing on x86) before the index that publishes the
// entry. Every shared word is read once and range-checked, so that a racing
// Configure or read-out can tear an entry but never send a store outside
// the ring; the check word lets the read-out recognise such a tear.
template <class A>
QUELTA_HANDOFF void RecordEntry(BasicLogCpuRecord<A>& record, uint32_t low, uint32_t high, uint32_t event,
                                uint32_t data) {
    const BasicLogRing<A> ring = RecorderRing(record);
    if (ring.capacity == 0) return;
    uint32_t slot = A::Load(record.writeIndex, A::kRelaxed);
    const bool wraps = slot >= ring.capacity;
    if (wraps) slot = 0;
    BasicLogEntry<A>& entry = ring.entries[slot];
    A::Store(entry.timeLow, low, A::kRelaxed);
    A::Store(entry.timeHigh, high, A::kRelaxed);
    A::Store(entry.event, event, A::kRelaxed);
    A::Store(entry.data, data, A::kRelaxed);
    A::Store(entry.check, LogEntryCheck(low, high, event, data), A::kRelaxed);
    if (wraps) A::Store(record.wrapCount, A::Load(record.wrapCount, A::kRelaxed) + 1, A::kRelaxed);
    A::StoreFence();
    A::Store(record.writeIndex, slot + 1, A::kRelaxed);
}

// What a recorder has published in a ring, as the read-out loads it.
struct LogPublished {
    uint32_t writeIndex;
    uint32_t wrapCount;
};

// The read-out's first step for each frozen ring; after the last of them,
// AfterPublishedLoads, then the entries.
template <class A>
QUELTA_HANDOFF LogPublished LoadPublished(const BasicLogCpuRecord<A>& record) {
    return LogPublished{A::Load(record.writeIndex, A::kRelaxed), A::Load(record.wrapCount, A::kRelaxed)};
}

// One acquire fence for all the rings: it pairs with each recorder's store
// fence before the index or wrap count loaded.
template <class A>
QUELTA_HANDOFF void AfterPublishedLoads() {
    A::Fence(A::kAcquire);
}

// Where the read-out of a ring starts: its newest slot, and how many entries
// it holds (the whole ring once it has wrapped). A write index beyond the
// ring (a recorder that still held a ring an earlier Configure replaced)
// counts as a full ring.
struct LogCursor {
    uint32_t pos;
    uint32_t remaining;
};

QUELTA_HANDOFF LogCursor StartCursor(const LogPublished& published, uint32_t capacity) {
    uint32_t remaining = published.wrapCount != 0 ? capacity : published.writeIndex;
    if (remaining > capacity) remaining = capacity;
    uint32_t pos = published.writeIndex - 1;
    if (pos >= capacity) pos = capacity - 1;  // 0 on an empty ring
    return LogCursor{pos, remaining};
}

// One entry as the read-out copies it.
struct LogEntryWords {
    uint32_t low;
    uint32_t high;
    uint32_t event;
    uint32_t data;
};

// Reads one entry; false when its check word does not match (torn by a
// recorder still writing into the frozen ring, or never written).
template <class A>
QUELTA_HANDOFF bool ReadEntry(const BasicLogEntry<A>& entry, LogEntryWords& out) {
    out.low = A::Load(entry.timeLow, A::kRelaxed);
    out.high = A::Load(entry.timeHigh, A::kRelaxed);
    out.event = A::Load(entry.event, A::kRelaxed);
    out.data = A::Load(entry.data, A::kRelaxed);
    return A::Load(entry.check, A::kRelaxed) == LogEntryCheck(out.low, out.high, out.event, out.data);
}

}  // namespace quelta

#endif
