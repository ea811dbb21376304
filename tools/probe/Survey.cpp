#include "probe/Survey.h"

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <sched.h>
#include <sys/mman.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <iterator>
#include <random>

#include "RuntimeSemaphore.h"
#include "TickGrid.h"
#include "probe/Costs.h"
#include "probe/SpscRing.h"

namespace qprobe {

namespace {

constexpr int64_t kNsPerMs = 1000000;
constexpr int64_t kMinDelayNs = 200000;      // deadlines 0.2 ms ...
constexpr int64_t kDelaySpreadNs = 1000000;  // ... to 1.2 ms ahead
constexpr int kWarmUpRounds = 20;
constexpr uint64_t kTickPeriodNs = 1000000;
constexpr int32_t kCallbackTimeoutMs = 250;
// Ticks are turned into lateness a minute at a time: the grid's phase is
// placed per chunk, and a day's ticks never sit in memory.
constexpr std::size_t kTickChunk = 60000;
constexpr std::size_t kRingSize = std::size_t{1} << 17;  // over 100 s of samples or ticks

const uint32_t kSampledSeries[] = {kBaseline, kEventOwnSem, kPlainWait, kEventTimeout, kGlobalWait,
                                   kCallbackTime};
const uint32_t kPlainSeries[] = {kBaseline, kPlainWait};

// Time this thread has spent runnable but not running, in ns (the kernel's
// run delay), or -1 when the kernel does not keep it.
int64_t RunDelayNs(int fd) {
    if (fd < 0) return -1;
    char buf[96];
    const ssize_t n = pread(fd, buf, sizeof buf - 1, 0);
    if (n <= 0) return -1;
    buf[n] = '\0';
    unsigned long long onCpu = 0, waiting = 0;
    if (std::sscanf(buf, "%llu %llu", &onCpu, &waiting) != 2) return -1;
    return static_cast<int64_t>(waiting);
}

uint64_t U64(const ClockTime& t) { return (static_cast<uint64_t>(t.high) << 32) | t.low; }
ClockTime CT(uint64_t v) { return ClockTime{static_cast<uint32_t>(v), static_cast<uint32_t>(v >> 32)}; }

// A lateness for a log entry's data word: ns, two's complement, saturated.
uint32_t DataNs(int64_t ns) { return static_cast<uint32_t>(static_cast<int32_t>(std::clamp<int64_t>(ns, INT32_MIN, INT32_MAX))); }

// Recording with a data word, stamped now on the log's own clock.
void LogWithData(iKPusTimingEngine* engine, iKPLogEngine* log, uint32_t word, uint32_t data) {
    ClockTime now;
    engine->ReadGlobal2(now);
    log->LogAtWithData(now, data, word);
}

struct RingSample {
    int64_t atNs = 0;       // deadline, since the survey started
    int64_t latenessNs = 0;
    uint32_t series = 0;
};

// State the library's timer thread writes from the tick callback. The
// callback is a plain function, so it is reached through this pointer; one
// survey runs at a time. Set before the callback is registered, cleared
// after it is unregistered and any running call has finished.
struct TickFeed {
    SpscRing<uint64_t> ring{kRingSize};  // tick times, CLOCK_MONOTONIC ns
    iKPLogEngine* log = nullptr;
};
std::atomic<TickFeed*> gTicks{nullptr};

void OnTick(uint64_t /*serial*/) {
    const uint64_t t = static_cast<uint64_t>(MonoNs());
    TickFeed* s = gTicks.load(std::memory_order_acquire);
    if (s == nullptr) return;
    s->ring.Push(t);
    s->log->LogNow5(EventWord(kTick, kKindWake));
}

// The callback-time series: the survey thread sets `intended` before each
// SetCallbackTime, the callback (on the timer thread) stores when it ran and
// posts the semaphore, after which the survey thread reads `firedAt`.
struct CallbackState {
    std::atomic<int64_t> firedAt{0};
    std::atomic<int64_t> intended{0};
    PalSemaphore* semaphore = nullptr;
    iKPusTimingEngine* engine = nullptr;
    iKPLogEngine* log = nullptr;
};

void OnCallbackTime(void* arg) {
    const int64_t t = MonoNs();
    auto* s = static_cast<CallbackState*>(arg);
    s->firedAt.store(t, std::memory_order_release);
    LogWithData(s->engine, s->log, EventWord(kCallbackTime, kKindWake),
                DataNs(t - s->intended.load(std::memory_order_acquire)));
    qtools::RuntimeSemaphorePost(s->semaphore);
}

// The library's timer thread's scheduling policy and priority, or false
// when it cannot be seen.
bool TimerThreadPolicy(pid_t tid, int& policy, int& priority) {
    if (tid < 0) return false;
    sched_param p{};
    policy = sched_getscheduler(tid);
    priority = sched_getparam(tid, &p) == 0 ? p.sched_priority : 0;
    return policy >= 0;
}

}  // namespace

struct Worker {
    const LoadedQuelta* lib = nullptr;
    SurveyConfig config;
    SurveyResult* result = nullptr;

