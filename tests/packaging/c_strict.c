/* The public headers under plain ISO C11 (no feature macros), pedantic and warning-free. */
#include <quelta/quelta.h>
#include <quelta/version.h>

iKPusTimingEngine* (*const strict_engine)(void) = GetEngine__MERIDOX;
const ClockTime strict_never = {QUELTA_NEVER_LOW, QUELTA_NEVER_HIGH};
