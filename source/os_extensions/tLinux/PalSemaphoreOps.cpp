// Platform layer: the counting semaphore.
//
// A mutex-and-condition semaphore whose count is bounded by the number of
// waiters plus one. The bound is what the wait list relies on: a wait node's
// semaphore may be posted by the timer thread and by another thread at about
// the same moment, and with nobody waiting it must remember a single post
// only, so that the node's next user does not find stale wake-ups.
#include "tLinux/PalSemaphoreOps.h"

#include <errno.h>
#include <time.h>

#include "quelta/RuntimeSemaphore.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace quelta {

int32_t PalSemaphoreCreate(PalSemaphore** out) {
    if (gPalReady.load(std::memory_order_acquire) == 0) {
        PalPreconditionBreak();
        return EINVAL;
    }
    auto* semaphore = static_cast<PalSemaphore*>(PalMemAlloc(sizeof(PalSemaphore)));
    if (semaphore == nullptr) return ENOMEM;

    int result = pthread_mutex_init(&semaphore->mutex, &gMutexAttr);
    if (result != 0) {
        PalMemFree(semaphore);
        *out = nullptr;
        return result;
    }
    result = pthread_cond_init(&semaphore->condition, &gCondAttr);
    if (result != 0) {
        pthread_mutex_destroy(&semaphore->mutex);
        PalMemFree(semaphore);
        *out = nullptr;
        return result;
    }
    semaphore->count = 0;
    semaphore->waiters = 0;
    *out = semaphore;
    return 0;
}

// Waiting and posting follow the rules every user of the record must share
// with the runtime's own semaphores; the one implementation of them is the
// reference in the public headers.
uint32_t PalSemaphoreWait(PalSemaphore* semaphore, int32_t timeoutMs) {
    if (semaphore == nullptr) return 2;
    return quelta_runtime::SemaphoreWait(semaphore, timeoutMs);
}

uint32_t PalSemaphoreWaitUntil(PalSemaphore* semaphore, const timespec* deadline) {
    if (semaphore == nullptr) return 2;
    return quelta_runtime::SemaphoreWaitUntil(semaphore, deadline);
}

uint32_t PalSemaphoreWaitUntilUnless(PalSemaphore* semaphore, const timespec* deadline, bool (*abandon)()) {
    if (semaphore == nullptr) return 2;
    return quelta_runtime::SemaphoreWaitUntilUnless(semaphore, deadline, abandon);
}

void PalSemaphoreWakeAll(PalSemaphore* semaphore) {
    if (semaphore == nullptr) return;
    pthread_mutex_lock(&semaphore->mutex);
    pthread_cond_broadcast(&semaphore->condition);
    pthread_mutex_unlock(&semaphore->mutex);
}

int32_t PalSemaphorePost(PalSemaphore* semaphore) {
    if (semaphore == nullptr) return EINVAL;
    return quelta_runtime::SemaphorePost(semaphore);
}

int32_t PalSemaphoreDestroy(PalSemaphore* semaphore) {
    if (semaphore == nullptr) return EINVAL;
    // Takes a pending post, if any, so that nothing is left behind.
    PalSemaphoreWait(semaphore, 0);
    const int condResult = pthread_cond_destroy(&semaphore->condition);
    const int mutexResult = pthread_mutex_destroy(&semaphore->mutex);
    PalMemFree(semaphore);
    return condResult != 0 ? condResult : mutexResult;
}

}  // namespace quelta