    // Shared with the main thread: stop is written by it; the progress
    // words by the worker; all relaxed (no data hangs on them).
    std::atomic<bool> stop{false};
    std::atomic<int> phase{0};  // 0 preparing, 1 surveying, 2 costs, 3 done
    std::atomic<int64_t> surveyStartNs{0};
    std::atomic<int64_t> surveyEndNs{0};
    std::atomic<uint64_t> samples{0};
    SpscRing<RingSample> ring{kRingSize};
    TickFeed ticks;
    pid_t timerTid = -1;  // set before the worker starts

    // The worker's own, read by others only after the join.
    std::vector<SeriesStats> stats = std::vector<SeriesStats>(kSeriesCount);
    iKPusTimingEngine* engine = nullptr;
    iKPLogEngine* log = nullptr;
    PalSemaphore* timeoutSemaphore = nullptr;
    CallbackState callback;
    std::mt19937_64 rng;
    std::size_t strayPosts = 0;
    int schedstatFd = -1;  // this thread's /proc schedstat, for its run delay
    uint32_t unexpectedResult[kSeriesCount] = {};

    // One sample; false when the call did not work as documented.
    bool Sample(uint32_t id, int64_t delayNs, int64_t& intendedNs, int64_t& latenessNs);
    bool TimerServes();
    void Run();
};

bool Worker::Sample(uint32_t id, int64_t delayNs, int64_t& intended, int64_t& latenessNs) {
    const QueltaEntries& fn = lib->fn();
    const uint32_t waitWord = EventWord(id, kKindWait);
    const uint32_t wakeWord = EventWord(id, kKindWake);
    const uint32_t delayData = static_cast<uint32_t>(delayNs);
    int64_t woke = 0;
    switch (id) {
        case kBaseline: {
            intended = MonoNs() + delayNs;
            timespec ts{static_cast<time_t>(intended / 1000000000LL), static_cast<long>(intended % 1000000000LL)};
            LogWithData(engine, log, waitWord, delayData);
            while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr) == EINTR) {
            }
            woke = MonoNs();
            break;
        }
        case kPlainWait: {
            intended = MonoNs() + delayNs;
            const ClockTime target = CT(static_cast<uint64_t>(intended));
            LogWithData(engine, log, waitWord, delayData);
            fn.waitUntilClocks64(&target);
            woke = MonoNs();
            break;
        }
        case kEventOwnSem: {
            intended = MonoNs() + delayNs;
            const ClockTime deadline = CT(static_cast<uint64_t>(intended));
            LogWithData(engine, log, waitWord, delayData);
            const uint32_t r = fn.eventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr);
            woke = MonoNs();
            if (r != 0) {
                unexpectedResult[id] = r;
                return false;
            }
            break;
        }
        case kEventTimeout: {
            const uint32_t timeoutUs = static_cast<uint32_t>(delayNs / 1000);
            intended = MonoNs() + static_cast<int64_t>(timeoutUs) * 1000;
            LogWithData(engine, log, waitWord, timeoutUs * 1000u);
            const uint32_t r = fn.eventWait(timeoutSemaphore, timeoutUs);
            woke = MonoNs();
            // The timeout's own post must have been taken by the wait.
            if (qtools::RuntimeSemaphorePending(timeoutSemaphore) != 0) {
                ++strayPosts;
                while (qtools::RuntimeSemaphoreWait(timeoutSemaphore, 0) == 0) {
                }
            }
            if (r != 1) {
                unexpectedResult[id] = r;
                return false;
            }
            break;
        }
        case kGlobalWait: {
            // Measured on the global clock, which the wait follows; the
            // deadline is placed on the monotonic one for the CSV.
            intended = MonoNs() + delayNs;
            ClockTime now;
            engine->ReadGlobal2(now);
            const uint64_t target = U64(now) + static_cast<uint64_t>(delayNs);
            const ClockTime t = CT(target);
            ClockTime after{0, 0};
            log->LogAtWithData(now, delayData, waitWord);
            fn.waitUntilGlobalClocks64(&t, nullptr, &after, 0);
            ClockTime fresh;
            engine->ReadGlobal2(fresh);
            latenessNs = static_cast<int64_t>(U64(fresh) - target);
            log->LogAtWithData(fresh, DataNs(latenessNs), wakeWord);
            return true;
        }
        case kCallbackTime: {
            callback.firedAt.store(0, std::memory_order_relaxed);
            intended = MonoNs() + delayNs;
            callback.intended.store(intended, std::memory_order_release);
            const ClockTime when = CT(static_cast<uint64_t>(intended));
            LogWithData(engine, log, waitWord, delayData);
            const uint32_t r = fn.setCallbackTime(&when, 0);
            if (r != 1) {
                unexpectedResult[id] = r == 0 ? 100 : r;
                return false;
            }
            if (qtools::RuntimeSemaphoreWait(callback.semaphore, kCallbackTimeoutMs) != 0) {
                // Never ran: cancel, let a late one pass, and drop its post.
                const ClockTime never{QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};
                fn.setCallbackTime(&never, 0);
                timespec pause{0, 5 * kNsPerMs};
                nanosleep(&pause, nullptr);
                while (qtools::RuntimeSemaphoreWait(callback.semaphore, 0) == 0) {
                }
                unexpectedResult[id] = 101;
                return false;
            }
            woke = callback.firedAt.load(std::memory_order_acquire);
            if (woke == 0) return false;
            latenessNs = woke - intended;
            return true;  // the callback logged its own wake-up
        }
        default:
            return false;
    }
    latenessNs = woke - intended;
    LogWithData(engine, log, wakeWord, DataNs(latenessNs));
    return true;
}

