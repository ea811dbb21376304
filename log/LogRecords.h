// The log engine's storage: one ring of entries per CPU and bank.
//
// Recorders write these words without a lock while a read-out or another
// recorder may touch the same words, so every shared word is a relaxed
// atomic: a race may tear an entry (the log accepts that) but is never
// undefined behaviour. A std::atomic<uint32_t> has the size and layout of a
// plain u32, so the records keep their documented shape.
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
// A ring's byte size is computed in 32 bits; from this many entries on
// (16 bytes each) it overflows, so such a ring is never asked for.
constexpr uint32_t kLogMaxRingEntries = 1u << 28;
// The data word of the entries made by the plain recording operations.
constexpr uint32_t kLogNoData = 0xFFFFFFFFu;

// The time stamp is one 64-bit word (a ClockTime's two words, low first on
// these little-endian targets) stored in one piece, so that two recorders
// racing for a slot can mix words of their entries but never the halves of
// a time: a torn stamp would put an entry seconds away from its neighbours.
struct alignas(8) LogEntry {
    std::atomic<uint64_t> time;
    std::atomic<uint32_t> event;
    std::atomic<uint32_t> data;
};
static_assert(sizeof(LogEntry) == 16, "a log entry is four 32-bit words");

struct LogCpuRecord {
    std::atomic<uint32_t> capacity;
    std::atomic<LogEntry*> entries;
    std::atomic<uint32_t> writeIndex;
    std::atomic<uint32_t> wrapCount;
    LogEntry inlineEntries[kLogInlineSlots];
    std::atomic<uint32_t> readPos;
    std::atomic<uint32_t> readRemaining;
};

// A ring as one thread sees it: the array and a bound that is never larger
// than that array, even while Configure swaps rings under the reader.
struct LogRing {
    LogEntry* entries;
    uint32_t capacity;  // 0: no usable ring
};

// Reads a record's ring once. The inline ring's size is known from its
// address; a heap ring's capacity is published before its pointer (release)
// and only lowered after the array was detached, so reading the pointer with
// acquire and the capacity after it never yields a bound beyond the array
// while that array is live.
inline LogRing LoadRing(const LogCpuRecord& record) {
    LogEntry* entries = record.entries.load(std::memory_order_acquire);
    if (entries == nullptr) return LogRing{nullptr, 0};
    if (entries == record.inlineEntries) return LogRing{entries, kLogInlineCapacity};
    return LogRing{entries, record.capacity.load(std::memory_order_relaxed)};
}

}  // namespace quelta

#endif
