#include "RuntimeSemaphore.h"

#include <errno.h>
#include <time.h>

#include <cstdlib>

namespace qtools {

namespace {

timespec DeadlineAfterMs(int32_t timeoutMs) {
    timespec t{};
    clock_gettime(CLOCK_MONOTONIC, &t);
    t.tv_sec += timeoutMs / 1000;
    t.tv_nsec += static_cast<long>(timeoutMs % 1000) * 1000000L;
    if (t.tv_nsec >= 1000000000L) {
        t.tv_sec += 1;
        t.tv_nsec -= 1000000000L;
    }
    return t;
}

}  // namespace

int RuntimeSemaphoreCreate(PalSemaphore** out) {
    if (out == nullptr) return EINVAL;
    auto* s = static_cast<PalSemaphore*>(std::calloc(1, sizeof(PalSemaphore)));
    if (s == nullptr) return ENOMEM;

    pthread_mutexattr_t ma;
    pthread_mutexattr_init(&ma);
    pthread_mutexattr_setprotocol(&ma, PTHREAD_PRIO_INHERIT);
    int r = pthread_mutex_init(&s->mutex, &ma);
    pthread_mutexattr_destroy(&ma);
    if (r != 0) {
        std::free(s);
        return r;
    }

    pthread_condattr_t ca;
    pthread_condattr_init(&ca);
    pthread_condattr_setclock(&ca, CLOCK_MONOTONIC);
    r = pthread_cond_init(&s->condition, &ca);
    pthread_condattr_destroy(&ca);
    if (r != 0) {
        pthread_mutex_destroy(&s->mutex);
        std::free(s);
        return r;
    }
    s->count = 0;
    s->waiters = 0;
    *out = s;
    return 0;
}

uint32_t RuntimeSemaphoreWait(PalSemaphore* s, int32_t timeoutMs) {
    if (s == nullptr) return 2;
    pthread_mutex_lock(&s->mutex);
    if (s->count != 0) {
        --s->count;
        pthread_mutex_unlock(&s->mutex);
        return 0;
    }
    ++s->waiters;
    int r = 0;
    if (timeoutMs < 0) {
        do {
            r = pthread_cond_wait(&s->condition, &s->mutex);
        } while (r == 0 && s->count == 0);
    } else {
        const timespec deadline = DeadlineAfterMs(timeoutMs);
        do {
            r = pthread_cond_timedwait(&s->condition, &s->mutex, &deadline);
        } while (r == 0 && s->count == 0);
    }
    uint32_t outcome = 0;
    --s->waiters;
    if (r == 0) {
        --s->count;
    } else {
        if (s->count - s->waiters > 1) --s->count;
        outcome = r == ETIMEDOUT ? 1u : 2u;
    }
    pthread_mutex_unlock(&s->mutex);
    return outcome;
}

int RuntimeSemaphorePost(PalSemaphore* s) {
    if (s == nullptr) return EINVAL;
    pthread_mutex_lock(&s->mutex);
    if (s->count <= s->waiters) ++s->count;
    int r = 0;
    if (s->waiters >= 1) r = pthread_cond_signal(&s->condition);
    pthread_mutex_unlock(&s->mutex);
    return r;
}

int32_t RuntimeSemaphorePending(PalSemaphore* s) {
    if (s == nullptr) return 0;
    pthread_mutex_lock(&s->mutex);
    const int32_t n = s->count;
    pthread_mutex_unlock(&s->mutex);
    return n;
}

int RuntimeSemaphoreDestroy(PalSemaphore* s) {
    if (s == nullptr) return EINVAL;
    RuntimeSemaphoreWait(s, 0);
    const int c = pthread_cond_destroy(&s->condition);
    const int m = pthread_mutex_destroy(&s->mutex);
    std::free(s);
    return c != 0 ? c : m;
}

}  // namespace qtools