// Whether the library's timer serves: a wait node 2 ms ahead is either
// queued (and then waited for) or refused at once with "no timer" (1), which
// is what a library without real-time privilege answers.
bool Worker::TimerServes() {
    const ClockTime deadline = CT(static_cast<uint64_t>(MonoNs() + 2 * kNsPerMs));
    return lib->fn().eventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr) != 1;
}

void Worker::Run() {
    engine = lib->engine();
    log = lib->log();
    const QueltaEntries& fn = lib->fn();
    SurveyResult& out = *result;
    for (uint32_t id = 0; id < kSeriesCount; ++id) stats[id].id = id;
    out.tickService = engine->UsesTickService() != 0;
    if (!out.tickService) {
        out.notes.push_back("the library's waits are not served by its tick service (UsesTickService is 0): "
                            "event waits cannot be served and no tick runs");
    }
    out.timerRunning = TimerServes();
    if (!out.timerRunning) {
        for (uint32_t id : {kTick, kEventOwnSem, kEventTimeout, kGlobalWait, kCallbackTime}) {
            stats[id].measured = false;
            stats[id].notMeasured = "needs real-time privilege";
        }
        out.notes.push_back("tick, event-own-sem, event-timeout, global-wait and callback-time were not "
                            "measured: without real-time privilege (root, CAP_SYS_NICE or ulimit -r 99) the "
                            "library's timer thread cannot run, and the library answers these waits with "
                            "\"no timer\" at once, as documented");
    }

    // The log keeps the whole survey if it can: every CPU's ring large enough.
    const long cpus = std::max(1L, sysconf(_SC_NPROCESSORS_ONLN));
    const int64_t byDuration = config.durationS == 0 ? 100000 : config.durationS * 10000LL;
    const int32_t wanted = static_cast<int32_t>(std::clamp<int64_t>(byDuration, 20000, 100000));
    const uint32_t capacity = log->Configure(wanted);
    if (capacity != static_cast<uint32_t>(wanted)) {
        out.notes.push_back("the log engine could not allocate its rings (Configure gave " +
                            std::to_string(capacity) + " entries per CPU); the trace is short");
    }
    log->SetEnabled(0);

    std::vector<std::size_t> failed(kSeriesCount, 0);
    std::vector<std::size_t> overMs(kSeriesCount, 0), cpuHeld(kSeriesCount, 0);
    schedstatFd = open("/proc/thread-self/schedstat", O_RDONLY | O_CLOEXEC);
    if (out.realtime) {
        out.memoryLocked = mlockall(MCL_CURRENT | MCL_FUTURE) == 0;
        if (!out.memoryLocked) {
            out.notes.push_back(std::string("memory could not be locked (mlockall: ") + std::strerror(errno) +
                                "); page faults may add lateness");
        }
    }

    if (qtools::RuntimeSemaphoreCreate(&timeoutSemaphore) != 0 ||
        qtools::RuntimeSemaphoreCreate(&callback.semaphore) != 0) {
        out.notes.push_back("could not create the runtime's semaphores; event-timeout and callback-time skipped");
    }
    callback.engine = engine;
    callback.log = log;
    rng.seed(static_cast<uint64_t>(MonoNs()));
    auto delay = [this] { return kMinDelayNs + static_cast<int64_t>(rng() % kDelaySpreadNs); };

    std::vector<uint32_t> order;
    if (out.timerRunning) {
        order.assign(std::begin(kSampledSeries), std::end(kSampledSeries));
        fn.setCallback(&OnCallbackTime, &callback);
    } else {
        order.assign(std::begin(kPlainSeries), std::end(kPlainSeries));
    }
    // A series whose calls keep failing is dropped, so that one that fails
    // slowly (a callback that never comes) does not starve the others.
    constexpr std::size_t kGiveUpAfter = 3;
    std::vector<std::size_t> failedInARow(kSeriesCount, 0);
    auto usable = [&](uint32_t id) {
        if (id == kEventTimeout && timeoutSemaphore == nullptr) return false;
        if (id == kCallbackTime && callback.semaphore == nullptr) return false;
        return failedInARow[id] < kGiveUpAfter;
    };
    auto attempt = [&](uint32_t id, int64_t& intended, int64_t& latenessNs) {
        const bool ok = Sample(id, delay(), intended, latenessNs);
        failedInARow[id] = ok ? 0 : failedInARow[id] + 1;
        if (!ok) ++failed[id];
        if (failedInARow[id] == kGiveUpAfter) {
            out.notes.push_back(std::string(SeriesName(id)) + ": dropped from the survey after " +
                                std::to_string(kGiveUpAfter) + " failed calls in a row");
        }
        return ok;
    };

    // Warm-up: code and data paths in, nothing kept.
    for (int r = 0; r < kWarmUpRounds && !stop.load(std::memory_order_relaxed); ++r) {
        for (uint32_t id : order) {
            int64_t intended = 0, lateness = 0;
            if (usable(id)) attempt(id, intended, lateness);
        }
    }

    // The machine's stalls, measured beside the series (its figures are
    // allocated here, before the survey); on a spare CPU only by a real-time
    // thread (at normal priority it would measure the scheduler's sharing,
    // not the machine).
    MachineNoise noise(kSeriesCount, timerTid);
    if (config.noise == NoiseMode::SpareCpu && !out.realtime) {
        out.notes.push_back("machine stalls measured in windows on the survey's CPU: a spare CPU needs real-time "
                            "scheduling");
        noise.UseWindows();
    } else if (config.noise == NoiseMode::SpareCpu && !noise.StartSpare(config.noiseCpu, out.priority)) {
        out.notes.push_back("machine stalls measured in windows on the survey's CPU: no thread could be started on "
                            "CPU " + std::to_string(config.noiseCpu));
        noise.UseWindows();
    } else if (config.noise == NoiseMode::Windows) {
        noise.UseWindows();
    }

    // The survey.
    log->SetEnabled(1);
    log->LogNow5(EventWord(kSurveyItself, kKindStart));
    for (uint32_t id : order) log->LogNow5(EventWord(id, kKindStart));
    ticks.log = log;
    if (out.timerRunning) {
        log->LogNow5(EventWord(kTick, kKindStart));
        gTicks.store(&ticks, std::memory_order_release);
        engine->RegisterTickCallback(&OnTick);
    }

    const int64_t start = MonoNs();
    const int64_t end = config.durationS == 0 ? INT64_MAX : start + config.durationS * 1000 * kNsPerMs;
    surveyStartNs.store(start, std::memory_order_relaxed);
    phase.store(1, std::memory_order_relaxed);
    while (MonoNs() < end && !stop.load(std::memory_order_relaxed)) {
        std::shuffle(order.begin(), order.end(), rng);
        for (uint32_t id : order) {
            if (!usable(id) || stop.load(std::memory_order_relaxed)) continue;
            int64_t intended = 0, latenessNs = 0;
            const int64_t delayBefore = RunDelayNs(schedstatFd);
            noise.Begin(id);
            const bool ok = attempt(id, intended, latenessNs);
            noise.End();
            const int64_t delayAfter = RunDelayNs(schedstatFd);
            noise.Window(id);
            if (!ok) continue;
            const double lateness = static_cast<double>(latenessNs) / 1000.0;
            stats[id].histogram.Add(lateness);
            ring.Push(RingSample{intended - start, latenessNs, id});
            if (lateness > 1000.0) {
                ++overMs[id];
                // Kept off the CPU for at least half of the lateness.
                if (delayBefore >= 0 && delayAfter >= 0 &&
                    static_cast<double>(delayAfter - delayBefore) / 1000.0 >= lateness / 2) {
                    ++cpuHeld[id];
                }
            }
            samples.fetch_add(1, std::memory_order_relaxed);
        }
    }
    const int64_t stopped = MonoNs();
    out.noise = std::move(noise.Stop());
    surveyEndNs.store(stopped, std::memory_order_relaxed);
    out.surveyedS = static_cast<double>(stopped - start) / 1e9;
    out.interrupted = stop.load(std::memory_order_relaxed);

    for (uint32_t id = 0; id < kSeriesCount; ++id) log->LogNow5(EventWord(id, kKindEnd));
    log->LogNow5(EventWord(kSurveyItself, kKindEnd));
    if (out.timerRunning) {
        engine->UnregisterTickCallback(&OnTick);
        const ClockTime never{QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};
        fn.setCallbackTime(&never, 0);
        fn.setCallback(nullptr, nullptr);
        timespec settle{0, 5 * kNsPerMs};  // a callback already running finishes
        nanosleep(&settle, nullptr);
        gTicks.store(nullptr, std::memory_order_release);
    }
    log->SetEnabled(0);

    // The probe's log, for the trace.
    LogSnapshot& snap = out.log;
    const std::size_t room = static_cast<std::size_t>(cpus) * std::max<uint32_t>(capacity, 10);
    snap.timeLow.resize(room);
    snap.timeHigh.resize(room);
    snap.events.resize(room);
    snap.data.resize(room);
    uint32_t count = static_cast<uint32_t>(room);
    log->ReadOutMerged(count, snap.timeLow.data(), snap.timeHigh.data(), snap.events.data(), snap.data.data(), 0);
    snap.count = count;
    for (auto* v : {&snap.timeLow, &snap.timeHigh, &snap.events, &snap.data}) v->resize(count);

    for (uint32_t id = 0; id < kSeriesCount; ++id) {
        SeriesStats& s = stats[id];
        s.failed = failed[id];
        s.overMs = overMs[id];
        if (schedstatFd >= 0 && id != kTick) s.cpuHeld = static_cast<long>(cpuHeld[id]);
        if (unexpectedResult[id] != 0) {
            const uint32_t r = unexpectedResult[id];
            std::string what = r == 100   ? "returned 0 (no timer)"
                               : r == 101 ? "never called back within 250 ms"
                                          : "returned " + std::to_string(r);
            out.notes.push_back(std::string(SeriesName(id)) + ": " + std::to_string(failed[id]) +
                                " call(s) failed; the last " + what);
        }
    }
    std::size_t over = 0, held = 0;
    for (uint32_t id : kSampledSeries) {
        over += overMs[id];
        held += cpuHeld[id];
    }
    if (over > 0 && schedstatFd >= 0) {
        out.notes.push_back(std::to_string(over) + " wait(s) woke more than 1 ms late; in " + std::to_string(held) +
                            " of them the survey thread was runnable but kept off its CPU for at least half of "
                            "the lateness (other work on the machine, not the wait itself)");
    }
    if (schedstatFd >= 0) close(schedstatFd);
    if (strayPosts > 0) {
        out.notes.push_back("event-timeout: " + std::to_string(strayPosts) +
                            " wait(s) left a post on the semaphore (the timeout's post was not taken)");
    }

    // The costs take a second; a survey ended by a signal skips them.
    if (!out.interrupted) {
        phase.store(2, std::memory_order_relaxed);
        out.costs = MeasureCosts(*lib);
    } else {
        out.notes.push_back("call costs not measured: the survey was ended by a signal");
    }

    qtools::RuntimeSemaphoreDestroy(timeoutSemaphore);
    qtools::RuntimeSemaphoreDestroy(callback.semaphore);
    phase.store(3, std::memory_order_release);
}

