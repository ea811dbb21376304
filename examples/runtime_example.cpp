// How a real-time runtime uses libquelta.so.6.
//
//   runtime_example [library [cycles]]
//
// library: the file to load (default "libquelta.so.6", found like any shared
// library: through LD_LIBRARY_PATH, the program's run path, then the system's
// library directories; built in the project's build tree, the example's run
// path names the library built beside it); cycles: how many 2 ms cycles to
// run (default 750, 1.5 s).
//
// The program does what a runtime does, in the steps the README walks through:
//  1. load the library with dlopen (loading starts it: no init call);
//  2. resolve the exported functions by name;
//  3. borrow the timing engine and the log engine from the two accessors and
//     call them through their interface classes (by virtual slot);
//  4. make its own thread SCHED_FIFO, below the library's timer thread;
//  5. create a semaphore with its own platform layer;
//  6. have the library call back at a time on the global clock; the
//     callback posts that semaphore;
//  7. run a periodic loop: wait for the next 2 ms boundary, then wait up to
//     500 us for an event on the semaphore, logging every step;
//  8. read the log out, print it, check what the library promises (no wait
//     returns early, the callback fires), and unload the library.
//
// Exit status: 0 pass; 1 something returned early, failed or never fired;
// 2 the library could not be loaded; 77 skipped (no real-time privilege).
#include <dlfcn.h>
#include <link.h>
#include <pthread.h>
#include <sched.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <atomic>
#include <vector>

#include <quelta/quelta.h>

#include <quelta/RuntimeSemaphore.h>

namespace runtime = quelta_runtime;

namespace {

constexpr uint32_t kPeriodClocks = 2000000;    // 2 ms; a clock is a nanosecond
constexpr uint32_t kEventTimeoutUs = 500;      // the event wait's timeout
constexpr uint64_t kUnixEpochOnGlobal = 2082844800ull;  // 1904-01-01 -> 1970-01-01, s

// Log event words: the kind in bits 0-7, the cycle in bits 16-31. On
// read-out the library puts the CPU index into bits 8-15.
enum EventKind : uint32_t {
    kWake = 1,      // the periodic wait returned
    kTimedOut = 2,  // the event wait timed out
    kSignalled = 3, // the event wait took a post
    kCallback = 4,  // the library's callback ran (on the timer thread)
};

uint32_t EventWord(EventKind kind, uint32_t cycle) { return (cycle << 16) | kind; }

uint64_t ToU64(const ClockTime& t) { return (static_cast<uint64_t>(t.high) << 32) | t.low; }

ClockTime FromU64(uint64_t v) {
    ClockTime t;
    t.low = static_cast<uint32_t>(v);
    t.high = static_cast<uint32_t>(v >> 32);
    return t;
}

// The exported functions this runtime uses, resolved by name. decltype on
// the header's declarations gives the exact types without linking them.
struct QueltaApi {
    decltype(&GetEngine__MERIDOX) GetEngine;
    decltype(&GetLogEngine__MERIDOX) GetLogEngine;
    decltype(&quelta_iTSC_WaitUntilNextMultipleClocks_C) WaitUntilNextMultipleClocks;
    decltype(&quelta_iTSCEvent_Wait_C) EventWait;
    decltype(&quelta_iTSC_SetCallback) SetCallback;
    decltype(&quelta_iTSC_SetCallbackTime) SetCallbackTime;
};

template <typename Fn>
bool Resolve(void* library, const char* name, Fn& fn) {
    fn = reinterpret_cast<Fn>(dlsym(library, name));
    if (fn == nullptr) fprintf(stderr, "runtime_example: %s not exported: %s\n", name, dlerror());
    return fn != nullptr;
}

// What the callback shares with the loop. The callback runs on the library's
// timer thread: it must be short and must not block.
struct CallbackState {
    iKPusTimingEngine* engine = nullptr;
    iKPLogEngine* log = nullptr;
    PalSemaphore* event = nullptr;
    std::atomic<uint32_t> fired{0};
    std::atomic<uint64_t> firedAt{0};  // global clock
};

void OnCallbackTime(void* arg) {
    CallbackState* state = static_cast<CallbackState*>(arg);
    ClockTime now;
    state->engine->ReadGlobal2(now);             // engine slot 2
    state->firedAt.store(ToU64(now), std::memory_order_relaxed);
    state->log->LogNow5(EventWord(kCallback, 0));  // log slot 5
    state->fired.store(1, std::memory_order_release);
    runtime::SemaphorePost(state->event);        // wakes the loop's event wait
}

// Makes the calling thread SCHED_FIFO at a priority below the library's
// timer thread (which runs at the top priority and must be able to preempt
// the runtime to serve expiries). A real runtime would also lock its memory.
bool MakeRealtime() {
    sched_param param{};
    param.sched_priority = sched_get_priority_max(SCHED_FIFO) - 19;
    const int rc = pthread_setschedparam(pthread_self(), SCHED_FIFO, &param);
    if (rc != 0) {
        printf("SCHED_FIFO not permitted (%s): going on at normal priority\n", strerror(rc));
        return false;
    }
    printf("running SCHED_FIFO at priority %d\n", param.sched_priority);
    return true;
}

void PrintEntry(uint32_t timeLow, uint32_t timeHigh, uint32_t event, uint64_t first) {
    static const char* const kNames[] = {"?", "periodic wake", "event wait timed out",
                                         "event wait signalled", "callback (timer thread)"};
    const uint32_t kind = event & 0xFFu;
    const uint32_t cpu = (event >> 8) & 0xFFu;
    const uint32_t cycle = event >> 16;
    const uint64_t t = ToU64(ClockTime{timeLow, timeHigh}) - first;
    printf("  %+12.3f us  cpu %u  cycle %5u  %s\n", static_cast<double>(t) / 1e3, cpu,
           cycle, kNames[kind < 5 ? kind : 0]);
}

}  // namespace

