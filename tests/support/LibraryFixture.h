// One loaded libquelta.so.6 shared by the tests of a suite, with the helpers
// those tests keep needing.
#ifndef QUELTA_TESTS_LIBRARYFIXTURE_H
#define QUELTA_TESTS_LIBRARYFIXTURE_H

#include <gtest/gtest.h>

#include <vector>

#include "LoadedLibrary.h"
#include "TestSupport.h"
#include "tLinux/PalSemaphoreOps.h"

namespace testsupport {

// Posts not yet taken, taking them all.
inline int Drain(PalSemaphore* s) {
    int n = 0;
    while (quelta::PalSemaphoreWait(s, 0) == 0) ++n;
    return n;
}

// Exactly 128 nodes can be taken (and are given back); the 129th is refused.
// `whileFull` runs while all 128 are held.
template <typename F>
void ExpectPoolWhole(const LoadedLibrary& lib, F whileFull) {
    PalSemaphore* s = NewRuntimeSemaphore();
    ClockTime now;
    lib.engine()->ReadMonotonic0(now);
    const ClockTime far = CT(U64(now) + 60000ull * 1000000ull);
    std::vector<WaitNode*> nodes(128);
    for (WaitNode*& n : nodes) ASSERT_EQ(lib.api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &n), 0u);
    WaitNode* extra = nullptr;
    EXPECT_EQ(lib.api().EventWaitCallback(s, &far, nullptr, nullptr, 0, &extra), 3u);
    whileFull(s);
    for (WaitNode* n : nodes) lib.engine()->ReleaseWait(n);  // cancels
    DeleteRuntimeSemaphore(s);
}

class LibraryFixture : public ::testing::Test {
protected:
    static void SetUpTestSuite() { lib = new LoadedLibrary(); }
    static void TearDownTestSuite() { delete lib, lib = nullptr; }
    void SetUp() override { ASSERT_TRUE(lib->ok()) << lib->error(); }
    const QueltaApi& api() { return lib->api(); }
    iKPusTimingEngine* engine() { return lib->engine(); }
    uint64_t MonoNow() {
        ClockTime t;
        engine()->ReadMonotonic0(t);
        return U64(t);
    }
    uint64_t GlobalNow() {
        ClockTime g;
        engine()->ReadGlobal2(g);
        return U64(g);
    }
    template <typename F>
    void ExpectPoolWhole(F whileFull) { testsupport::ExpectPoolWhole(*lib, whileFull); }
    void ExpectPoolWhole() { ExpectPoolWhole([](PalSemaphore*) {}); }
    static inline LoadedLibrary* lib = nullptr;
};

}  // namespace testsupport

#endif