namespace {

void* WorkerMain(void* arg) {
    static_cast<Worker*>(arg)->Run();
    return nullptr;
}

}  // namespace

const char* SeriesName(uint32_t id) {
    switch (id) {
        case kBaseline: return "baseline";
        case kPlainWait: return "plain-wait";
        case kTick: return "tick";
        case kEventOwnSem: return "event-own-sem";
        case kEventTimeout: return "event-timeout";
        case kGlobalWait: return "global-wait";
        case kCallbackTime: return "callback-time";
        case kSurveyItself: return "survey";
        default: return "unknown";
    }
}

const char* SeriesDescription(uint32_t id) {
    switch (id) {
        case kBaseline: return "clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME): the machine's own wake-up";
        case kPlainWait: return "quelta_iTSC_WaitUntilClocks64_C";
        case kTick: return "tick callback (engine slot 54) against the rebuilt 1 ms grid";
        case kEventOwnSem: return "quelta_iTSCEvent_Wait_Callback_C with its own semaphore";
        case kEventTimeout: return "quelta_iTSCEvent_Wait_C timing out on an unposted semaphore";
        case kGlobalWait: return "quelta_iTSC_WaitUntilGlobalClocks64_C, on the global clock";
        case kCallbackTime: return "quelta_iTSC_SetCallbackTime (monotonic): when the callback ran";
        default: return "";
    }
}

