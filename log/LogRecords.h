// The log engine's storage: one ring of entries per CPU and bank.
//
// Recorders write these words without a lock while a read-out or another
// recorder may touch the same words, so every shared word is a relaxed
// atomic of word size: on every target, ARMv7 and i686 included, each store
// is one plain store instruction. A race may tear an entry, but is never
// undefined behaviour, and the read-out recognises a torn entry by its check
// word (LogEntryCheck) and leaves it out.
//
// Publishing: a recorder writes the entry's words (and, on a wrap, the wrap
// count), then PublishFence, then the write index. A read-out loads the write
// indices, then an acquire fence, then everything else: every slot below an
// index it saw holds a whole entry, never one claimed but not yet written.
#ifndef QUELTA_LOG_LOGRECORDS_H
#define QUELTA_LOG_LOGRECORDS_H

#include <atomic>
#include <cstdint>

namespace quelta {

// Entries per ring when Configure is asked for the default (-1).
constexpr uint32_t kLogDefaultCapacity = 5000;
// The fallback area inside each record: 20 entries, of which the first 10
// are used as the ring when a heap ring cannot be had.
constexpr uint32_t kLogInlineSlots = 20;
constexpr uint32_t kLogInlineCapacity = 10;
// A ring of this many entries or more is refused without asking the
// allocator (Configure falls back to the inline ring): the log's documented
// limit, where a 32-bit byte count of 16-byte entries overflows.
constexpr uint32_t kLogMaxRingEntries = 1u << 28;
// The data word of the entries made by the plain recording operations.
constexpr uint32_t kLogNoData = 0xFFFFFFFFu;

// One recording: the ClockTime's two words (low first), the event and data
// words, and a check word over the four.
struct LogEntry {
    std::atomic<uint32_t> timeLow;
    std::atomic<uint32_t> timeHigh;
    std::atomic<uint32_t> event;
    std::atomic<uint32_t> data;
    std::atomic<uint32_t> check;
};
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

// Orders a recorder's entry stores (and its wrap-count store) before the
// write-index store that publishes them. Only stores need ordering there
// (the later store's address and value depend on the loads before it), so
// on ARMv7 this is the store barrier `dmb ishst`, cheaper than the full
// `dmb ish` a release fence becomes; on x86 a release fence emits nothing.
inline void PublishFence() {
#if defined(__arm__) && defined(__ARM_ARCH) && __ARM_ARCH >= 7 && !defined(__SANITIZE_THREAD__)
    __asm__ __volatile__("dmb ishst" ::: "memory");
#else
    std::atomic_thread_fence(std::memory_order_release);
#endif
}

// A heap ring is one allocation: this header, then `capacity` entries.
// The capacity is written before the ring is published and never changes
// while the ring lives, so a recorder that reaches the ring through its
// pointer finds the matching bound through the same pointer.
struct LogRingHeader {
    std::atomic<uint32_t> capacity;
};
static_assert(sizeof(LogRingHeader) % alignof(LogEntry) == 0, "entries follow the header");

inline LogRingHeader* RingHeaderOf(LogEntry* entries) {
    return reinterpret_cast<LogRingHeader*>(entries) - 1;
}

struct LogCpuRecord {
    std::atomic<uint32_t> capacity;
    std::atomic<LogEntry*> entries;
    std::atomic<uint32_t> writeIndex;
    std::atomic<uint32_t> wrapCount;
    LogEntry inlineEntries[kLogInlineSlots];
    std::atomic<uint32_t> readPos;
    std::atomic<uint32_t> readRemaining;
};

// A ring as one thread sees it: the array and a bound never larger than it.
struct LogRing {
    LogEntry* entries;
    uint32_t capacity;  // 0: no usable ring
};

// The ring a recorder writes into. Configure may swap rings at any moment
// (recorders take no lock), so the bound must belong to the array it is used
// on: the inline ring's size is known from its address, a heap ring's is
// read from its own header through the pointer just loaded. That load
// depends on the pointer's value, which orders it after the pointer load on
// every processor this library targets (ARM and x86 keep address
// dependencies), so no barrier is needed where an acquire load would put one.
inline LogRing RecorderRing(const LogCpuRecord& record) {
    LogEntry* entries = record.entries.load(std::memory_order_relaxed);
    if (entries == record.inlineEntries) return LogRing{entries, kLogInlineCapacity};
    if (entries == nullptr) return LogRing{nullptr, 0};
    return LogRing{entries, RingHeaderOf(entries)->capacity.load(std::memory_order_relaxed)};
}

// The ring as the read-out and Configure see it. Both hold the engine's
// maintenance lock, under which rings are only swapped by Configure itself,
// so the record's own pair is consistent.
inline LogRing LockedRing(const LogCpuRecord& record) {
    return LogRing{record.entries.load(std::memory_order_relaxed),
                   record.capacity.load(std::memory_order_relaxed)};
}

}  // namespace quelta

#endif
