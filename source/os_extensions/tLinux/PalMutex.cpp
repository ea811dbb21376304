// Platform layer: priority-inheriting mutexes.
#include "tLinux/PalMutex.h"

#include <errno.h>
#include <time.h>

#include "quelta/RuntimeSemaphore.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace quelta {

int32_t PalLockMutexTimed(pthread_mutex_t* mutex, int32_t timeoutMs) {
    int result;
    if (timeoutMs < 0) {
        result = pthread_mutex_lock(mutex);
    } else {
        // pthread_mutex_timedlock measures its deadline on CLOCK_REALTIME.
        const timespec deadline = quelta_runtime::DeadlineAfterMs(CLOCK_REALTIME, timeoutMs);
        result = pthread_mutex_timedlock(mutex, &deadline);
    }
    if (result == 0) return 0;
    return result == ETIMEDOUT ? 1 : 2;
}

int PALCreateMutexInternal(pthread_mutex_t** out) {
    if (gPalReady.load(std::memory_order_acquire) == 0) {
        PalPreconditionBreak();
        return EINVAL;
    }
    auto* mutex = static_cast<pthread_mutex_t*>(PalMemAlloc(sizeof(pthread_mutex_t)));
    *out = mutex;
    if (mutex == nullptr) return ENOMEM;
    const int result = pthread_mutex_init(mutex, &gMutexAttr);
    if (result != 0) {
        // Nothing half-made is handed out: the caller sees null and the
        // system's reason.
        PalMemFree(mutex);
        *out = nullptr;
        return result;
    }
    return 0;
}

}  // namespace quelta