qtools::TraceDescribeFn ProbeEventDescriber(double lateUs) {
    return [lateUs](const qtools::TraceEntry& e) {
        const uint32_t word = e.event;
        const uint32_t series = word & 0xFFu;
        const uint32_t kind = (word >> 16) & 0xFFu;
        if ((word >> 24) != 0 || (series >= kSeriesCount && series != kSurveyItself) || kind < kKindStart ||
            kind > kKindCost) {
            return qtools::DescribeEventWord(e);
        }
        const std::string name = SeriesName(series);
        qtools::TraceEventInfo info;
        switch (kind) {
            case kKindStart:
            case kKindEnd:
                info.name = name + (kind == kKindStart ? " start" : " end");
                info.category = "series";
                break;
            case kKindWait:
                info.name = name;
                info.category = "wait";
                info.phase = qtools::TracePhase::Begin;
                info.spanKey = series;
                if (e.data != qtools::kLogNoData) {
                    info.args["deadline_us"] = std::round((e.tsUs + e.data / 1000.0) * 1000.0) / 1000.0;
                }
                break;
            case kKindWake:
                if (series == kTick) {
                    info.name = "tick";
                    info.category = "tick";
                    break;
                }
                info.phase = qtools::TracePhase::End;
                info.spanKey = series;
                if (e.data != qtools::kLogNoData) {
                    const double late = static_cast<int32_t>(e.data) / 1000.0;
                    info.args["lateness_us"] = late;
                    info.name = late > lateUs ? name + " LATE" : name;
                    info.category = late > lateUs ? "wait,late" : "wait";
                }
                break;
            default:
                info.name = "cost sample";
                info.category = "cost";
                break;
        }
        return info;
    };
}

