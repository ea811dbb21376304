/* The public headers under plain ISO C11 (no POSIX or GNU feature macros),
 * pedantic and warning-free; linked into c_api_c. */
#include <quelta/quelta.h>
#include <quelta/version.h>

uint32_t strict_clocktime_size(void);

uint32_t strict_clocktime_size(void) {
    const ClockTime never = {QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};
    iKPusTimingEngine* (*engine)(void) = GetEngine__MERIDOX;
    (void)engine;
    return (uint32_t)sizeof never;
}
