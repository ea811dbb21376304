/* The exported interface from C. <quelta/quelta.h> and <quelta/version.h>
 * compile as C11 (this file) and as C++ (c_api.cpp compiles this same file),
 * warning-free and pedantic, and a program linked against libquelta calls
 * through the declarations: a plain wait, the refusals, and a wait-node
 * callback written in C that posts a semaphore made with plain pthreads.
 * Prints OK and exits 0 when every check holds.
 *
 * QUELTA_EXPECTED_VERSION is the project version, passed by the build.
 * The test itself needs POSIX beyond C11 (clocks, priority inheritance);
 * c_strict.c includes the headers under plain C11. */
#ifndef _XOPEN_SOURCE
#define _XOPEN_SOURCE 700
#endif
#include <quelta/quelta.h>
#include <quelta/version.h>

#include <pthread.h>
#include <stddef.h>
#include <stdio.h>
#include <string.h>
#include <time.h>

#ifdef __cplusplus
#define LAYOUT_CHECK(condition, message) static_assert(condition, message)
#else
#define LAYOUT_CHECK(condition, message) _Static_assert(condition, message)
#endif

/* The records are the library's, word for word. */
LAYOUT_CHECK(sizeof(ClockTime) == 8 && offsetof(ClockTime, low) == 0 && offsetof(ClockTime, high) == 4,
             "ClockTime: low word, then high word");
LAYOUT_CHECK(offsetof(PalSemaphore, mutex) == sizeof(pthread_cond_t) &&
                 offsetof(PalSemaphore, count) == sizeof(pthread_cond_t) + sizeof(pthread_mutex_t) &&
                 offsetof(PalSemaphore, waiters) == offsetof(PalSemaphore, count) + 4,
             "PalSemaphore: condition, mutex, count, waiters");

static int failures = 0;

#ifdef __cplusplus
static uint32_t strict_clocktime_size(void) { return sizeof(ClockTime); }
#else
uint32_t strict_clocktime_size(void); /* c_strict.c */
#endif

static void check(int ok, const char* what) {
    if (!ok) {
        printf("FAIL: %s\n", what);
        ++failures;
    }
}

static uint64_t monotonic_now(void) {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return (uint64_t)ts.tv_sec * 1000000000u + (uint64_t)ts.tv_nsec;
}

/* A semaphore as a runtime's own platform layer makes one, in C. */
static int semaphore_init(PalSemaphore* s) {
    pthread_mutexattr_t ma;
    pthread_condattr_t ca;
    int rc;
    pthread_mutexattr_init(&ma);
    rc = pthread_mutexattr_setprotocol(&ma, PTHREAD_PRIO_INHERIT);
    if (rc == 0) rc = pthread_mutex_init(&s->mutex, &ma);
    pthread_mutexattr_destroy(&ma);
    if (rc != 0) return rc;
    pthread_condattr_init(&ca);
    rc = pthread_condattr_setclock(&ca, CLOCK_MONOTONIC);
    if (rc == 0) rc = pthread_cond_init(&s->condition, &ca);
    pthread_condattr_destroy(&ca);
    s->count = 0;
    s->waiters = 0;
    return rc;
}

/* Keeps a post only while count <= waiters, as the record's rules say. */
static void semaphore_post(PalSemaphore* s) {
    pthread_mutex_lock(&s->mutex);
    if (s->count <= s->waiters) ++s->count;
    if (s->waiters >= 1) pthread_cond_signal(&s->condition);
    pthread_mutex_unlock(&s->mutex);
}

/* A wait-node callback in C: runs on the timer thread, posts, gives the
 * node back (nonzero). */
static uint32_t on_deadline(void* arg) {
    semaphore_post((PalSemaphore*)arg);
    return 1;
}

int main(void) {
    char version[32];
    iKPusTimingEngine* engine = GetEngine__MERIDOX();
    iKPLogEngine* log = GetLogEngine__MERIDOX();
    uint64_t before;
    uint32_t after;
    PalSemaphore semaphore;
    ClockTime deadline;
    uint32_t r;

    snprintf(version, sizeof version, "%d.%d.%d", QUELTA_VERSION_MAJOR, QUELTA_VERSION_MINOR,
             QUELTA_VERSION_PATCH);
    check(strcmp(version, QUELTA_EXPECTED_VERSION) == 0, "version macros name the project version");
    check(strcmp(QUELTA_VERSION_STRING, QUELTA_EXPECTED_VERSION) == 0, "QUELTA_VERSION_STRING");
    snprintf(version, sizeof version, "libquelta.so.%d", QUELTA_VERSION_MAJOR);
    check(strcmp(QUELTA_SONAME, version) == 0, "QUELTA_SONAME names the major version");

    check(strict_clocktime_size() == 8, "plain C11 sees the same ClockTime");
    check(engine != NULL && log != NULL, "the accessors hand out both engines");
    check(quelta_iTSC_GetCPUSpeed_C() == 1000, "GetCPUSpeed is 1000 ticks per microsecond");
    check(quelta_iTSC_GetCPUTicksPerMS_C() == 1000000, "GetCPUTicksPerMS is 1,000,000");

    /* A plain wait of 2 ms returns the low word of the time after it. */
    before = monotonic_now();
    after = quelta_iTSC_WaitClocks_C(2000000);
    check((uint32_t)(after - (uint32_t)before) >= 2000000u, "a 2 ms plain wait is not early");
    check((uint32_t)(monotonic_now() - after) < 1000000000u, "it returns the monotonic low word");

    /* Refusals. */
    check(quelta_iTSCEvent_Wait_C(NULL, 0) == 3, "a null semaphore is refused with 3");
    check(quelta_iTSCEvent_Wait_Callback_C(NULL, NULL, NULL, NULL, 0, NULL) == 3,
          "a null deadline is refused with 3");
    check(quelta_iTSC_SetCallbackTime(NULL, 0) == 0, "a null callback time is refused with 0");

    /* A deadline 1 ms ahead whose C callback posts the semaphore. Without
     * real-time privilege there is no timer (result 1) and nothing fires. */
    check(semaphore_init(&semaphore) == 0, "semaphore created");
    before = monotonic_now() + 1000000u;
    deadline.low = (uint32_t)before;
    deadline.high = (uint32_t)(before >> 32);
    r = quelta_iTSCEvent_Wait_Callback_C(NULL, &deadline, on_deadline, &semaphore, 0, NULL);
    check(r == 0 || r == 1, "a deadline with a callback is queued (or refused for want of a timer)");
    if (r == 0) {
        check(quelta_iTSCEvent_Wait_C(&semaphore, 2000000) == 0, "the C callback posted the semaphore");
        check(monotonic_now() >= before, "and not before its deadline");
    } else {
        puts("note: no timer thread (no real-time privilege); callback not exercised");
    }
    pthread_cond_destroy(&semaphore.condition);
    pthread_mutex_destroy(&semaphore.mutex);

    if (failures != 0) return 1;
    puts("OK");
    return 0;
}