Survey::Survey(const LoadedQuelta& lib, const SurveyConfig& config) : worker_(std::make_unique<Worker>()) {
    worker_->lib = &lib;
    worker_->config = config;
    worker_->result = &result_;
    tick_.id = kTick;
    tickChunk_.reserve(kTickChunk);
}

Survey::~Survey() {
    if (started_) {
        RequestStop();
        Finish(nullptr);
    }
}

bool Survey::Start() {
    SurveyResult& result = result_;
    const SurveyConfig& config = worker_->config;
    int timerPolicy = 0, timerPriority = 0;
    worker_->timerTid = LibraryTimerThread();
    if (!TimerThreadPolicy(worker_->timerTid, timerPolicy, timerPriority)) {
        timerThreadNote_ = "the library's timer thread QUELTAisr is not running (it needs SCHED_FIFO)";
    } else if (timerPolicy != SCHED_FIFO) {
        timerThreadNote_ = "the library's timer thread QUELTAisr does not run under SCHED_FIFO";
    }

    cpu_set_t set;
    CPU_ZERO(&set);
    for (int c : config.cpus) CPU_SET(c, &set);
    auto attributes = [&](pthread_attr_t& attr, bool realtime, int priority) {
        pthread_attr_init(&attr);
        if (!config.cpus.empty()) pthread_attr_setaffinity_np(&attr, sizeof set, &set);
        if (!realtime) return;
        pthread_attr_setinheritsched(&attr, PTHREAD_EXPLICIT_SCHED);
        pthread_attr_setschedpolicy(&attr, SCHED_FIFO);
        sched_param p{};
        p.sched_priority = priority;
        pthread_attr_setschedparam(&attr, &p);
    };

    pthread_t thread{};
    int r = -1;
    if (config.realtime) {
        // By default just below the library's timer thread, which runs at the top.
        const int priority = config.priority > 0 ? config.priority : sched_get_priority_max(SCHED_FIFO) - 1;
        pthread_attr_t attr;
        attributes(attr, true, priority);
        result.realtime = true;
        result.priority = priority;
        r = pthread_create(&thread, &attr, &WorkerMain, worker_.get());
        pthread_attr_destroy(&attr);
        if (r != 0) {
            result.realtime = false;
            result.priority = 0;
            const std::string why = std::string("real-time scheduling is not permitted (") + std::strerror(r) +
                                    "): measuring under normal scheduling, expect far larger lateness";
            result.notes.push_back(why);
        }
    } else {
        result.notes.push_back("real-time scheduling not requested (--no-realtime)");
    }
    if (r != 0) {
        pthread_attr_t attr;
        attributes(attr, false, 0);
        r = pthread_create(&thread, &attr, &WorkerMain, worker_.get());
        pthread_attr_destroy(&attr);
    }
    if (r != 0) {
        result.notes.push_back(std::string("could not start the survey thread: ") + std::strerror(r));
        return false;
    }
    thread_ = thread;
    started_ = true;
    return true;
}

