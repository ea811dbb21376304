// The shared records as a runtime built with the C library's default time
// interfaces sees them (32-bit time_t on a 32-bit target): this file alone
// leaves out the build's 64-bit time settings.
#undef _TIME_BITS
#undef _FILE_OFFSET_BITS
#include "Time32Layout.h"

#include <cstddef>

#include "quelta/PalSemaphore.h"

namespace testsupport {

RecordLayout PalSemaphoreLayoutWith32BitTime() {
    return RecordLayout{sizeof(PalSemaphore), offsetof(PalSemaphore, mutex), offsetof(PalSemaphore, count),
                        offsetof(PalSemaphore, waiters), sizeof(time_t)};
}

}  // namespace testsupport
