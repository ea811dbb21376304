// The shared semaphore record as a runtime built without the library's 64-bit
// time settings sees it (see Time32Layout.cpp).
#ifndef QUELTA_TESTS_TIME32LAYOUT_H
#define QUELTA_TESTS_TIME32LAYOUT_H

#include <cstddef>

namespace testsupport {

struct RecordLayout {
    size_t size, mutexOffset, countOffset, waitersOffset;
    size_t timeTSize;  // sizeof(time_t) where the layout was taken
};
RecordLayout PalSemaphoreLayoutWith32BitTime();

}  // namespace testsupport

#endif