void Survey::RequestStop() { worker_->stop.store(true, std::memory_order_relaxed); }
bool Survey::Done() const { return !started_ || worker_->phase.load(std::memory_order_acquire) == 3; }
int Survey::Phase() const { return std::min(2, worker_->phase.load(std::memory_order_relaxed)); }
uint64_t Survey::Samples() const { return worker_->samples.load(std::memory_order_relaxed); }

double Survey::ElapsedS() const {
    const int64_t start = worker_->surveyStartNs.load(std::memory_order_relaxed);
    if (start == 0) return 0.0;
    const int64_t end = worker_->surveyEndNs.load(std::memory_order_relaxed);
    return static_cast<double>((end != 0 ? end : MonoNs()) - start) / 1e9;
}

void Survey::Poll(SampleSink* sink) {
    worker_->ring.Drain([&](const RingSample& s) {
        const double us = static_cast<double>(s.latenessNs) / 1000.0;
        if (s.series == kBaseline && (baselineMinUs_ < 0 || us < baselineMinUs_)) baselineMinUs_ = std::max(0.0, us);
        if (sink) sink->OnSample(s.series, static_cast<double>(s.atNs) / 1e9, us);
    });
    worker_->ticks.ring.Drain([&](uint64_t t) { tickChunk_.push_back(t); });
    if (tickChunk_.size() >= kTickChunk) ProcessTicks(sink, false);
}

