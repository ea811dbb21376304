// A fixed-capacity ring between one producing thread and one consuming
// thread, without locks: the survey thread (or the library's timer thread,
// in the tick callback) hands samples to the probe's main thread, which
// writes files and prints while the real-time threads keep sampling.
//
// Concurrency: `head_` is written only by the producer (release) and read by
// the consumer (acquire); `tail_` the other way round; a slot is written
// before the head that publishes it and read before the tail that frees it.
// `dropped_` counts pushes refused because the consumer fell a whole ring
// behind (relaxed: a statistic). The slots are allocated and touched by the
// constructor, so pushing never allocates or faults a page in.
#ifndef QUELTA_PROBE_SPSCRING_H
#define QUELTA_PROBE_SPSCRING_H

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace qprobe {

template <class T>
class SpscRing {
public:
    explicit SpscRing(std::size_t capacityPowerOfTwo) : slots_(capacityPowerOfTwo), mask_(capacityPowerOfTwo - 1) {}

    bool Push(const T& value) {
        const uint64_t h = head_.load(std::memory_order_relaxed);
        if (h - tail_.load(std::memory_order_acquire) > mask_) {
            dropped_.fetch_add(1, std::memory_order_relaxed);
            return false;
        }
        slots_[h & mask_] = value;
        head_.store(h + 1, std::memory_order_release);
        return true;
    }

    // Hands every waiting value to fn, oldest first; returns how many.
    template <class Fn>
    std::size_t Drain(Fn&& fn) {
        const uint64_t t = tail_.load(std::memory_order_relaxed);
        const uint64_t h = head_.load(std::memory_order_acquire);
        for (uint64_t i = t; i != h; ++i) fn(slots_[i & mask_]);
        tail_.store(h, std::memory_order_release);
        return static_cast<std::size_t>(h - t);
    }

    uint64_t dropped() const { return dropped_.load(std::memory_order_relaxed); }

private:
    std::vector<T> slots_;
    const uint64_t mask_;
    std::atomic<uint64_t> head_{0};
    std::atomic<uint64_t> tail_{0};
    std::atomic<uint64_t> dropped_{0};
};

}  // namespace qprobe

#endif
