// The wake word (tLinux/PalWake.h) under the C++ memory model: the timer
// thread's take-and-sleep against a setter of its expiry and against its
// stop. The word's steps and the sleep loop are the library's own, over
// RlAtomics; the kernel's futex and the timer's loop around them are modelled
// here (the loop as tKPusLinuxNanoSleepTimer's isrthread runs it).
#include <errno.h>
#include <time.h>

#include "tLinux/PalWake.h"

#include "RelacyAtomics.h"

namespace {

using models::RlAtomics;
using Word = quelta::BasicWakeWord<RlAtomics>;

// The kernel's futex as the sleep sees it: comparing the word with the
// snapshot and going to sleep happen under the kernel's lock, which a wake
// takes as well.
struct Futex {
    rl::mutex lock;
    rl::condition_variable sleepers;

    void Notify() {
        lock.lock($);
        sleepers.notify_all($);
        lock.unlock($);
    }
};
Futex* gFutex = nullptr;

struct ModelKernel {
    static int Wait(Word& word, uint32_t expected, const timespec&) {
        gFutex->lock.lock($);
        const bool same = word.sequence.load(rl::mo_relaxed, $) == expected;
        if (same) gFutex->sleepers.wait(gFutex->lock, $);
        gFutex->lock.unlock($);
        return same ? 0 : EAGAIN;
    }
    // The thread sleeps parked, decades before its deadline: only a wake ends it.
    static bool Reached(const timespec&) { return false; }
};

constexpr int kParked = 0;
constexpr int kArmed = 1;

// The timer: its expiry under its lock, its wake word, its stop request.
// The stop flag's own order is relaxed here, so that the model checks what
// the word carries. (The timer's flag is sequentially consistent besides,
// which Relacy would order by its interleaving, more strictly than the
// language does.)
struct Timer {
    Futex futex;
    rl::mutex expiryLock;
    rl::var<int> expiry;  // guarded by expiryLock
    Word word;
    rl::atomic<int> stop;

    void Init() {
        gFutex = &futex;
        expiry($) = kParked;
        stop.store(0, rl::mo_relaxed, $);
    }

    // The timer thread: take the expiry and the word's snapshot under the
    // lock, look for the stop, sleep unless the word has moved since. Ends
    // when it has taken an armed expiry or found the stop.
    void Serve() {
        for (;;) {
            if (stop.load(rl::mo_relaxed, $) != 0) return;
            expiryLock.lock($);
            const uint32_t snapshot = quelta::WakeSnapshot(word);
            const int taken = expiry($);
            expiry($) = kParked;
            expiryLock.unlock($);
            if (stop.load(rl::mo_relaxed, $) != 0 || taken == kArmed) return;
            const timespec far{0x7FFFFFFE, 0};
            quelta::WakeableSleep<ModelKernel>(word, snapshot, far, nullptr, nullptr);
        }
    }

    // SetExpiry: the expiry and the word's move under the lock, the wake after it.
    void Arm() {
        expiryLock.lock($);
        expiry($) = kArmed;
        quelta::WakeMove(word);
        expiryLock.unlock($);
        futex.Notify();
    }

    // The destructor: the stop request, then PalWake (move, then wake).
    void Stop() {
        stop.store(1, rl::mo_relaxed, $);
        quelta::WakeMove(word);
        futex.Notify();
    }
};

// An expiry set while the thread takes, or sleeps on, the previous one is
// never lost: the thread always comes to take it (else Relacy reports the
// thread asleep for good, a deadlock).
struct ExpiryNotLost : rl::test_suite<ExpiryNotLost, 2> {
    Timer timer;
    void before() { timer.Init(); }
    void thread(unsigned index) { index == 0 ? timer.Serve() : timer.Arm(); }
};

// The stop request, made without the expiry lock, reaches a thread that
// takes or sleeps at that moment: seeing the word move, it sees the request.
struct StopNotLost : rl::test_suite<StopNotLost, 2> {
    Timer timer;
    void before() { timer.Init(); }
    void thread(unsigned index) { index == 0 ? timer.Serve() : timer.Stop(); }
};

const models::Case kCases[] = {
    {"wake word: a new expiry is never lost", &models::Simulate<ExpiryNotLost>, 6},
    {"wake word: the stop request is never lost", &models::Simulate<StopNotLost>, 6},
};

}  // namespace

int main(int argc, char** argv) { return models::RunModels(argc, argv, kCases, sizeof kCases / sizeof kCases[0]); }