// The tick grid of a chunk is placed by the machine's best wake-up seen so far.
void Survey::ProcessTicks(SampleSink* sink, bool /*all*/) {
    if (tickChunk_.empty()) return;
    const qtools::TickLatenessResult late =
        qtools::TickLateness(tickChunk_, kTickPeriodNs, std::max(0.0, baselineMinUs_));
    const int64_t start = worker_->surveyStartNs.load(std::memory_order_relaxed);
    for (std::size_t k = 0; k < late.latenessUs.size(); ++k) {
        const double us = late.latenessUs[k];
        tick_.histogram.Add(us);
        if (us > 1000.0) ++tick_.overMs;
        if (sink) {
            const double dueS = (static_cast<double>(tickChunk_[k]) - static_cast<double>(start)) / 1e9 - us / 1e6;
            sink->OnSample(kTick, dueS, us);
        }
    }
    result_.tickRestarts += late.restarts;
    tickChunk_.clear();
}

SurveyResult Survey::Finish(SampleSink* sink) {
    if (!started_) return std::move(result_);
    pthread_join(thread_, nullptr);
    started_ = false;
    Poll(sink);
    ProcessTicks(sink, true);
    SurveyResult& out = result_;
    // Without a timer the not-measured note says it all.
    if (out.timerRunning && !timerThreadNote_.empty()) out.notes.insert(out.notes.begin(), timerThreadNote_);
    out.series = std::move(worker_->stats);
    out.series[kTick].histogram = std::move(tick_.histogram);
    out.series[kTick].overMs = tick_.overMs;
    out.series[kTick].cpuHeld = -1;
    if (out.tickRestarts > 0) {
        out.notes.push_back("tick: the tick grid restarted " + std::to_string(out.tickRestarts) +
                            " time(s) (a tick served more than 1 ms late)");
    }
    if (worker_->ticks.ring.dropped() > 0) {
        out.notes.push_back(std::to_string(worker_->ticks.ring.dropped()) +
                            " ticks were not counted (the probe's main thread fell behind)");
    }
    if (worker_->ring.dropped() > 0) {
        out.notes.push_back(std::to_string(worker_->ring.dropped()) +
                            " samples are missing from the CSV file and the summary lines (the probe's main "
                            "thread fell behind); the tables have them all");
    }
    return std::move(out);
}

}  // namespace qprobe
