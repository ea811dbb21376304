// The layout of the record shared with the runtime, as compiled without the
// library's 64-bit time settings (see Time32Layout.cpp).
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
