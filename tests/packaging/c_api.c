/* The public headers as C11 (c_api.cpp: as C++), pedantic, in a linked program: version macros, a C callback
 * fired not early and not lost, a plain wait not early. Prints OK. (c_strict.c: plain C11.) */
#ifndef _XOPEN_SOURCE
#define _XOPEN_SOURCE 700
#endif
#include <quelta/quelta.h>
#include <quelta/version.h>

#include <stdio.h>
#include <string.h>
#include <time.h>

static uint64_t monotonic_ns(void) {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return (uint64_t)ts.tv_sec * 1000000000u + (uint64_t)ts.tv_nsec;
}

static uint32_t on_deadline(void* fired_at) { /* on the timer thread; gives the node back */
    __atomic_store_n((uint64_t*)fired_at, monotonic_ns(), __ATOMIC_RELEASE);
    return 1;
}

int main(void) {
    char version[32], soname[32];
    uint64_t fired_at = 0, now = monotonic_ns(), at = now + 1000000u;
    const struct timespec step = {0, 1000000};
    uint32_t waited, queued, polls;
    ClockTime deadline;
    deadline.low = (uint32_t)at, deadline.high = (uint32_t)(at >> 32);
    queued = quelta_iTSCEvent_Wait_Callback_C(NULL, &deadline, on_deadline, &fired_at, 0, NULL); /* 1: no timer */
    waited = quelta_iTSC_WaitClocks_C(3000000) - (uint32_t)now; /* returns the low word of the time after it */
    /* Never lost, never early; how late is the benches' business (a loaded CI machine can hold it ms). */
    for (polls = 0; queued == 0 && polls < 10000 && !__atomic_load_n(&fired_at, __ATOMIC_ACQUIRE); ++polls) nanosleep(&step, NULL);
    fired_at = __atomic_load_n(&fired_at, __ATOMIC_ACQUIRE);
    snprintf(version, sizeof version, "%d.%d.%d", QUELTA_VERSION_MAJOR, QUELTA_VERSION_MINOR, QUELTA_VERSION_PATCH);
    snprintf(soname, sizeof soname, "libquelta.so.%d", QUELTA_VERSION_MAJOR);
    if (strcmp(version, QUELTA_EXPECTED_VERSION) || strcmp(QUELTA_VERSION_STRING, version) || strcmp(QUELTA_SONAME, soname) ||
        waited < 3000000u || waited > 1000000000u || !(queued == 1 || (queued == 0 && fired_at >= at))) {
        printf("FAIL: %s %s %s, waited %u ns, queued %u, fired %lld ns after the deadline\n", version, QUELTA_VERSION_STRING,
               QUELTA_SONAME, waited, queued, fired_at ? (long long)(fired_at - at) : -1LL);
        return 1;
    }
    return puts("OK") < 0;
}
