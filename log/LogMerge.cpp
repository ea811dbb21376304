// The read-out's tournament tree (see LogMerge.h).
#include "log/LogMerge.h"

namespace quelta {

namespace {

uint32_t RoundUpToPowerOfTwo(uint32_t n) {
    uint32_t size = 1;
    while (size < n) size *= 2;
    return size;
}

}  // namespace

size_t LogMerge::ScratchBytes(uint32_t leaves) {
    const size_t size = RoundUpToPowerOfTwo(leaves);
    return size * (sizeof(LogMergeLeaf) + sizeof(uint64_t) + sizeof(uint32_t));
}

void LogMerge::Bind(void* scratch, uint32_t leaves) {
    size_ = RoundUpToPowerOfTwo(leaves);
    leaves_ = static_cast<LogMergeLeaf*>(scratch);
    nodeKeys_ = reinterpret_cast<uint64_t*>(leaves_ + size_);
    nodeLeaves_ = reinterpret_cast<uint32_t*>(nodeKeys_ + size_);
    for (uint32_t i = 0; i < size_; ++i) {
        leaves_[i] = LogMergeLeaf{nullptr, 0, 0, 0, 0, 0, kLogNoHead};
        nodeKeys_[i] = kLogNoHead;
        nodeLeaves_[i] = 0;
    }
    winner_ = Node{kLogNoHead, 0};
}

// The match at `node` is between the winners of its two subtrees; the left
// one (lower CPU indices) takes it on equal keys.
LogMerge::Node LogMerge::BuildNode(uint32_t node) {
    if (node >= size_) return Node{leaves_[node - size_].key, node - size_};
    const Node left = BuildNode(2 * node);
    const Node right = BuildNode(2 * node + 1);
    const Node& loser = left.key >= right.key ? right : left;
    nodeKeys_[node] = loser.key;
    nodeLeaves_[node] = loser.leaf;
    return left.key >= right.key ? left : right;
}

void LogMerge::Build() { winner_ = BuildNode(1); }

}  // namespace quelta
