// Platform layer: start-up, threads, CPUs, scheduling, sleeping, diagnostics.
//
// Thin wrappers over POSIX threads and the Linux kernel. Error numbers are the
// POSIX ones, passed through unchanged. Operations that create objects need a
// successful PalInitialize first; called before it they raise SIGTRAP and
// return 22 (EINVAL) without doing anything.
#ifndef QUELTA_TLINUX_PALTHREADS_H
#define QUELTA_TLINUX_PALTHREADS_H

#include <pthread.h>

#include <atomic>
#include <cstdint>

namespace quelta {

// 1024 CPUs in 128 bytes: bit (n mod 32) of word (n / 32) stands for CPU n.
struct PalCpuSet {
    uint32_t words[32];
};
static_assert(sizeof(PalCpuSet) == 128, "CPU sets passed to the kernel are 128 bytes");

extern std::atomic<uint32_t> gPalReady;     // 1 once PalInitialize succeeded
extern pthread_mutexattr_t gMutexAttr;      // PTHREAD_PRIO_INHERIT
extern pthread_condattr_t gCondAttr;        // clock CLOCK_MONOTONIC
extern PalCpuSet gAllCpus;                  // CPUs online at PalInitialize
extern std::atomic<int32_t> gCpuCount;      // cached online CPUs, -1 unread

uint32_t PalInitialize();
int32_t PalGetCpuCount();
void PalSetThreadName(const char* name);
// Asks the kernel to end this thread's timed sleeps on time rather than
// within its default grouping allowance (see the definition).
void PalSetExactTimers();
int32_t PalSetAffinityAll();
int32_t PalSetAffinityOne(int32_t cpu);
int32_t PalSetThreadPriority(pthread_t thread, int32_t priority);
// Returns the thread's priority; -1 when pthread_getschedparam fails (never a
// valid SCHED_RR/SCHED_FIFO priority, and not 0, which SCHED_OTHER reports).
int32_t PalGetThreadPriority(pthread_t thread);
void PalSleepMilliseconds(uint32_t ms);
void PalDebugPrint(const char* file, const char* function, int32_t line,
                   const char* format, ...) __attribute__((format(printf, 4, 5)));
// Returns a new key; when the process has no keys left it returns
// kPalNoThreadKey, a value pthread_key_create never hands out.
pthread_key_t PalCreateThreadKey();
constexpr pthread_key_t kPalNoThreadKey = static_cast<pthread_key_t>(-1);

// Kernel thread id of the calling thread (gettid).
int32_t PalGetThreadId();

// Raised for a call before PalInitialize: SIGTRAP, then the caller returns 22.
void PalPreconditionBreak();

// Seam: the online-CPU query (sysconf(_SC_NPROCESSORS_ONLN)); tests replace it.
extern long (*gPalOnlineCpuQuery)();

}  // namespace quelta

#define PAL_DEBUG_PRINT(...) ::quelta::PalDebugPrint(__FILE__, __func__, __LINE__, __VA_ARGS__)

#endif
