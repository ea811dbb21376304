// Platform layer: start-up, threads, CPUs, scheduling, sleeping, diagnostics.
#include "tLinux/PalThreads.h"

#include <errno.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <cstdarg>
#include <cstdio>
#include <cstring>

namespace quelta {

static_assert(sizeof(cpu_set_t) == sizeof(PalCpuSet),
              "the kernel's CPU set must be the layer's 128 bytes");
static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__,
              "32-bit CPU words match the kernel's bit layout only on little-endian");

namespace {

long QueryOnlineCpus() { return sysconf(_SC_NPROCESSORS_ONLN); }

constexpr uint32_t kMaxCpus = 1024;

void SetCpuBit(PalCpuSet& set, uint32_t cpu) {
    set.words[cpu / 32] |= uint32_t(1) << (cpu % 32);
}

// Hands a layer CPU set to the kernel for the calling thread. The set is
// copied into the system's own type rather than cast, so that its stricter
// alignment never matters; the bytes are identical.
int32_t PinCallingThread(const PalCpuSet& set) {
    cpu_set_t kernelSet;
    std::memcpy(&kernelSet, &set, sizeof kernelSet);
    return pthread_setaffinity_np(pthread_self(), sizeof kernelSet, &kernelSet);
}

}  // namespace

std::atomic<uint32_t> gPalReady{0};
pthread_mutexattr_t gMutexAttr;
pthread_condattr_t gCondAttr;
PalCpuSet gAllCpus;
std::atomic<int32_t> gCpuCount{-1};
long (*gPalOnlineCpuQuery)() = QueryOnlineCpus;

void PalPreconditionBreak() { raise(SIGTRAP); }

uint32_t PalInitialize() {
    // A failure leaves whatever was already initialised as it is: start-up
    // gives up on the whole library then, and nothing else reads the
    // attributes while gPalReady is 0.
    if (pthread_mutexattr_init(&gMutexAttr) != 0) return 0;
    if (pthread_mutexattr_setprotocol(&gMutexAttr, PTHREAD_PRIO_INHERIT) != 0) return 0;
    if (pthread_condattr_init(&gCondAttr) != 0) return 0;
    if (pthread_condattr_setclock(&gCondAttr, CLOCK_MONOTONIC) != 0) return 0;

    std::memset(&gAllCpus, 0, sizeof gAllCpus);
    const long online = gPalOnlineCpuQuery();
    for (long cpu = online - 1; cpu >= 0; --cpu) {
        if (cpu < static_cast<long>(kMaxCpus)) SetCpuBit(gAllCpus, static_cast<uint32_t>(cpu));
    }

    gPalReady.store(1, std::memory_order_release);
    return 1;
}

int32_t PalGetCpuCount() {
    int32_t cached = gCpuCount.load(std::memory_order_relaxed);
    if (cached >= 0) return cached;
    // Racing callers may each ask and store; they store the same answer. A
    // failed query (-1) is stored too and asked again next time.
    cached = static_cast<int32_t>(gPalOnlineCpuQuery());
    gCpuCount.store(cached, std::memory_order_relaxed);
    return cached;
}

void PalSetThreadName(const char* name) {
    prctl(PR_SET_NAME, reinterpret_cast<unsigned long>(name), 0ul, 0ul, 0ul);
}

// The kernel may end a timed sleep up to the thread's timer slack late (50 us
// by default) to batch wake-ups. clock_nanosleep ignores it for real-time
// threads, and newer kernels clear it on the change to a real-time policy;
// older ones apply it to a timed futex wait (the wake stand-in's sleep) of a
// real-time thread all the same. 1 ns is the least that can be set: 0 means
// "the default".
void PalSetExactTimers() { prctl(PR_SET_TIMERSLACK, 1ul, 0ul, 0ul, 0ul); }

int32_t PalSetAffinityAll() {
    if (gPalReady.load(std::memory_order_acquire) == 0) {
        PalPreconditionBreak();
        return EINVAL;
    }
    return PinCallingThread(gAllCpus);
}

int32_t PalSetAffinityOne(int32_t cpu) {
    // Asked afresh: a CPU brought online since start-up may be chosen.
    if (gPalOnlineCpuQuery() <= static_cast<long>(cpu)) return -1;
    PalCpuSet set;
    std::memset(&set, 0, sizeof set);
    // A negative number passes the test above and leaves the set empty; the
    // kernel then refuses it with EINVAL.
    if (static_cast<uint32_t>(cpu) < kMaxCpus) SetCpuBit(set, static_cast<uint32_t>(cpu));
    return PinCallingThread(set);
}

int32_t PalSetThreadPriority(pthread_t thread, int32_t priority) {
    sched_param param{};
    param.sched_priority = priority;
    const int result = pthread_setschedparam(thread, SCHED_RR, &param);
    errno = result;
    return result;
}

int32_t PalGetThreadPriority(pthread_t thread) {
    int policy = 0;
    sched_param param{};
    if (pthread_getschedparam(thread, &policy, &param) != 0) return -1;
    return param.sched_priority;
}

void PalSleepMilliseconds(uint32_t ms) {
    timespec ts{};
    ts.tv_sec = static_cast<time_t>(ms / 1000);
    ts.tv_nsec = static_cast<long>((ms % 1000) * 1000000u);
    // One sleep; an interrupted one is not resumed.
    nanosleep(&ts, &ts);
}

int32_t PalGetThreadId() { return static_cast<int32_t>(syscall(SYS_gettid)); }

void PalDebugPrint(const char* file, const char* function, int32_t line, const char* format,
                   ...) {
    const long tid = PalGetThreadId();
    if (function != nullptr) {
        std::fprintf(stderr, "%s:%s:%d::%ld::", file, function, static_cast<int>(line), tid);
    } else {
        std::fprintf(stderr, "%s:%d::%ld::", file, static_cast<int>(line), tid);
    }
    if (format != nullptr) {
        va_list args;
        va_start(args, format);
        std::vfprintf(stderr, format, args);
        va_end(args);
    }
    std::fputc('\n', stderr);
    std::fflush(stderr);
}

pthread_key_t PalCreateThreadKey() {
    pthread_key_t key;
    if (pthread_key_create(&key, nullptr) != 0) return kPalNoThreadKey;
    return key;
}

}  // namespace quelta
