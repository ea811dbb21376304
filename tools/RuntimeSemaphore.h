// The runtime's side of the semaphores passed to the library's event waits:
// the probe is a runtime, so it uses the reference implementation that ships
// with the library's public headers.
#ifndef QUELTA_TOOLS_RUNTIMESEMAPHORE_H
#define QUELTA_TOOLS_RUNTIMESEMAPHORE_H

#include <cstdint>

#include "quelta/RuntimeSemaphore.h"

namespace qtools {

inline int RuntimeSemaphoreCreate(PalSemaphore** out) { return quelta_runtime::SemaphoreCreate(out); }
inline uint32_t RuntimeSemaphoreWait(PalSemaphore* s, int32_t timeoutMs) {
    return quelta_runtime::SemaphoreWait(s, timeoutMs);
}
inline int RuntimeSemaphorePost(PalSemaphore* s) { return quelta_runtime::SemaphorePost(s); }
inline int32_t RuntimeSemaphorePending(PalSemaphore* s) { return quelta_runtime::SemaphorePending(s); }
inline int RuntimeSemaphoreDestroy(PalSemaphore* s) { return quelta_runtime::SemaphoreDelete(s); }

}  // namespace qtools

#endif
