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

#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace quelta {

namespace {

// Now on CLOCK_MONOTONIC plus timeoutMs (not negative), normalised.
timespec MonotonicDeadline(int32_t timeoutMs) {
    timespec deadline{};
    clock_gettime(CLOCK_MONOTONIC, &deadline);
    deadline.tv_sec += timeoutMs / 1000;
    deadline.tv_nsec += static_cast<long>(timeoutMs % 1000) * 1000000L;
    if (deadline.tv_nsec >= 1000000000L) {
        deadline.tv_sec += 1;
        deadline.tv_nsec -= 1000000000L;
    }
    return deadline;
}

}  // namespace

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

uint32_t PalSemaphoreWait(PalSemaphore* semaphore, int32_t timeoutMs) {
    if (timeoutMs < 0) return PalSemaphoreWaitUntil(semaphore, nullptr);
    if (timeoutMs == 0) {
        // Nothing to wait for: a timed wait on an already passed deadline
        // would still sleep until the next timer interrupt (start-up drains
        // 128 semaphores this way). Result and counters are the same.
        if (semaphore == nullptr) return 2;
        pthread_mutex_lock(&semaphore->mutex);
        const bool taken = semaphore->count != 0;
        if (taken) --semaphore->count;
        pthread_mutex_unlock(&semaphore->mutex);
        return taken ? 0 : 1;
    }
    const timespec deadline = MonotonicDeadline(timeoutMs);
    return PalSemaphoreWaitUntil(semaphore, &deadline);
}

uint32_t PalSemaphoreWaitUntil(PalSemaphore* semaphore, const timespec* deadline) {
    if (semaphore == nullptr) return 2;
    pthread_mutex_lock(&semaphore->mutex);
    if (semaphore->count != 0) {
        --semaphore->count;
        pthread_mutex_unlock(&semaphore->mutex);
        return 0;
    }

    ++semaphore->waiters;
    int result = 0;
    if (deadline == nullptr) {
        do {
            result = pthread_cond_wait(&semaphore->condition, &semaphore->mutex);
        } while (result == 0 && semaphore->count == 0);
    } else {
        // The condition runs on CLOCK_MONOTONIC, so a step of the wall clock
        // neither shortens nor stretches the wait. Spurious wake-ups wait
        // again for the same deadline.
        do {
            result = pthread_cond_timedwait(&semaphore->condition, &semaphore->mutex, deadline);
        } while (result == 0 && semaphore->count == 0);
    }

    uint32_t outcome;
    if (result == 0) {
        --semaphore->waiters;
        --semaphore->count;
        outcome = 0;
    } else {
        // This waiter leaves without a post, even one that came in while it
        // was timing out; the post stays for the next wait, but the count
        // must come back within the bound now that one waiter fewer exists.
        --semaphore->waiters;
        if (semaphore->count - semaphore->waiters > 1) --semaphore->count;
        outcome = (result == ETIMEDOUT) ? 1u : 2u;
    }
    pthread_mutex_unlock(&semaphore->mutex);
    return outcome;
}

int32_t PalSemaphorePost(PalSemaphore* semaphore) {
    if (semaphore == nullptr) return EINVAL;
    pthread_mutex_lock(&semaphore->mutex);
    if (semaphore->count <= semaphore->waiters) ++semaphore->count;
    int result = 0;
    // Signalled with the mutex held: the waiter cannot have left between the
    // check of waiters and the signal.
    if (semaphore->waiters >= 1) result = pthread_cond_signal(&semaphore->condition);
    pthread_mutex_unlock(&semaphore->mutex);
    return result;
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
