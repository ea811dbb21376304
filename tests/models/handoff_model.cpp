// The library's lock-free hand-offs (engine/HandOff.h, log/LogHandOff.h, the
// wake word of tLinux/PalWake.h) run over RlAtomics; what a hand-off carries
// is a plain rl::var, so a missing edge shows as a data race or a stale value.
#include <errno.h>
#include <time.h>

#include "engine/HandOff.h"
#include "log/LogHandOff.h"
#include "tLinux/PalWake.h"

#include "RelacyAtomics.h"

namespace {

using models::RlAtomics;


// The words hold functions in the library; Relacy's atomics take object pointers only.
struct Function {};
Function gCallback, gTickCallback;

// SetCallback against a tick service pass: a pass that finds the function
// finds its argument, and what the setter wrote there before.
struct CallbackPair : rl::test_suite<CallbackPair, 2> {
    rl::atomic<Function*> fn;
    rl::atomic<void*> arg;
    rl::var<int> state;

    void before() { fn.store(nullptr, rl::mo_relaxed, $), arg.store(nullptr, rl::mo_relaxed, $); }
    void thread(unsigned index) {
        void* taken = nullptr;
        if (index == 0) {
            state($) = 42;
            quelta::PublishCallback<RlAtomics>(fn, arg, &gCallback, &state);
        } else if (quelta::TakeCallback<RlAtomics>(fn, arg, taken) != nullptr) {
            RL_ASSERT(taken == &state);
            RL_ASSERT((*static_cast<rl::var<int>*>(taken))($) == 42);
        }
    }
};

// RegisterTickCallback against a tick: the tick that calls the function sees
// what the registering thread wrote before.
struct TickCallbackRegistered : rl::test_suite<TickCallbackRegistered, 2> {
    rl::atomic<Function*> word;
    rl::var<int> state;

    void before() { word.store(nullptr, rl::mo_relaxed, $); }
    void thread(unsigned index) {
        if (index == 0) {
            state($) = 7;
            quelta::PublishTickCallback<RlAtomics>(word, &gTickCallback);
        } else if (quelta::TakeTickCallback<RlAtomics>(word) != nullptr) {
            RL_ASSERT(state($) == 7);
        }
    }
};

// The lateness samples against Calibrate: every sample the count covers is
// the one recorded, never the zero it was reset to.
struct SamplesCounted : rl::test_suite<SamplesCounted, 2> {
    static constexpr uint32_t kSize = 2;
    rl::atomic<uint32_t> samples[kSize];
    rl::atomic<int32_t> count;

    void before() {
        for (auto& s : samples) s.store(0, rl::mo_relaxed, $);
        count.store(0, rl::mo_relaxed, $);
    }
    void thread(unsigned index) {
        if (index == 0) {
            for (uint32_t v = 5; v < 5 + kSize; ++v) quelta::RecordSample<RlAtomics>(samples, kSize, count, v);
            return;
        }
        const int32_t n = quelta::SamplesCounted<RlAtomics>(count);
        for (int32_t i = 0; i < n; ++i) RL_ASSERT(samples[i].load(rl::mo_relaxed, $) == 5u + i);
    }
};

// A caller entering node-using code against the stop: the caller turns back,
// or the stop waits for it; the stop never destroys what a caller still uses.
struct CallersAndStop : rl::test_suite<CallersAndStop, 2> {
    rl::atomic<int32_t> inside;
    rl::atomic<bool> stopping;
    rl::var<int> engine;  // 1 alive, 0 destroyed

    void before() { inside.store(0, rl::mo_relaxed, $), stopping.store(false, rl::mo_relaxed, $), engine($) = 1; }
    void thread(unsigned index) {
        if (index == 0 && quelta::EnterUnlessStopping<RlAtomics>(inside, stopping)) {
            RL_ASSERT(engine($) == 1);
            quelta::LeaveInside<RlAtomics>(inside);
        } else if (index == 1) {
            quelta::BeginStop<RlAtomics>(stopping);
            if (quelta::NobodyInside<RlAtomics>(inside)) engine($) = 0;
        }
    }
};

// A long-lived object built on one thread and published: the timer thread,
// started before it was built, borrows it whole; or the stop withdraws it and
// may destroy it.
template <bool kWithdraw>
struct ObjectPublished : rl::test_suite<ObjectPublished<kWithdraw>, 2> {
    struct Object { rl::var<int> field; } object;  // the field: the object's words and virtual table
    rl::atomic<Object*> word;

