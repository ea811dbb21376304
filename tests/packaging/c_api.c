/* The public headers as C11 (c_api.cpp: as C++), pedantic, in a linked program: version macros, a C callback,
 * a plain wait not early. Prints OK. (c_strict.c: plain C11.) */
#ifndef _XOPEN_SOURCE
#define _XOPEN_SOURCE 700
#endif
#include <quelta/quelta.h>
#include <quelta/version.h>

#include <stdio.h>
#include <string.h>
#include <time.h>

static uint32_t on_deadline(void* fired) { /* on the timer thread; gives the node back */
    __atomic_store_n((int*)fired, 1, __ATOMIC_RELEASE);
    return 1;
}

int main(void) {
    char version[32], soname[32];
    int fired = 0;
    struct timespec ts;
    uint64_t now, at;
    uint32_t waited, queued;
    ClockTime deadline;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    now = (uint64_t)ts.tv_sec * 1000000000u + (uint64_t)ts.tv_nsec, at = now + 1000000u;
    deadline.low = (uint32_t)at, deadline.high = (uint32_t)(at >> 32);
    queued = quelta_iTSCEvent_Wait_Callback_C(NULL, &deadline, on_deadline, &fired, 0, NULL); /* 1: no timer */
    waited = quelta_iTSC_WaitClocks_C(3000000) - (uint32_t)now; /* returns the low word of the time after it */
    snprintf(version, sizeof version, "%d.%d.%d", QUELTA_VERSION_MAJOR, QUELTA_VERSION_MINOR, QUELTA_VERSION_PATCH);
    snprintf(soname, sizeof soname, "libquelta.so.%d", QUELTA_VERSION_MAJOR);
    if (strcmp(version, QUELTA_EXPECTED_VERSION) || strcmp(QUELTA_VERSION_STRING, version) || strcmp(QUELTA_SONAME, soname) ||
        waited < 3000000u || waited > 1000000000u || !(queued == 1 || (queued == 0 && __atomic_load_n(&fired, __ATOMIC_ACQUIRE)))) {
        printf("FAIL: %s %s %s, waited %u ns, queued %u\n", version, QUELTA_VERSION_STRING, QUELTA_SONAME, waited, queued);
        return 1;
    }
    return puts("OK") < 0;
}
