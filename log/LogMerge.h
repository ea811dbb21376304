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

#include "log/LogRecords.h"

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
    LogMergeLeaf& Leaf(uint32_t i) { return leaves_[i]; }
    void LoadHead(uint32_t i);
    void Build();
    uint32_t WinnerLeaf() const { return winner_.leaf; }
    uint64_t WinnerKey() const { return winner_.key; }
    void Advance();

private:
    struct Node {
        uint64_t key;
        uint32_t leaf;
    };

    Node BuildNode(uint32_t node);
    void Replay(uint32_t leaf);

    uint32_t size_ = 0;  // leaves, rounded up to a power of two
    LogMergeLeaf* leaves_ = nullptr;  // size_ leaves; those past n never have a head
    Node* nodes_ = nullptr;           // inner nodes 1 .. size_-1 (0 unused)
    Node winner_{kLogNoHead, 0};
};

}  // namespace quelta

#endif
