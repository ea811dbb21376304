// The library's own 64-bit multiplication and division on ClockTime records,
// built from 32-bit operations, shifts and adds only (no runtime division
// routine). Both work in place.
#ifndef QUELTA_ENGINE_U64ARITH_H
#define QUELTA_ENGINE_U64ARITH_H

#include "quelta/ClockTime.h"

namespace quelta {

// value = value * multiplier mod 2^64.
void U64MulU32(ClockTime& value, uint32_t multiplier);

// dividend <- quotient, divisor <- remainder. Divisor 0: quotient 0,
// remainder the dividend. A dividend whose high word is 0xFFFFFFFF ranks below
// every divisor whose high word is not (ClockTime order): quotient 0.
void U64DivMod(ClockTime& dividend, ClockTime& divisor);

}  // namespace quelta

#endif