int main(int argc, char** argv) {
    const char* path = argc > 1 ? argv[1] : "libquelta.so.6";
    const uint32_t cycles = argc > 2 ? static_cast<uint32_t>(strtoul(argv[2], nullptr, 10)) : 750;
    if (cycles == 0 || cycles > 1000000) {
        fprintf(stderr, "usage: runtime_example [library [cycles 1..1000000]]\n");
        return 2;
    }
    setvbuf(stdout, nullptr, _IOLBF, 0);

    // 1. Load: the library starts itself (timer thread, 1 ms tick, log).
    void* library = dlopen(path, RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
        fprintf(stderr, "runtime_example: cannot load %s: %s\n", path, dlerror());
        return 2;
    }
    // 2. Resolve the exports by name.
    QueltaApi q{};
    bool ok = Resolve(library, "GetEngine__MERIDOX", q.GetEngine) &&
              Resolve(library, "GetLogEngine__MERIDOX", q.GetLogEngine) &&
              Resolve(library, "quelta_iTSC_WaitUntilNextMultipleClocks_C",
                      q.WaitUntilNextMultipleClocks) &&
              Resolve(library, "quelta_iTSCEvent_Wait_C", q.EventWait) &&
              Resolve(library, "quelta_iTSC_SetCallback", q.SetCallback) &&
              Resolve(library, "quelta_iTSC_SetCallbackTime", q.SetCallbackTime);
    if (!ok) return 2;
    // Which file the search found: a runtime should say, since a stale copy
    // elsewhere on the search path would be loaded just as silently.
    struct link_map* loaded = nullptr;
    const char* file = dlinfo(library, RTLD_DI_LINKMAP, &loaded) == 0 && loaded != nullptr
                           ? loaded->l_name : "?";
    printf("loaded %s from %s\n", path, file);

    // 3. The two long-lived objects; the library owns them, we borrow them.
    iKPusTimingEngine* engine = q.GetEngine();
    iKPLogEngine* log = q.GetLogEngine();
    if (engine == nullptr || log == nullptr) {
        fprintf(stderr, "runtime_example: the library did not start\n");
        return 2;
    }

    // 4. The runtime's thread becomes real-time. Without the privilege the
    // library's own timer thread could not either: plain waits still work,
    // but the tick service's waits answer "no timer" at once.
    const bool realtime = MakeRealtime();

    // 5. The runtime's own semaphore, made by its own platform layer.
    PalSemaphore event;
    if (runtime::SemaphoreInit(&event) != 0) {
        fprintf(stderr, "runtime_example: cannot create a semaphore\n");
        return 1;
    }

    // 6. A callback at a time on the global clock, a third into the run.
    CallbackState callback;
    callback.engine = engine;
    callback.log = log;
    callback.event = &event;
    ClockTime globalNow;
    engine->ReadGlobal2(globalNow);  // engine slot 2: global clock, ns since 1904
    const uint64_t callbackOffset = static_cast<uint64_t>(cycles) * kPeriodClocks / 3 + 1000000;
    const ClockTime callbackTime = FromU64(ToU64(globalNow) + callbackOffset);
    q.SetCallback(&OnCallbackTime, &callback);
    if (q.SetCallbackTime(&callbackTime, -1) == 0) {  // -1: a global-clock time
        printf("callback time not stored: the library has no timer\n");
    }

    log->SetEnabled(1);  // log slot 11: recording on

    // 7. The periodic loop.
    int64_t maxPeriodicLate = 0, maxEventLate = 0;
    uint32_t early = 0, timedOut = 0, signalled = 0, noTimer = 0, failed = 0;
    for (uint32_t cycle = 0; cycle < cycles; ++cycle) {
        // The deadline the library will pick: the next multiple of the period.
        ClockTime before;
        engine->ReadMonotonic0(before);  // engine slot 0: CLOCK_MONOTONIC, ns
        const uint64_t deadline = (ToU64(before) / kPeriodClocks + 1) * kPeriodClocks;
        // A plain wait: it sleeps on this thread and returns the low word of
        // the monotonic time after it. 32-bit differences are exact while
        // both lie within 4.29 s of each other.
        const uint32_t woke = q.WaitUntilNextMultipleClocks(kPeriodClocks);
        const int32_t late = static_cast<int32_t>(woke - static_cast<uint32_t>(deadline));
        log->LogNow5(EventWord(kWake, cycle));
        if (late < 0) ++early;
        if (late > maxPeriodicLate) maxPeriodicLate = late;

        // A tick-service wait: an event on our semaphore, or the timeout.
        ClockTime start, end;
        engine->ReadMonotonic0(start);
        const uint32_t r = q.EventWait(&event, kEventTimeoutUs);
        engine->ReadMonotonic0(end);
        const int64_t waited = static_cast<int64_t>(ToU64(end) - ToU64(start));
        const int64_t eventLate = waited - static_cast<int64_t>(kEventTimeoutUs) * 1000;
        if (r == 1 && eventLate < 0) {
            // Returned before its timeout: allowed only as the "no timer"
            // answer of a library whose timer thread lacks SCHED_FIFO.
            if (realtime) ++early; else ++noTimer;
        } else if (r == 1) {
            ++timedOut;
            if (eventLate > maxEventLate) maxEventLate = eventLate;
        } else if (r == 0) {
            ++signalled;
        } else {
            ++failed;  // 2: the semaphore wait failed; 3: the event system is down
        }
        log->LogNow5(EventWord(r == 0 ? kSignalled : kTimedOut, cycle));
    }

    // A slow machine may not have reached the callback time yet: give it a
    // second more. The timer thread serves it whatever this thread does.
    for (int i = 0; i < 100 && realtime && callback.fired.load(std::memory_order_acquire) == 0; ++i) {
        struct timespec tenMs = {0, 10000000};
        nanosleep(&tenMs, nullptr);
    }
    log->SetEnabled(0);  // recording off
    // Cancel what is left before handing the semaphore back: a NeverTime
    // callback time removes the pending one; fn 0 removes the callback.
    const ClockTime never = {QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};
    q.SetCallbackTime(&never, -1);
    q.SetCallback(nullptr, nullptr);

    // 8. Read the log out (log slot 23): the newest entries of all CPUs,
    // merged in time order, oldest first.
    uint32_t count = 2 * cycles + 16;
    std::vector<uint32_t> timeLow(count), timeHigh(count), events(count), data(count);
    log->ReadOutMerged(count, timeLow.data(), timeHigh.data(), events.data(), data.data(), 0);
    if (count > 0) {
        const uint64_t first = ToU64(ClockTime{timeLow[0], timeHigh[0]});
        const time_t unixSeconds = static_cast<time_t>(first / 1000000000u - kUnixEpochOnGlobal);
        struct tm utc;
        char when[32] = "?";
        if (gmtime_r(&unixSeconds, &utc) != nullptr) strftime(when, sizeof when, "%Y-%m-%d %H:%M:%S", &utc);
        printf("log: %u entries, the first at %s UTC on the global clock; times relative to it:\n",
               count, when);
        const uint32_t head = 4, tail = 8;
        for (uint32_t i = 0; i < count; ++i) {
            const bool isCallback = (events[i] & 0xFFu) == kCallback;
            if (i < head || i + tail >= count || isCallback) {
                PrintEntry(timeLow[i], timeHigh[i], events[i], first);
            } else if (i == head) {
                printf("  ...\n");
            }
        }
    } else {
        printf("log: empty\n");
    }

    const bool fired = callback.fired.load(std::memory_order_acquire) != 0;
    int64_t callbackLate = 0;
    if (fired) {
        callbackLate = static_cast<int64_t>(callback.firedAt.load() - ToU64(callbackTime));
        if (callbackLate < 0) ++early;
    }
    printf("event waits: %u timed out (max lateness %lld us), %u signalled by the callback",
           timedOut, static_cast<long long>(maxEventLate / 1000), signalled);
    if (noTimer) printf(", %u answered 'no timer' at once", noTimer);
    if (failed) printf(", %u failed", failed);
    printf("\n");
    if (fired) {
        printf("callback: fired %lld us after its global-clock time\n",
               static_cast<long long>(callbackLate / 1000));
    }

    int status = 0;
    const char* verdict = "PASS";
    if (!realtime && early == 0 && failed == 0) {
        status = 77;
        verdict = "SKIPPED: no real-time privilege";
    } else if (early != 0 || failed != 0 || !fired) {
        status = 1;
        verdict = "FAIL";
    }
    printf("summary: %u cycles of %u us, max lateness %lld us, early returns %u, "
           "callback fired %s -> %s\n",
           cycles, kPeriodClocks / 1000, static_cast<long long>(maxPeriodicLate / 1000), early,
           fired ? "yes" : "no", verdict);

    // Unloading stops the library (its timer thread is joined); only then
    // may the semaphore that its waits used go away.
    dlclose(library);
    runtime::SemaphoreDestroy(&event);
    return status;
}
