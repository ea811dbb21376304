// This file alone leaves out the build's 64-bit time settings: the C
// library's default time interfaces (32-bit time_t on a 32-bit target).
#undef _TIME_BITS
#undef _FILE_OFFSET_BITS
#include "Time32Layout.h"

#include "quelta/PalSemaphore.h"

namespace testsupport {

RecordLayout PalSemaphoreLayoutWith32BitTime() {
    return RecordLayout{sizeof(PalSemaphore), offsetof(PalSemaphore, mutex), offsetof(PalSemaphore, count),
                        offsetof(PalSemaphore, waiters), sizeof(time_t)};
}

}  // namespace testsupport
