// Platform layer: priority-inheriting mutexes.
#ifndef QUELTA_TLINUX_PALMUTEX_H
#define QUELTA_TLINUX_PALMUTEX_H

#include <pthread.h>

#include <cstdint>

namespace quelta {

// 0 locked, 1 timed out, 2 other failure. Negative timeout: no limit. The
// deadline is on CLOCK_REALTIME, the clock pthread_mutex_timedlock uses.
int32_t PalLockMutexTimed(pthread_mutex_t* mutex, int32_t timeoutMs);

// 0 success; 22 before PalInitialize; 12 without memory; otherwise the error of
// pthread_mutex_init (then *out is null). Never 0 unless *out is usable.
int PALCreateMutexInternal(pthread_mutex_t** out);

}  // namespace quelta

#endif
