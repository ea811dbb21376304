// A runtime's own counting semaphore, compatible with libquelta's: a small
// reference implementation, header only, for runtimes that have no platform
// layer of their own yet.
//
// A runtime creates the semaphores it hands to quelta_iTSCEvent_Wait_C with
// its own platform layer. The library then waits on them on the caller's
// thread, and its timer thread posts them when a timeout expires, so both
// sides must agree on the record and on the rules:
//
//  - the record is struct PalSemaphore from <quelta/PalSemaphore.h>:
//    condition, mutex, count, waiters, in that order;
//  - the condition variable measures time on CLOCK_MONOTONIC, and the mutex
//    inherits priority (a real-time waiter boosts whoever holds it);
//  - count and waiters change only with the mutex held;
//  - a post is kept only while count <= waiters, so that count never exceeds
//    waiters + 1: with nobody waiting, a semaphore remembers one post at
//    most; a post signals one waiter when anybody waits;
//  - a wait takes a pending post at once; otherwise it counts itself among
//    the waiters and sleeps until a post is there or its timeout (in
//    milliseconds; negative: none) has passed. A waiter that gives up drops
//    a post that has become surplus. Results: 0 taken, 1 timed out, 2 failed.
#ifndef QUELTA_RUNTIMESEMAPHORE_H
#define QUELTA_RUNTIMESEMAPHORE_H

#include <errno.h>
#include <pthread.h>
#include <stdint.h>
#include <time.h>

#include <stdlib.h>

#include "quelta/PalSemaphore.h"

namespace quelta_runtime {

// Initialises a semaphore in place, with nothing pending and nobody waiting.
// Returns 0 or the error of the failing initialisation.
inline int SemaphoreInit(PalSemaphore* s) {
    pthread_mutexattr_t mutexAttr;
    pthread_mutexattr_init(&mutexAttr);
    int rc = pthread_mutexattr_setprotocol(&mutexAttr, PTHREAD_PRIO_INHERIT);
    if (rc == 0) rc = pthread_mutex_init(&s->mutex, &mutexAttr);
    pthread_mutexattr_destroy(&mutexAttr);
    if (rc != 0) return rc;

    pthread_condattr_t condAttr;
    pthread_condattr_init(&condAttr);
    rc = pthread_condattr_setclock(&condAttr, CLOCK_MONOTONIC);
    if (rc == 0) rc = pthread_cond_init(&s->condition, &condAttr);
    pthread_condattr_destroy(&condAttr);
    if (rc != 0) {
        pthread_mutex_destroy(&s->mutex);
        return rc;
    }
    s->count = 0;
    s->waiters = 0;
    return 0;
}

// Only when no thread waits on it any longer, and no pending library wait
// can post it.
inline int SemaphoreDestroy(PalSemaphore* s) {
    const int c = pthread_cond_destroy(&s->condition);
    const int m = pthread_mutex_destroy(&s->mutex);
    return c != 0 ? c : m;
}

inline int SemaphorePost(PalSemaphore* s) {
    pthread_mutex_lock(&s->mutex);
    if (s->count <= s->waiters) ++s->count;  // else dropped: count <= waiters + 1
    int rc = 0;
    if (s->waiters >= 1) rc = pthread_cond_signal(&s->condition);
    pthread_mutex_unlock(&s->mutex);
    return rc;
}

// Now on `clock` plus a timeout in milliseconds (not negative), normalised.
inline timespec DeadlineAfterMs(clockid_t clock, int32_t timeoutMs) {
    timespec deadline{};
    clock_gettime(clock, &deadline);
    deadline.tv_sec += timeoutMs / 1000;
    deadline.tv_nsec += static_cast<long>(timeoutMs % 1000) * 1000000L;
    if (deadline.tv_nsec >= 1000000000L) {
        deadline.tv_sec += 1;
        deadline.tv_nsec -= 1000000000L;
    }
    return deadline;
}

// Waits until a post is there or the absolute CLOCK_MONOTONIC deadline has
// passed (null: no deadline), unless `abandon()` turns true first: it is asked
// with the mutex held before the first wait and after every wake-up, and a
// waiter that abandons takes no post and returns 3. Spurious wake-ups wait
// again for the same deadline; the clock is monotonic, so a step of the wall
// clock neither shortens nor stretches the wait.
template <class Abandon>
inline uint32_t SemaphoreWaitUntilUnless(PalSemaphore* s, const timespec* deadline, Abandon abandon) {
    pthread_mutex_lock(&s->mutex);
    if (s->count != 0) {
        --s->count;
        pthread_mutex_unlock(&s->mutex);
        return 0;
    }
    ++s->waiters;
    int rc = 0;
    bool abandoned = false;
    while (rc == 0 && s->count == 0) {
        if (abandon()) {
            abandoned = true;
            break;
        }
        rc = deadline == nullptr ? pthread_cond_wait(&s->condition, &s->mutex)
                                 : pthread_cond_timedwait(&s->condition, &s->mutex, deadline);
    }
    --s->waiters;
    uint32_t result = 0;
    if (rc == 0 && !abandoned) {
        --s->count;
    } else {
        // This waiter leaves without a post, even one that came in while it
        // was timing out; that post stays, but count must come back within
        // waiters + 1 now that one waiter fewer exists.
        if (s->count - s->waiters > 1) --s->count;
        result = abandoned ? 3 : rc == ETIMEDOUT ? 1 : 2;
    }
    pthread_mutex_unlock(&s->mutex);
    return result;
}

inline uint32_t SemaphoreWaitUntil(PalSemaphore* s, const timespec* deadline) {
    return SemaphoreWaitUntilUnless(s, deadline, [] { return false; });
}

inline uint32_t SemaphoreWait(PalSemaphore* s, int32_t timeoutMs) {
    if (timeoutMs < 0) return SemaphoreWaitUntil(s, nullptr);
    if (timeoutMs == 0) {
        // Nothing to wait for: a timed wait on a passed deadline would still
        // sleep until the next timer interrupt. Same result and counters.
        pthread_mutex_lock(&s->mutex);
        const bool taken = s->count != 0;
        if (taken) --s->count;
        pthread_mutex_unlock(&s->mutex);
        return taken ? 0 : 1;
    }
    const timespec deadline = DeadlineAfterMs(CLOCK_MONOTONIC, timeoutMs);
    return SemaphoreWaitUntil(s, &deadline);
}

// Posts not yet taken (read under the mutex).
inline int32_t SemaphorePending(PalSemaphore* s) {
    pthread_mutex_lock(&s->mutex);
    const int32_t n = s->count;
    pthread_mutex_unlock(&s->mutex);
    return n;
}

// A semaphore on the heap: 0, or the error of the allocation (ENOMEM) or of
// the initialisation (*out untouched then).
inline int SemaphoreCreate(PalSemaphore** out) {
    PalSemaphore* s = static_cast<PalSemaphore*>(malloc(sizeof(PalSemaphore)));
    if (s == nullptr) return ENOMEM;
    const int rc = SemaphoreInit(s);
    if (rc != 0) {
        free(s);
        return rc;
    }
    *out = s;
    return 0;
}

// Takes a pending post if there is one, destroys and frees; 22 for null.
inline int SemaphoreDelete(PalSemaphore* s) {
    if (s == nullptr) return EINVAL;
    SemaphoreWait(s, 0);
    const int rc = SemaphoreDestroy(s);
    free(s);
    return rc;
}

}  // namespace quelta_runtime

#endif
