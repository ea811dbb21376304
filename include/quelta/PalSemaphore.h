/**
 * \file
 * \brief PalSemaphore: the counting semaphore on which every waiter blocks.
 *
 * The layout is shared with the runtime: the runtime creates the semaphores
 * it passes to the event waits with its own platform layer, and this library
 * posts and waits on them. Fields, in order, must not change.
 *
 * Both sides follow the same rules: the condition variable measures time on
 * `CLOCK_MONOTONIC`; the mutex inherits priority (`PTHREAD_PRIO_INHERIT`);
 * `count` and `waiters` change only with the mutex held; a post is kept only
 * while `count` <= `waiters`, so a semaphore nobody waits on remembers one
 * post at most. `<quelta/RuntimeSemaphore.h>` is a header-only C++ reference
 * implementation of these rules, the one the library itself uses.
 *
 * This header compiles as C (C11) and as C++.
 */
#ifndef QUELTA_PALSEMAPHORE_H
#define QUELTA_PALSEMAPHORE_H

#include <pthread.h>
#include <stdint.h>

/**
 * \brief A counting semaphore whose record both the runtime and the library
 *        use.
 */
struct PalSemaphore {
    pthread_cond_t condition;  ///< Condition on `CLOCK_MONOTONIC`.
    pthread_mutex_t mutex;     ///< `PTHREAD_PRIO_INHERIT`; guards `count` and `waiters`.
    int32_t count;             ///< Posts not yet taken; never above `waiters` + 1.
    int32_t waiters;           ///< Threads inside a wait that took no post yet.
};

#ifndef __cplusplus
typedef struct PalSemaphore PalSemaphore;
#endif

#endif