    void before() { word.store(nullptr, rl::mo_relaxed, $); }
    void thread(unsigned index) {
        if (index == 0) {
            object.field($) = 1;
            quelta::Publish<RlAtomics>(word, &object);
        } else if (Object* o = kWithdraw ? quelta::Withdraw<RlAtomics>(word) : quelta::Published<RlAtomics>(word)) {
            if (kWithdraw) o->field($) = 0;  // destroyed
            else RL_ASSERT(o->field($) == 1);
        }
    }
};


using Entry = quelta::BasicLogEntry<RlAtomics>;
using Record = quelta::BasicLogCpuRecord<RlAtomics>;
constexpr uint32_t kRingSlots = 2;

// A record as the engine's constructor leaves it (every word written), with
// room for a heap ring of its own: a header, then its entries.
struct Log {
    Record record;
    alignas(quelta::BasicLogRingHeader<RlAtomics>) unsigned char
        block[sizeof(quelta::BasicLogRingHeader<RlAtomics>) + kRingSlots * sizeof(Entry)];
    Entry* ring = nullptr;

    void Init() {
        for (auto* w : {&record.capacity, &record.writeIndex, &record.wrapCount, &record.readPos, &record.readRemaining})
            w->store(0, rl::mo_relaxed, $);
        record.entries.store(nullptr, rl::mo_relaxed, $);
        quelta::ClearEntries(record.inlineEntries, quelta::kLogInlineSlots);
    }
    Entry* Build() { return quelta::BuildRing<RlAtomics>(block, kRingSlots); }
    void Destroy() {
        for (uint32_t i = 0; i < kRingSlots; ++i) ring[i].~Entry();
        quelta::RingHeaderOf(ring)->~BasicLogRingHeader();
    }
    // Every word of entry t is derived from t, so a torn entry shows.
    void Put(uint32_t t) { quelta::RecordEntry(record, t, t + 1, t * 7, t * 13); }
};
bool IsWhole(const quelta::LogEntryWords& w) { return w.high == w.low + 1 && w.event == w.low * 7 && w.data == w.low * 13; }

// A bank the last read-out emptied still holds whole entries of its earlier
// round (1 and 2). A recorder records 10 and 11 into the two-slot ring, then
// 12, which wraps onto slot 0, while a read-out reads: every entry it takes is
// of this round and whole.
struct EntriesPublished : rl::test_suite<EntriesPublished, 2> {
    Log log;

    void before() {
        log.Init();
        quelta::PublishRing(log.record, log.ring = log.Build(), kRingSlots);
        log.Put(1), log.Put(2);
        log.record.writeIndex.store(0, rl::mo_relaxed, $);  // emptied, as ReadOutMerged empties a bank
    }
    void thread(unsigned index) {
        if (index == 0) {
            for (uint32_t t = 10; t <= 12; ++t) log.Put(t);
            return;
        }
        const quelta::LogPublished published = quelta::LoadPublished(log.record);
        quelta::AfterPublishedLoads<RlAtomics>();
        for (quelta::LogCursor c = quelta::StartCursor(published, kRingSlots); c.remaining != 0; --c.remaining) {
            quelta::LogEntryWords words;
            if (quelta::ReadEntry(log.ring[c.pos], words)) RL_ASSERT(IsWhole(words) && words.low >= 10);
            c.pos = c.pos == 0 ? kRingSlots - 1 : c.pos - 1;
        }
    }
    void after() { log.Destroy(); }
};

// Configure replaces the inline ring by a heap ring it has just built while a
// recorder records: the recorder finds the new ring's bound through its
// pointer (never a header not yet written), and the new ring's clearing does
// not undo its entry.
struct RingPublished : rl::test_suite<RingPublished, 2> {
    Log log;

