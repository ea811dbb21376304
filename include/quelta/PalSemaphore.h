// PalSemaphore: the counting semaphore on which every waiter blocks.
//
// The layout is shared with the runtime: the runtime creates the semaphores
// it passes to the event waits with its own platform layer, and this library
// posts and waits on them. Fields, in order, must not change.
#ifndef QUELTA_PALSEMAPHORE_H
#define QUELTA_PALSEMAPHORE_H

#include <pthread.h>
#include <stdint.h>

struct PalSemaphore {
    pthread_cond_t condition;  // clock CLOCK_MONOTONIC
    pthread_mutex_t mutex;     // PTHREAD_PRIO_INHERIT; guards count and waiters
    int32_t count;             // posts not yet taken; never above waiters + 1
    int32_t waiters;           // threads inside the wait that took no post yet
};

#endif
