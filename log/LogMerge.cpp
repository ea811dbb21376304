// The read-out's tournament tree (see LogMerge.h).
#include "log/LogMerge.h"

#include "engine/ClockTimeOps.h"

namespace quelta {

namespace {

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;

uint32_t RoundUpToPowerOfTwo(uint32_t n) {
    uint32_t size = 1;
    while (size < n) size *= 2;
    return size;
}

// One slot back, from slot 0 round to the ring's last.
void StepBack(LogMergeLeaf& leaf) {
    leaf.pos = leaf.pos == 0 ? leaf.capacity - 1 : leaf.pos - 1;
    --leaf.remaining;
}

}  // namespace

size_t LogMerge::ScratchBytes(uint32_t leaves) {
    const size_t size = RoundUpToPowerOfTwo(leaves);
    return size * sizeof(LogMergeLeaf) + size * sizeof(Node);
}

void LogMerge::Bind(void* scratch, uint32_t leaves) {
    size_ = RoundUpToPowerOfTwo(leaves);
    leaves_ = static_cast<LogMergeLeaf*>(scratch);
    nodes_ = reinterpret_cast<Node*>(leaves_ + size_);
    for (uint32_t i = 0; i < size_; ++i) {
        leaves_[i] = LogMergeLeaf{nullptr, 0, 0, 0, 0, 0, kLogNoHead};
        nodes_[i] = Node{kLogNoHead, 0};
    }
    winner_ = Node{kLogNoHead, 0};
}

// The newest entry at or behind the cursor whose check word matches: an
// entry torn by a recorder still writing into the frozen bank is left out
// (counted as handed out), never copied with a time it was not recorded at.
void LogMerge::LoadHead(uint32_t i) {
    LogMergeLeaf& leaf = leaves_[i];
    while (leaf.remaining != 0) {
        const LogEntry& entry = leaf.entries[leaf.pos];
        const uint32_t low = entry.timeLow.load(kRelaxed);
        const uint32_t high = entry.timeHigh.load(kRelaxed);
        const uint32_t event = entry.event.load(kRelaxed);
        const uint32_t data = entry.data.load(kRelaxed);
        if (entry.check.load(kRelaxed) == LogEntryCheck(low, high, event, data)) {
            const uint64_t key = OrderKey((uint64_t(high) << 32) | low);
            leaf.key = key > OrderKey(0) ? key : kLogNoHead;
            leaf.event = event;
            leaf.data = data;
            return;
        }
        StepBack(leaf);
    }
    leaf.key = kLogNoHead;
}

// The match at `node` is between the winners of its two subtrees; the left
// one (lower CPU indices) takes it on equal keys.
LogMerge::Node LogMerge::BuildNode(uint32_t node) {
    if (node >= size_) return Node{leaves_[node - size_].key, node - size_};
    const Node left = BuildNode(2 * node);
    const Node right = BuildNode(2 * node + 1);
    if (left.key >= right.key) {
        nodes_[node] = right;
        return left;
    }
    nodes_[node] = left;
    return right;
}

void LogMerge::Build() { winner_ = BuildNode(1); }

void LogMerge::Advance() {
    const uint32_t w = winner_.leaf;
    StepBack(leaves_[w]);
    LoadHead(w);
    Replay(w);
}

// The leaf that won last has a new head: replay the matches on its path. At
// each node the stored loser is the winner of the sibling subtree; it takes
// the match when its key is larger, or equal and it sits on the left (the
// replayed head came up from the right child, an odd node). Keys are at
// least 1, so "key - 1" cannot wrap. Written without branches: which side
// wins is data, not a pattern a predictor could learn.
void LogMerge::Replay(uint32_t leaf) {
    Node current{leaves_[leaf].key, leaf};
    for (uint32_t index = size_ + leaf; index > 1;) {
        const uint64_t fromRight = index & 1u;
        index >>= 1;
        const Node stored = nodes_[index];
        const bool storedWins = stored.key > current.key - fromRight;
        nodes_[index] = storedWins ? current : stored;
        current = storedWins ? stored : current;
    }
    winner_ = current;
}

}  // namespace quelta
