#include "probe/Survey.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <sched.h>
#include <sys/mman.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>
#include <random>

#include "RuntimeSemaphore.h"
#include "TickGrid.h"
#include "probe/Costs.h"

namespace qprobe {

namespace {

constexpr int64_t kNsPerMs = 1000000;
constexpr int64_t kMinDelayNs = 200000;     // deadlines 0.2 ms ...
constexpr int64_t kDelaySpreadNs = 1000000;  // ... to 1.2 ms ahead
constexpr int kWarmUpRounds = 20;
constexpr uint64_t kTickPeriodNs = 1000000;
constexpr int32_t kCallbackTimeoutMs = 250;

const uint32_t kSampledSeries[] = {kBaseline, kEventOwnSem, kPlainWait, kEventTimeout, kGlobalWait,
                                   kCallbackTime};

int64_t MonoNs() {
    timespec t{};
    clock_gettime(CLOCK_MONOTONIC, &t);
    return static_cast<int64_t>(t.tv_sec) * 1000000000LL + t.tv_nsec;
}

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

// State the library's timer thread writes from the callbacks. The callbacks
// are plain functions, so it lives here; one survey runs at a time.
struct TickLog {
    std::vector<uint64_t> times;
    std::atomic<std::size_t> count{0};
    std::atomic<std::size_t> dropped{0};
    iKPLogEngine* log = nullptr;
};
std::atomic<TickLog*> gTicks{nullptr};

void OnTick(uint64_t /*serial*/) {
    const uint64_t t = static_cast<uint64_t>(MonoNs());
    TickLog* s = gTicks.load(std::memory_order_acquire);
    if (s == nullptr) return;
    const std::size_t i = s->count.load(std::memory_order_relaxed);
    if (i < s->times.size()) {
        s->times[i] = t;
        s->count.store(i + 1, std::memory_order_release);
    } else {
        s->dropped.fetch_add(1, std::memory_order_relaxed);
    }
    s->log->LogNow5(EventWord(kTick, kKindWake));
}

struct CallbackState {
    std::atomic<int64_t> firedAt{0};
    PalSemaphore* semaphore = nullptr;
    iKPLogEngine* log = nullptr;
};

void OnCallbackTime(void* arg) {
    const int64_t t = MonoNs();
    auto* s = static_cast<CallbackState*>(arg);
    s->firedAt.store(t, std::memory_order_release);
    s->log->LogNow5(EventWord(kCallbackTime, kKindWake));
    qtools::RuntimeSemaphorePost(s->semaphore);
}

struct Progress {
    std::atomic<int> phase{0};  // 0 preparing, 1 surveying, 2 costs, 3 done
    std::atomic<int64_t> surveyStartNs{0};
    std::atomic<uint64_t> samples{0};
};

struct Worker {
    const LoadedQuelta* lib = nullptr;
    SurveyConfig config;
    SurveyResult* result = nullptr;
    Progress progress;

    iKPusTimingEngine* engine = nullptr;
    iKPLogEngine* log = nullptr;
    PalSemaphore* timeoutSemaphore = nullptr;
    CallbackState callback;
    std::mt19937_64 rng;
    std::size_t strayPosts = 0;
    int schedstatFd = -1;  // this thread's /proc schedstat, for its run delay
    uint32_t unexpectedResult[kSeriesCount] = {};

