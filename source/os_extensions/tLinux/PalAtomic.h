// Platform layer: the atomic operations the library's lock-free hand-offs
// are written over.
//
// Each hand-off between threads that does not go through a lock (the log
// ring's entries and index, the wake word, the callback words, the callers'
// count and the stop flag, ...) is written once, as templates over an
// "atomics" policy A: A::Atomic<T> is the word type, A::Load, A::Store,
// A::FetchAdd, A::Exchange and A::Fence the operations, A::kRelaxed ...
// A::kSeqCst the orders. The library instantiates them with StdAtomics
// below, which is std::atomic and nothing else, so the code the compiler
// emits is what the plain calls would emit. The memory-model checks in
// tests/models instantiate the same templates with a model checker's atomics,
// so that the steps they check are the library's own and cannot drift from
// a copy.
#ifndef QUELTA_TLINUX_PALATOMIC_H
#define QUELTA_TLINUX_PALATOMIC_H

#include <atomic>

// Every step of a hand-off is compiled into its caller, as the plain code
// was: left to itself the compiler keeps a larger template out of line (the
// log's recording step), which would add a call to the recording path.
#define QUELTA_HANDOFF inline __attribute__((always_inline))

namespace quelta {

struct StdAtomics {
    template <class T>
    using Atomic = std::atomic<T>;
    using Order = std::memory_order;

    static constexpr Order kRelaxed = std::memory_order_relaxed;
    static constexpr Order kAcquire = std::memory_order_acquire;
    static constexpr Order kRelease = std::memory_order_release;
    static constexpr Order kAcqRel = std::memory_order_acq_rel;
    static constexpr Order kSeqCst = std::memory_order_seq_cst;
    // A pointer load whose target is then read through the pointer, where the
    // processor keeps the two loads in order by the address dependency alone
    // (ARM and x86 both do): relaxed, so no barrier is spent. The language
    // promises that order only for memory_order_consume, which compilers turn
    // into acquire (a full barrier on ARMv7); the model checks read it as
    // consume, which is the assumption made here.
    static constexpr Order kDependency = std::memory_order_relaxed;

    template <class W>
    static auto Load(const W& word, Order order) {
        return word.load(order);
    }
    template <class W, class T>
    static void Store(W& word, T value, Order order) {
        word.store(value, order);
    }
    template <class W, class T>
    static auto FetchAdd(W& word, T delta, Order order) {
        return word.fetch_add(delta, order);
    }
    template <class W, class T>
    static auto Exchange(W& word, T value, Order order) {
        return word.exchange(value, order);
    }
    static void Fence(Order order) { std::atomic_thread_fence(order); }

    // Orders the stores before it before the stores after it; nothing about
    // loads. Where only stores need ordering (a writer publishing what it
    // wrote: the later store's address and value depend on the loads before
    // it) this is the ARMv7 store barrier `dmb ishst`, cheaper than the full
    // `dmb ish` of a release fence; on x86 a release fence emits nothing.
    // It stands in for a release fence, and the model checks read it as one.
    static void StoreFence() {
#if defined(__arm__) && defined(__ARM_ARCH) && __ARM_ARCH >= 7 && !defined(__SANITIZE_THREAD__)
        __asm__ __volatile__("dmb ishst" ::: "memory");
#else
        std::atomic_thread_fence(std::memory_order_release);
#endif
    }
};

}  // namespace quelta

#endif
