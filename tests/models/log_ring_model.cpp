// The log ring's hand-offs (log/LogHandOff.h) under the C++ memory model:
// a recorder publishing entries to a read-out, and Configure publishing a new
// ring to a recorder. Both run the library's own steps over RlAtomics.
#include "log/LogHandOff.h"

#include "RelacyAtomics.h"

namespace {

using quelta::LogEntryWords;
using models::RlAtomics;
using Entry = quelta::BasicLogEntry<RlAtomics>;
using Header = quelta::BasicLogRingHeader<RlAtomics>;
using Record = quelta::BasicLogCpuRecord<RlAtomics>;

constexpr uint32_t kRingSlots = 2;

// Room for a heap ring: its header, then its entries.
struct RingBlock {
    alignas(Header) unsigned char bytes[sizeof(Header) + kRingSlots * sizeof(Entry)];

    Entry* Build(uint32_t capacity) { return quelta::BuildRing<RlAtomics>(bytes, capacity); }
    void Destroy(Entry* entries, uint32_t capacity) {
        for (uint32_t i = 0; i < capacity; ++i) entries[i].~Entry();
        quelta::RingHeaderOf(entries)->~Header();
    }
};

// A record as the engine's constructor leaves it: no heap ring, every word
// written.
void InitRecord(Record& record) {
    for (auto* word : {&record.capacity, &record.writeIndex, &record.wrapCount, &record.readPos,
                       &record.readRemaining}) {
        word->store(0, rl::mo_relaxed, $);
    }
    record.entries.store(nullptr, rl::mo_relaxed, $);
    quelta::ClearEntries(record.inlineEntries, quelta::kLogInlineSlots);
}

// Every word of entry t is derived from t, so a torn entry shows.
void Put(Record& record, uint32_t t) { quelta::RecordEntry(record, t, t + 1, t * 7, t * 13); }

bool IsWhole(const LogEntryWords& w) {
    return w.high == w.low + 1 && w.event == w.low * 7 && w.data == w.low * 13;
}

// A bank the last read-out emptied still holds whole entries of its earlier
// round (times 1 and 2). A recorder records 10 and 11 into the two-slot ring,
// then 12, which wraps onto slot 0, while a read-out reads the ring. Every
// entry the read-out takes is one of this round, never of the earlier one,
// and never torn.
struct EntriesPublished : rl::test_suite<EntriesPublished, 2> {
    Record record;
    RingBlock block;
    Entry* ring = nullptr;

    void before() {
        InitRecord(record);
        ring = block.Build(kRingSlots);
        quelta::PublishRing(record, ring, kRingSlots);
        Put(record, 1);
        Put(record, 2);
        record.writeIndex.store(0, rl::mo_relaxed, $);  // emptied, as ReadOutMerged empties a bank
    }

    void thread(unsigned index) {
        if (index == 0) {
            for (uint32_t t = 10; t <= 12; ++t) Put(record, t);
            return;
        }
        const quelta::LogPublished published = quelta::LoadPublished(record);
        quelta::AfterPublishedLoads<RlAtomics>();
        quelta::LogCursor cursor = quelta::StartCursor(published, kRingSlots);
        for (; cursor.remaining != 0; --cursor.remaining) {
            LogEntryWords words;
            if (quelta::ReadEntry(ring[cursor.pos], words)) {
                RL_ASSERT(IsWhole(words));
                RL_ASSERT(words.low >= 10);
            }
            cursor.pos = cursor.pos == 0 ? kRingSlots - 1 : cursor.pos - 1;
        }
    }

    void after() { block.Destroy(ring, kRingSlots); }
};

// Configure replaces a record's inline ring by a heap ring it has just built
// while a recorder records: the recorder finds the new ring's bound through
// its pointer (never a header not yet written), and its entry is not undone
// by the new ring's clearing.
struct RingPublished : rl::test_suite<RingPublished, 2> {
    Record record;
    RingBlock block;
    Entry* ring = nullptr;

    void before() {
        InitRecord(record);
        record.entries.store(record.inlineEntries, rl::mo_relaxed, $);
        record.capacity.store(quelta::kLogInlineCapacity, rl::mo_relaxed, $);
    }

    void thread(unsigned index) {
        if (index == 0) {
            Entry* built = block.Build(kRingSlots);
            quelta::PublishRing(record, built, kRingSlots);
            ring = built;
        } else {
            Put(record, 5);
        }
    }

    void after() {
        LogEntryWords inlined, heap;
        const bool inInline = quelta::ReadEntry(record.inlineEntries[0], inlined);
        const bool inHeap = quelta::ReadEntry(ring[0], heap);
        RL_ASSERT((inInline && inlined.low == 5) || (inHeap && heap.low == 5));
        block.Destroy(ring, kRingSlots);
    }
};

const models::Case kCases[] = {
    {"log entries published by the write index", &models::Simulate<EntriesPublished>, 3},
    {"log ring published to recorders", &models::Simulate<RingPublished>, 4},
};

}  // namespace

int main(int argc, char** argv) { return models::RunModels(argc, argv, kCases, sizeof kCases / sizeof kCases[0]); }
