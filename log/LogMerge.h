// The read-out's selection: of the frozen rings, which one's head (its
// newest entry not yet handed out) is the latest, again and again.
//
// A tournament tree over the n heads keeps that answer: every inner node
// holds the head that lost the match played there, the root's winner is the
// latest head, and replacing the winner's head replays only the matches on
// its path to the root, one comparison per level. A read-out of m entries
// thus costs O(n) to set up and O(log n) per entry, where scanning every head
// for every entry would cost O(m x n).
//
// The order is exactly the one a scan in CPU order with "replace only by a
// strictly later time" gives: the latest time in ClockTime order wins, and
// among equal times the lower CPU index, because leaves sit in CPU order and
// every match goes to the left (lower) side on a tie.
//
// Concurrency: used only by the read-out, under the engine's maintenance
// lock. The memory is the engine's, allocated and written when the engine is
// built, so a read-out allocates nothing.
#ifndef QUELTA_LOG_LOGMERGE_H
#define QUELTA_LOG_LOGMERGE_H

#include <cstddef>
#include <cstdint>

#include "engine/ClockTimeOps.h"
#include "log/LogHandOff.h"

namespace quelta {

// The key of a leaf with nothing to select: an exhausted ring, or a head
// whose time is never selected (0, or a high word of 0xFFFFFFFF: not later
// than 0 in ClockTime order). The key of every selectable time, its order key
// (above 2^32), is larger.
constexpr uint64_t kLogNoHead = 1;

// One frozen ring being read: its cursor and its head.
struct LogMergeLeaf {
    const LogEntry* entries;
    uint32_t capacity;
    uint32_t pos;        // slot of the head
    uint32_t remaining;  // entries not yet handed out, the head among them
    uint32_t event;      // the head's words (meaningful while key > kLogNoHead)
    uint32_t data;
    uint64_t key;        // the head's order key, or kLogNoHead
};
static_assert(sizeof(LogMergeLeaf) % alignof(uint64_t) == 0, "the node keys follow the leaves");

class LogMerge {
public:
    // Scratch memory for `leaves` leaves: its size and alignment.
    static size_t ScratchBytes(uint32_t leaves);
    static constexpr size_t kScratchAlign = 8;

    // Takes scratch memory of ScratchBytes(leaves) bytes and writes all of it.
    void Bind(void* scratch, uint32_t leaves);

    // The read-out fills each leaf's ring and cursor, loads its head, then
    // builds the tree once; after that it hands out the winner's head and
    // calls Advance, as long as WinnerKey() > kLogNoHead.
    // (The per-entry steps are inline: a read-out runs them once per entry.)
    LogMergeLeaf& Leaf(uint32_t i) { return leaves_[i]; }
    inline void LoadHead(uint32_t i);
    void Build();
    uint32_t WinnerLeaf() const { return winner_.leaf; }
    uint64_t WinnerKey() const { return winner_.key; }
    inline void Advance();

private:
    struct Node {
        uint64_t key;
        uint32_t leaf;
    };

    Node BuildNode(uint32_t node);
    inline void Replay(uint32_t leaf);

    uint32_t size_ = 0;  // leaves, rounded up to a power of two
    LogMergeLeaf* leaves_ = nullptr;  // size_ leaves; those past n never have a head
    uint64_t* nodeKeys_ = nullptr;    // inner nodes 1 .. size_-1 (0 unused): the
    uint32_t* nodeLeaves_ = nullptr;  // loser's key and leaf, in two arrays (cheaper to index)
    Node winner_{kLogNoHead, 0};
};

// --- the per-entry steps ---------------------------------------------------------

// One slot back, from slot 0 round to the ring's last.
inline void LogMergeStepBack(LogMergeLeaf& leaf) {
    leaf.pos = leaf.pos == 0 ? leaf.capacity - 1 : leaf.pos - 1;
    --leaf.remaining;
}

// The newest entry at or behind the cursor whose check word matches: an
// entry torn by a recorder still writing into the frozen bank is left out
// (counted as handed out), never copied with a time it was not recorded at.
inline void LogMerge::LoadHead(uint32_t i) {
    LogMergeLeaf& leaf = leaves_[i];
    while (leaf.remaining != 0) {
        const LogEntry& entry = leaf.entries[leaf.pos];
        LogEntryWords words;
        if (ReadEntry(entry, words)) {
            const uint64_t key = OrderKey((uint64_t(words.high) << 32) | words.low);
            leaf.key = key > OrderKey(0) ? key : kLogNoHead;
            leaf.event = words.event;
            leaf.data = words.data;
            // The ring's next head, fetched while the other rings take
            // their turns: with many CPUs every head lies in another ring.
            // (Before slot 0 it is an address outside the ring, which a
            // prefetch may be given: it never faults.)
            __builtin_prefetch(reinterpret_cast<const void*>(reinterpret_cast<uintptr_t>(&entry) - sizeof(LogEntry)));
            return;
        }
        LogMergeStepBack(leaf);
    }
    leaf.key = kLogNoHead;
}

// The leaf that won last has a new head: replay the matches on its path. At
// each node the stored loser is the winner of the sibling subtree; it takes
// the match when its key is larger, or equal and its leaf lower (the left
// side). A branch, not a select: the processor predicts the outcome and runs
// ahead, where selects chain every level to the one below (measured twice
// as slow); equal keys are rare, so their test costs nothing.
inline void LogMerge::Replay(uint32_t leaf) {
    uint64_t* const keys = nodeKeys_;  // locals: no reload after each store
    uint32_t* const losers = nodeLeaves_;
    uint64_t key = leaves_[leaf].key;
    uint32_t who = leaf;
    for (size_t index = (size_t(size_) + leaf) >> 1; index > 0; index >>= 1) {
        const uint64_t stored = keys[index];
        if (stored > key || (stored == key && losers[index] < who)) {
            keys[index] = key;
            key = stored;
            const uint32_t storedLeaf = losers[index];
            losers[index] = who;
            who = storedLeaf;
        }
    }
    winner_ = Node{key, who};
}

inline void LogMerge::Advance() {
    const uint32_t w = winner_.leaf;
    LogMergeStepBack(leaves_[w]);
    LoadHead(w);
    Replay(w);
}

}  // namespace quelta

#endif
