// Seconds from 1904-01-01 to 1970-01-01 in the local zone (2,082,844,800 in a
// zone whose offset from UTC was the same at both dates).
#ifndef QUELTA_ENGINE_EPOCHOFFSET_H
#define QUELTA_ENGINE_EPOCHOFFSET_H

#include <cstdint>

namespace quelta {

int32_t ComputeEpochOffset();

}  // namespace quelta

#endif
