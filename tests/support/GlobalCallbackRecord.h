// A SetCallback function for tests of global-clock callback times: it stores
// the global clock's reading (engine slot 2) at the moment it runs into the
// std::atomic<uint64_t> given as its argument (0 until then).
#ifndef QUELTA_TESTS_GLOBALCALLBACKRECORD_H
#define QUELTA_TESTS_GLOBALCALLBACKRECORD_H

#include <atomic>
#include <cstdint>

#include "engine/ClockTimeOps.h"
#include "quelta/quelta.h"

namespace testsupport {

inline void StoreGlobalNow(void* word) {
    ClockTime g;
    GetEngine__MERIDOX()->ReadGlobal2(g);
    static_cast<std::atomic<uint64_t>*>(word)->store(quelta::ToU64(g));
}

}  // namespace testsupport

#endif
