// The log engine's storage: one ring of entries per CPU and bank.
//
// Recorders write these words without a lock while a read-out or another
// recorder may touch the same words, so every shared word is a relaxed
// atomic of word size: on every target, ARMv7 and i686 included, each store
// is one plain store instruction. A race may tear an entry, but is never
// undefined behaviour, and the read-out recognises a torn entry by its check
// word (LogEntryCheck) and leaves it out.
//
// The types are templates over the atomics policy (tLinux/PalAtomic.h) so
// that the memory-model checks build the same records over their own
// atomics; the library uses the StdAtomics instances named below. How
// entries and rings are published lives in log/LogHandOff.h.
#ifndef QUELTA_LOG_LOGRECORDS_H
#define QUELTA_LOG_LOGRECORDS_H

#include <cstdint>

#include "tLinux/PalAtomic.h"

namespace quelta {

// Entries per ring when Configure is asked for the default (-1).
constexpr uint32_t kLogDefaultCapacity = 5000;
// The fallback area inside each record: 20 entries, of which the first 10
// are used as the ring when a heap ring cannot be had.
constexpr uint32_t kLogInlineSlots = 20;
constexpr uint32_t kLogInlineCapacity = 10;
// A ring of this many entries or more is refused without asking the
// allocator (Configure falls back to the inline ring): the log's documented
// limit. On 32-bit targets a smaller ring can still need more bytes than
// size_t holds (entries are 20 bytes); the allocation refuses that itself.
constexpr uint32_t kLogMaxRingEntries = 1u << 28;
// The data word of the entries made by the plain recording operations.
constexpr uint32_t kLogNoData = 0xFFFFFFFFu;

// One recording: the ClockTime's two words (low first), the event and data
// words, and a check word over the four.
template <class A>
struct BasicLogEntry {
    typename A::template Atomic<uint32_t> timeLow;
    typename A::template Atomic<uint32_t> timeHigh;
    typename A::template Atomic<uint32_t> event;
    typename A::template Atomic<uint32_t> data;
    typename A::template Atomic<uint32_t> check;
};
using LogEntry = BasicLogEntry<StdAtomics>;
static_assert(sizeof(LogEntry) == 20, "a log entry is five 32-bit words");

// The check word: each of the four words passes through its own bijection
// (an odd multiplier), so an entry whose words come from two recordings (a
// recorder overwriting a slot while it is read, or two recorders sharing a
// record) never matches when just one word differs: a time whose low and
// high words belong to different recordings is always caught unless the
// event or data word is torn as well, and then only with odds of 2^-32. The
// constant keeps a zero-filled slot from passing.
inline uint32_t LogEntryCheck(uint32_t low, uint32_t high, uint32_t event, uint32_t data) {
    return low ^ (high * 0x9E3779B1u) ^ (event * 0x85EBCA77u) ^ (data * 0xC2B2AE3Du) ^ 0x27D4EB2Fu;
}

// A heap ring is one allocation: this header, then `capacity` entries.
// The capacity is written before the ring is published and never changes
// while the ring lives, so a recorder that reaches the ring through its
// pointer finds the matching bound through the same pointer.
template <class A>
struct BasicLogRingHeader {
    typename A::template Atomic<uint32_t> capacity;
};
using LogRingHeader = BasicLogRingHeader<StdAtomics>;
static_assert(sizeof(LogRingHeader) % alignof(LogEntry) == 0, "entries follow the header");

template <class A>
BasicLogRingHeader<A>* RingHeaderOf(BasicLogEntry<A>* entries) {
    return reinterpret_cast<BasicLogRingHeader<A>*>(entries) - 1;
}

template <class A>
struct BasicLogCpuRecord {
    typename A::template Atomic<uint32_t> capacity;
    typename A::template Atomic<BasicLogEntry<A>*> entries;
    typename A::template Atomic<uint32_t> writeIndex;
    typename A::template Atomic<uint32_t> wrapCount;
    BasicLogEntry<A> inlineEntries[kLogInlineSlots];
    typename A::template Atomic<uint32_t> readPos;
    typename A::template Atomic<uint32_t> readRemaining;
};
using LogCpuRecord = BasicLogCpuRecord<StdAtomics>;

// A ring as one thread sees it: the array and a bound never larger than it.
template <class A>
struct BasicLogRing {
    BasicLogEntry<A>* entries;
    uint32_t capacity;  // 0: no usable ring
};
using LogRing = BasicLogRing<StdAtomics>;

// The ring as the read-out and Configure see it. Both hold the engine's
// maintenance lock, under which rings are only swapped by Configure itself,
// so the record's own pair is consistent.
template <class A>
BasicLogRing<A> LockedRing(const BasicLogCpuRecord<A>& record) {
    return BasicLogRing<A>{A::Load(record.entries, A::kRelaxed), A::Load(record.capacity, A::kRelaxed)};
}

}  // namespace quelta

#endif