    void before() {
        log.Init();
        log.record.entries.store(log.record.inlineEntries, rl::mo_relaxed, $);
        log.record.capacity.store(quelta::kLogInlineCapacity, rl::mo_relaxed, $);
    }
    void thread(unsigned index) {
        if (index == 1) return log.Put(5);
        Entry* built = log.Build();
        quelta::PublishRing(log.record, built, kRingSlots);
        log.ring = built;
    }
    void after() {
        quelta::LogEntryWords inlined, heap;
        const bool inInline = quelta::ReadEntry(log.record.inlineEntries[0], inlined);
        const bool inHeap = quelta::ReadEntry(log.ring[0], heap);
        RL_ASSERT((inInline && inlined.low == 5) || (inHeap && heap.low == 5));
        log.Destroy();
    }
};


using Word = quelta::BasicWakeWord<RlAtomics>;

// The kernel's futex: comparing the word with the snapshot and going to sleep
// happen under the kernel's lock, which a wake takes as well.
struct Futex {
    rl::mutex lock;
    rl::condition_variable sleepers;
} * gFutex = nullptr;

struct ModelKernel {
    static int Wait(Word& word, uint32_t expected, const timespec&) {
        gFutex->lock.lock($);
        const bool same = word.sequence.load(rl::mo_relaxed, $) == expected;
        if (same) gFutex->sleepers.wait(gFutex->lock, $);
        gFutex->lock.unlock($);
        return same ? 0 : EAGAIN;
    }
    static bool Reached(const timespec&) { return false; }  // parked decades ahead: only a wake ends it
};

// The timer: its expiry under its lock, its wake word, its stop request. The
// stop flag is relaxed here, so that the model checks what the word carries
// (the timer's own flag is seq_cst besides, which Relacy would order more
// strictly than the language does).
struct Timer {
    Futex futex;
    rl::mutex expiryLock;
    rl::var<int> expiry;  // guarded by expiryLock; 1: armed
    Word word;
    rl::atomic<int> stop;

    void Init() { gFutex = &futex, expiry($) = 0, stop.store(0, rl::mo_relaxed, $); }
    void Notify() { futex.lock.lock($), futex.sleepers.notify_all($), futex.lock.unlock($); }
    // The timer thread as isrthread runs it: take the expiry and the word's
    // snapshot under the lock, look for the stop, sleep unless the word has
    // moved. Ends on an armed expiry or the stop.
    void Serve() {
        while (stop.load(rl::mo_relaxed, $) == 0) {
            expiryLock.lock($);
            const uint32_t snapshot = quelta::WakeSnapshot(word);
            const int taken = expiry($);
            expiry($) = 0;
            expiryLock.unlock($);
            if (stop.load(rl::mo_relaxed, $) != 0 || taken == 1) return;
            quelta::WakeableSleep<ModelKernel>(word, snapshot, timespec{0x7FFFFFFE, 0}, nullptr, nullptr);
        }
    }
    void Arm() {  // SetExpiry: the expiry and the word's move under the lock, the wake after it
        expiryLock.lock($);
        expiry($) = 1;
        quelta::WakeMove(word);
        expiryLock.unlock($);
        Notify();
    }
    void Stop() { stop.store(1, rl::mo_relaxed, $), quelta::WakeMove(word), Notify(); }  // the destructor
};

// An expiry set (or the stop requested, without the lock) while the thread
// takes or sleeps on the previous one is never lost: the thread comes to take
// it, else Relacy reports it asleep for good.
template <bool kStop>
struct WakeNotLost : rl::test_suite<WakeNotLost<kStop>, 2> {
    Timer timer;
    void before() { timer.Init(); }
    void thread(unsigned index) { index == 0 ? timer.Serve() : kStop ? timer.Stop() : timer.Arm(); }
};

const models::Case kCases[] = {
    {"callback and argument", &rl::simulate<CallbackPair>, 4},
    {"tick callback", &rl::simulate<TickCallbackRegistered>, 4},
    {"lateness samples and their count", &rl::simulate<SamplesCounted>, 4},
    {"callers and the stop", &rl::simulate<CallersAndStop>, 4},
    {"object published", &rl::simulate<ObjectPublished<false>>, 4},
    {"object withdrawn", &rl::simulate<ObjectPublished<true>>, 4},
    {"log entries published by the write index", &rl::simulate<EntriesPublished>, 3},
    {"log ring published to recorders", &rl::simulate<RingPublished>, 4},
    {"wake word: a new expiry is never lost", &rl::simulate<WakeNotLost<false>>, 6},
    {"wake word: the stop request is never lost", &rl::simulate<WakeNotLost<true>>, 6},
};

}  // namespace

int main(int argc, char** argv) { return models::RunModels(argc, argv, kCases, sizeof kCases / sizeof kCases[0]); }