    // One sample; false when the call did not work as documented.
    bool Sample(uint32_t id, int64_t delayNs, double& latenessUs);
    void Run();
};

bool Worker::Sample(uint32_t id, int64_t delayNs, double& latenessUs) {
    const QueltaEntries& fn = lib->fn();
    const uint32_t waitWord = EventWord(id, kKindWait);
    const uint32_t wakeWord = EventWord(id, kKindWake);
    int64_t intended = 0;
    int64_t woke = 0;
    switch (id) {
        case kBaseline: {
            intended = MonoNs() + delayNs;
            timespec ts{static_cast<time_t>(intended / 1000000000LL), static_cast<long>(intended % 1000000000LL)};
            log->LogNow5(waitWord);
            while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr) == EINTR) {
            }
            woke = MonoNs();
            log->LogNow5(wakeWord);
            break;
        }
        case kPlainWait: {
            intended = MonoNs() + delayNs;
            const ClockTime target = CT(static_cast<uint64_t>(intended));
            log->LogNow5(waitWord);
            fn.waitUntilClocks64(&target);
            woke = MonoNs();
            log->LogNow5(wakeWord);
            break;
        }
        case kEventOwnSem: {
            intended = MonoNs() + delayNs;
            const ClockTime deadline = CT(static_cast<uint64_t>(intended));
            log->LogNow5(waitWord);
            const uint32_t r = fn.eventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr);
            woke = MonoNs();
            log->LogNow5(wakeWord);
            if (r != 0) {
                unexpectedResult[id] = r;
                return false;
            }
            break;
        }
        case kEventTimeout: {
            const uint32_t timeoutUs = static_cast<uint32_t>(delayNs / 1000);
            const int64_t called = MonoNs();
            intended = called + static_cast<int64_t>(timeoutUs) * 1000;
            log->LogNow5(waitWord);
            const uint32_t r = fn.eventWait(timeoutSemaphore, timeoutUs);
            woke = MonoNs();
            log->LogNow5(wakeWord);
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
            ClockTime now;
            engine->ReadGlobal2(now);
            const uint64_t target = U64(now) + static_cast<uint64_t>(delayNs);
            const ClockTime t = CT(target);
            ClockTime after{0, 0};
            log->LogNow5(waitWord);
            fn.waitUntilGlobalClocks64(&t, nullptr, &after, 0);
            ClockTime fresh;
            engine->ReadGlobal2(fresh);
            log->LogNow5(wakeWord);
            latenessUs = static_cast<double>(static_cast<int64_t>(U64(fresh) - target)) / 1000.0;
            return true;
        }
        case kCallbackTime: {
            callback.firedAt.store(0, std::memory_order_relaxed);
            intended = MonoNs() + delayNs;
            const ClockTime when = CT(static_cast<uint64_t>(intended));
            log->LogNow5(waitWord);
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
            break;
        }
        default:
            return false;
    }
    latenessUs = static_cast<double>(woke - intended) / 1000.0;
    return true;
}

