// The engine's small lock-free hand-offs between callers and the timer
// thread: each one's two halves, written once over the atomics policy
// (tLinux/PalAtomic.h). The library instantiates them with StdAtomics;
// tests/models checks the same steps under the C++ memory model.
#ifndef QUELTA_ENGINE_HANDOFF_H
#define QUELTA_ENGINE_HANDOFF_H

#include <cstdint>

#include "tLinux/PalAtomic.h"

namespace quelta {

// --- the callback and its argument (gCallbackFn, gCallbackArg) ----------------
// The setter stores the argument, then the function with release; the tick
// service loads the function with acquire, then the argument. A pass that
// finds the new function finds its argument (or a later one) and whatever
// the setter wrote before setting them.

template <class A, class FnWord, class ArgWord, class Fn>
QUELTA_HANDOFF void PublishCallback(FnWord& fnWord, ArgWord& argWord, Fn fn, void* arg) {
    A::Store(argWord, arg, A::kRelaxed);
    A::Store(fnWord, fn, A::kRelease);
}

// The function (null: none) and, with one, its argument in `arg`.
template <class A, class FnWord, class ArgWord>
QUELTA_HANDOFF auto TakeCallback(const FnWord& fnWord, const ArgWord& argWord, void*& arg) {
    const auto fn = A::Load(fnWord, A::kAcquire);
    arg = fn != nullptr ? A::Load(argWord, A::kRelaxed) : nullptr;
    return fn;
}

// --- the tick callback (gTickCallback) ------------------------------------------
// One word: whatever the registering thread wrote before registering is seen
// by the tick that calls the function.

template <class A, class W, class Fn>
QUELTA_HANDOFF void PublishTickCallback(W& word, Fn fn) {
    A::Store(word, fn, A::kRelease);
}

template <class A, class W>
QUELTA_HANDOFF auto TakeTickCallback(const W& word) {
    return A::Load(word, A::kAcquire);
}

// --- lateness samples (statsCount and the jitter samples) -------------------------
// The tick service writes a sample, then counts it (release); Calibrate loads
// the count (acquire), then reads the samples it counts.

// Records `value` as the next of `size` samples; false when they are full
// (or the count is negative).
template <class A, class Sample, class Count>
QUELTA_HANDOFF bool RecordSample(Sample* samples, uint32_t size, Count& count, uint32_t value) {
    const int32_t n = A::Load(count, A::kRelaxed);
    if (n < 0 || n >= static_cast<int32_t>(size)) return false;
    A::Store(samples[n], value, A::kRelaxed);
    A::Store(count, n + 1, A::kRelease);
    return true;
}

template <class A, class Count>
int32_t SamplesCounted(const Count& count) {
    return A::Load(count, A::kAcquire);
}

// --- callers inside the library and the stop (gCallersInside, gStopping) --------
// Each side writes its own word and then reads the other's: a caller counts
// itself in, then looks for the stop; the stop sets its flag, then counts the
// callers. Only sequentially consistent orders keep both from reading the
// other's old value (acquire and release allow it): so either the caller sees
// the stop and turns back, or the stop sees the caller and waits for it to
// leave. The leaving decrement, seen by the stop's count, orders everything
// the caller did inside before whatever the stop destroys.

template <class A, class Count, class Flag>
QUELTA_HANDOFF bool EnterUnlessStopping(Count& inside, const Flag& stopping) {
    A::FetchAdd(inside, 1, A::kSeqCst);
    if (!A::Load(stopping, A::kSeqCst)) return true;
    A::FetchAdd(inside, -1, A::kSeqCst);
    return false;
}

template <class A, class Count>
QUELTA_HANDOFF void LeaveInside(Count& inside) {
    A::FetchAdd(inside, -1, A::kSeqCst);
}

template <class A, class Flag>
QUELTA_HANDOFF void BeginStop(Flag& stopping) {
    A::Store(stopping, true, A::kSeqCst);
}

template <class A, class Flag>
QUELTA_HANDOFF bool StopBegun(const Flag& stopping) {
    return A::Load(stopping, A::kSeqCst);
}

template <class A, class Count>
QUELTA_HANDOFF bool NobodyInside(const Count& inside) {
    return A::Load(inside, A::kSeqCst) <= 0;
}

// --- what start-up builds (gEngine, gTimer, gLogEngine; gEventSystemReady) ------
// Built, then published (release): a pointer to a long-lived object, or a
// ready flag over what start-up set up. Whoever finds it (acquire) finds the
// object whole, its virtual table included, or the set-up done. The timer
// thread needs it most: it starts before the engine it uses is built.
// Withdrawing (acq_rel) hands the object to the stop, which destroys it.

template <class A, class W, class T>
QUELTA_HANDOFF void Publish(W& word, T value) {
    A::Store(word, value, A::kRelease);
}

template <class A, class W>
QUELTA_HANDOFF auto Published(const W& word) {
    return A::Load(word, A::kAcquire);
}

template <class A, class W>
QUELTA_HANDOFF auto Withdraw(W& word) {
    return A::Exchange(word, nullptr, A::kAcqRel);
}

}  // namespace quelta

#endif