void Worker::Run() {
    engine = lib->engine();
    log = lib->log();
    const QueltaEntries& fn = lib->fn();
    SurveyResult& out = *result;
    out.tickService = engine->UsesTickService() != 0;
    if (!out.tickService) {
        out.notes.push_back("the library's waits are not served by its tick service (UsesTickService is 0): "
                            "event waits cannot be served and no tick runs");
    }

    // The log keeps the whole survey if it can: every CPU's ring large enough.
    const long cpus = std::max(1L, sysconf(_SC_NPROCESSORS_ONLN));
    const int32_t wanted = static_cast<int32_t>(std::clamp<int64_t>(config.durationS * 10000LL, 20000, 100000));
    const uint32_t capacity = log->Configure(wanted);
    if (capacity != static_cast<uint32_t>(wanted)) {
        out.notes.push_back("the log engine could not allocate its rings (Configure gave " +
                            std::to_string(capacity) + " entries per CPU); the trace is short");
    }
    log->SetEnabled(0);

    // Buffers, touched now so that the survey does not fault pages in.
    const std::size_t rounds = static_cast<std::size_t>(config.durationS) * 900 + 200;
    std::vector<std::vector<float>> samples(kSeriesCount);
    for (uint32_t id : kSampledSeries) samples[id].reserve(rounds);
    TickLog ticks;
    ticks.times.assign(static_cast<std::size_t>(config.durationS) * 1050 + 2000, 0);
    ticks.log = log;
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
    for (uint32_t id : kSampledSeries) {  // touch the sample buffers
        samples[id].resize(rounds);
        samples[id].clear();
    }

    if (qtools::RuntimeSemaphoreCreate(&timeoutSemaphore) != 0 ||
        qtools::RuntimeSemaphoreCreate(&callback.semaphore) != 0) {
        out.notes.push_back("could not create the runtime's semaphores; event-timeout and callback-time skipped");
    }
    callback.log = log;
    rng.seed(static_cast<uint64_t>(MonoNs()));
    auto delay = [this] { return kMinDelayNs + static_cast<int64_t>(rng() % kDelaySpreadNs); };

    fn.setCallback(&OnCallbackTime, &callback);

    uint32_t order[std::size(kSampledSeries)];
    std::copy(std::begin(kSampledSeries), std::end(kSampledSeries), order);
    // A series whose calls keep failing is dropped, so that one that fails
    // slowly (a callback that never comes) does not starve the others.
    constexpr std::size_t kGiveUpAfter = 3;
    std::vector<std::size_t> failedInARow(kSeriesCount, 0);
    auto usable = [&](uint32_t id) {
        if (id == kEventTimeout && timeoutSemaphore == nullptr) return false;
        if (id == kCallbackTime && callback.semaphore == nullptr) return false;
        return failedInARow[id] < kGiveUpAfter;
    };

    // One sample of a series; counts a failure, and drops a series after a
    // few failures in a row, warm-up included.
    auto attempt = [&](uint32_t id, double& lateness) {
        const bool ok = Sample(id, delay(), lateness);
        failedInARow[id] = ok ? 0 : failedInARow[id] + 1;
        if (!ok) ++failed[id];
        if (failedInARow[id] == kGiveUpAfter) {
            out.notes.push_back(std::string(SeriesName(id)) + ": dropped from the survey after " +
                                std::to_string(kGiveUpAfter) + " failed calls in a row");
        }
        return ok;
    };

    // Warm-up: code and data paths in, nothing recorded.
    for (int r = 0; r < kWarmUpRounds; ++r) {
        for (uint32_t id : order) {
            double ignored;
            if (usable(id)) attempt(id, ignored);
        }
    }

    // The survey.
    log->SetEnabled(1);
    log->LogNow5(EventWord(kSurveyItself, kKindStart));
    for (uint32_t id = 0; id < kSeriesCount; ++id) log->LogNow5(EventWord(id, kKindStart));
    gTicks.store(&ticks, std::memory_order_release);
    engine->RegisterTickCallback(&OnTick);

    const int64_t start = MonoNs();
    const int64_t end = start + static_cast<int64_t>(config.durationS) * 1000 * kNsPerMs;
    progress.surveyStartNs.store(start);
    progress.phase.store(1);
    bool full = false;
    while (!full && MonoNs() < end) {
        std::shuffle(std::begin(order), std::end(order), rng);
        for (uint32_t id : order) {
            if (!usable(id)) continue;
            double lateness = 0.0;
            const int64_t delayBefore = RunDelayNs(schedstatFd);
            const bool ok = attempt(id, lateness);
            const int64_t delayAfter = RunDelayNs(schedstatFd);
            if (ok) {
                samples[id].push_back(static_cast<float>(lateness));
                if (samples[id].size() >= rounds) full = true;
                if (lateness > 1000.0) {
                    ++overMs[id];
                    // Kept off the CPU for at least half of the lateness.
                    if (delayBefore >= 0 && delayAfter >= 0 &&
                        static_cast<double>(delayAfter - delayBefore) / 1000.0 >= lateness / 2) {
                        ++cpuHeld[id];
                    }
                }
            }
        }
        progress.samples.fetch_add(std::size(kSampledSeries), std::memory_order_relaxed);
    }
    const int64_t stop = MonoNs();
    out.surveyedS = static_cast<double>(stop - start) / 1e9;

    for (uint32_t id = 0; id < kSeriesCount; ++id) log->LogNow5(EventWord(id, kKindEnd));
    log->LogNow5(EventWord(kSurveyItself, kKindEnd));
    engine->UnregisterTickCallback(&OnTick);
    const ClockTime never{QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};
    fn.setCallbackTime(&never, 0);
    fn.setCallback(nullptr, nullptr);
    timespec settle{0, 5 * kNsPerMs};  // a callback already running finishes
    nanosleep(&settle, nullptr);
    gTicks.store(nullptr, std::memory_order_release);
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

    // Results. The tick's grid is placed by the machine's best wake-up.
    double floorUs = 0.0;
    if (!samples[kBaseline].empty()) {
        floorUs = std::max(0.0f, *std::min_element(samples[kBaseline].begin(), samples[kBaseline].end()));
    }
    ticks.times.resize(ticks.count.load(std::memory_order_acquire));
    const qtools::TickLatenessResult tick = qtools::TickLateness(ticks.times, kTickPeriodNs, floorUs);
    out.tickRestarts = tick.restarts;
    if (ticks.dropped.load() > 0) {
        out.notes.push_back(std::to_string(ticks.dropped.load()) + " ticks beyond the buffer were not counted");
    }
    for (uint32_t id = 0; id < kSeriesCount; ++id) {
        SeriesSamples s;
        s.id = id;
        s.failed = failed[id];
        if (id == kTick) {
            s.latenessUs = tick.latenessUs;
            s.overMs = static_cast<std::size_t>(
                std::count_if(s.latenessUs.begin(), s.latenessUs.end(), [](double v) { return v > 1000.0; }));
        } else {
            s.latenessUs.assign(samples[id].begin(), samples[id].end());
            std::vector<float>().swap(samples[id]);
            s.overMs = overMs[id];
            if (schedstatFd >= 0) s.cpuHeld = static_cast<long>(cpuHeld[id]);
        }
        out.series.push_back(std::move(s));
        if (unexpectedResult[id] != 0) {
            const uint32_t r = unexpectedResult[id];
            std::string what = r == 100   ? "returned 0 (no timer)"
                               : r == 101 ? "never called back within 250 ms"
                                          : "returned " + std::to_string(r);
            out.notes.push_back(std::string(SeriesName(id)) + ": " + std::to_string(failed[id]) +
                                " call(s) failed; the last " + what);
        }
    }
    if (tick.restarts > 0) {
        out.notes.push_back("tick: the tick grid restarted " + std::to_string(tick.restarts) +
                            " time(s) (a tick served more than 1 ms late)");
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

    progress.phase.store(2);
    out.costs = MeasureCosts(*lib);

    qtools::RuntimeSemaphoreDestroy(timeoutSemaphore);
    qtools::RuntimeSemaphoreDestroy(callback.semaphore);
    progress.phase.store(3);
}

void* WorkerMain(void* arg) {
    static_cast<Worker*>(arg)->Run();
    return nullptr;
}

// The library's timer thread, found by its name: its scheduling policy and
// priority, or false when it cannot be seen.
bool TimerThreadPolicy(int& policy, int& priority) {
    DIR* d = opendir("/proc/self/task");
    if (d == nullptr) return false;
    bool found = false;
    while (dirent* e = readdir(d)) {
        if (e->d_name[0] == '.') continue;
        std::ifstream comm(std::string("/proc/self/task/") + e->d_name + "/comm");
        std::string name;
        std::getline(comm, name);
        if (name != "QUELTAisr") continue;
        const pid_t tid = static_cast<pid_t>(std::atoi(e->d_name));
        sched_param p{};
        policy = sched_getscheduler(tid);
        found = policy >= 0 && sched_getparam(tid, &p) == 0;
        priority = p.sched_priority;
        break;
    }
    closedir(d);
    return found;
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

qtools::TraceEventInfo DescribeProbeEvent(uint32_t word) {
    const uint32_t series = word & 0xFFu;
    const uint32_t kind = (word >> 16) & 0xFFu;
    const std::string name = SeriesName(series);
    qtools::TraceEventInfo info;
    if ((word >> 24) != 0 || (series >= kSeriesCount && series != kSurveyItself) || kind < kKindStart ||
        kind > kKindCost) {
        return qtools::DescribeEventWord(word);
    }
    switch (kind) {
        case kKindStart:
            info.name = name + " start";
            info.category = "series";
            break;
        case kKindEnd:
            info.name = name + " end";
            info.category = "series";
            break;
        case kKindWait:
            info.name = name;
            info.category = "wait";
            info.phase = qtools::TracePhase::Begin;
            info.spanKey = series;
            break;
        case kKindWake:
            if (series == kTick) {
                info.name = "tick";
                info.category = "tick";
            } else {
                info.name = name;
                info.category = "wait";
                info.phase = qtools::TracePhase::End;
                info.spanKey = series;
            }
            break;
        default:
            info.name = "cost sample";
            info.category = "cost";
            break;
    }
    return info;
}

SurveyResult RunSurvey(const LoadedQuelta& lib, const SurveyConfig& config) {
    SurveyResult result;
    Worker worker;
    worker.lib = &lib;
    worker.config = config;
    worker.result = &result;

    int timerPolicy = 0, timerPriority = 0;
    if (!TimerThreadPolicy(timerPolicy, timerPriority)) {
        result.notes.push_back("the library's timer thread QUELTAisr is not running (it needs SCHED_FIFO): "
                               "nothing serves the tick, the callbacks or the event and global-clock waits");
    } else if (timerPolicy != SCHED_FIFO) {
        result.notes.push_back("the library's timer thread QUELTAisr does not run under SCHED_FIFO");
    }

    pthread_t thread{};
    bool started = false;
    if (config.realtime) {
        // Just below the library's timer thread, which runs at the top.
        const int priority = sched_get_priority_max(SCHED_FIFO) - 1;
        pthread_attr_t attr;
        pthread_attr_init(&attr);
        pthread_attr_setinheritsched(&attr, PTHREAD_EXPLICIT_SCHED);
        pthread_attr_setschedpolicy(&attr, SCHED_FIFO);
        sched_param p{};
        p.sched_priority = priority;
        pthread_attr_setschedparam(&attr, &p);
        result.realtime = true;
        result.priority = priority;
        const int r = pthread_create(&thread, &attr, &WorkerMain, &worker);
        pthread_attr_destroy(&attr);
        if (r == 0) {
            started = true;
        } else {
            result.realtime = false;
            result.priority = 0;
            const std::string why = std::string("real-time scheduling is not permitted (") + std::strerror(r) +
                                    "): measuring under normal scheduling, expect far larger lateness";
            std::printf("note: %s\n", why.c_str());
            std::fflush(stdout);
            result.notes.push_back(why);
        }
    } else {
        result.notes.push_back("real-time scheduling not requested (--no-realtime)");
    }
    if (!started && pthread_create(&thread, nullptr, &WorkerMain, &worker) != 0) {
        result.notes.push_back("could not start the survey thread");
        return result;
    }

    // Progress, only for a person at a terminal.
    int lastLength = 0;
    while (worker.progress.phase.load() != 3) {
        timespec pause{0, 200 * kNsPerMs};
        nanosleep(&pause, nullptr);
        if (!config.progress) continue;
        char line[160];
        const int phase = worker.progress.phase.load();
        if (phase == 0) {
            std::snprintf(line, sizeof line, "preparing ...");
        } else if (phase == 1) {
            const double elapsed =
                static_cast<double>(MonoNs() - worker.progress.surveyStartNs.load()) / 1e9;
            std::snprintf(line, sizeof line, "surveying: %5.1f / %d s, %llu samples", std::min(elapsed, 1.0 * config.durationS),
                          config.durationS, static_cast<unsigned long long>(worker.progress.samples.load()));
        } else {
            std::snprintf(line, sizeof line, "measuring call costs ...");
        }
        const int length = static_cast<int>(std::strlen(line));
        std::printf("\r%s%*s", line, std::max(0, lastLength - length), "");
        std::fflush(stdout);
        lastLength = length;
    }
    pthread_join(thread, nullptr);
    if (config.progress && lastLength > 0) {
        std::printf("\r%*s\r", lastLength, "");
        std::fflush(stdout);
    }
    return result;
}

}  // namespace qprobe
