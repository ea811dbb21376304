// Loading, running and unloading the built libquelta.so.6 as a runtime does.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <cctype>
#include <cstdio>
#include <set>
#include <sstream>
#include <string>

#include "LoadedLibrary.h"
#include "TestSupport.h"

using testsupport::LoadedLibrary;

namespace {

std::string Capture(const std::string& command) {
    std::string out;
    FILE* p = popen(command.c_str(), "r");
    if (p == nullptr) return out;
    char buf[4096];
    size_t n;
    while ((n = fread(buf, 1, sizeof buf, p)) > 0) out.append(buf, n);
    pclose(p);
    return out;
}

TEST(LibraryExports, OnlyTheRuntimeInterfaceIsExported) {
    const std::string table = Capture(std::string("readelf --dyn-syms -W ") + QUELTA_SO_PATH);
    ASSERT_FALSE(table.empty());
    const std::set<std::string> expected = {
        "quelta_iTSC_WaitUntilClocks_C", "quelta_iTSC_WaitUntilClocks64_C",
        "quelta_iTSC_WaitClocks_C", "quelta_iTSC_WaitUntilNextMultipleClocks_C",
        "quelta_iTSC_WaitMicroSeconds_C", "quelta_iTSC_WaitUntilMicroSeconds_C",
        "quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C", "quelta_iTSC_GetCPUSpeed_C",
        "quelta_iTSC_GetCPUTicksPerMS_C", "quelta_iTSC_WaitUntilGlobalClocks64_C",
        "quelta_iTSCEvent_Wait_C", "quelta_iTSCEvent_Wait_Callback_C",
        "quelta_iTSC_SetCallback", "quelta_iTSC_SetCallbackTime",
        "GetEngine__MERIDOX", "GetLogEngine__MERIDOX"};
    const std::set<std::string> typeInfo = {
        "_ZTI17iKPusTimingEngine", "_ZTS17iKPusTimingEngine", "_ZTI12iKPLogEngine",
        "_ZTS12iKPLogEngine", "_ZTI15iKPusLinuxTimer", "_ZTS15iKPusLinuxTimer"};
    std::set<std::string> defined;
    std::istringstream lines(table);
    std::string line;
    while (std::getline(lines, line)) {
        std::istringstream f(line);
        std::string num, value, size, type, bind, vis, ndx, name;
        if (!(f >> num >> value >> size >> type >> bind >> vis >> ndx)) continue;
        if (num.empty() || num.back() != ':' || !isdigit(static_cast<unsigned char>(num[0]))) continue;
        EXPECT_NE(bind, "UNIQUE") << "a unique symbol keeps the library mapped: " << line;
        if (ndx == "UND" || !(f >> name)) continue;
        if (bind == "LOCAL") continue;  // section symbols some targets list
        name = name.substr(0, name.find('@'));
        defined.insert(name);
    }
    for (const std::string& name : expected) EXPECT_TRUE(defined.count(name)) << "missing " << name;
    for (const std::string& name : defined) {
        EXPECT_TRUE(expected.count(name) || typeInfo.count(name)) << "exported but private: " << name;
        EXPECT_NE(name.rfind("Pal", 0), 0u) << name;
    }
}

TEST(LibraryExports, SonameIsLibquelta6) {
    const std::string dyn = Capture(std::string("readelf -d ") + QUELTA_SO_PATH);
    EXPECT_NE(dyn.find("Library soname: [libquelta.so.6]"), std::string::npos) << dyn;
}

std::atomic<uint64_t> gTicks{0};
void CountTick(uint64_t) { gTicks.fetch_add(1); }

TEST(LibraryLifetime, LoadStartsEverythingAndTicksEveryMillisecond) {
    LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    ASSERT_NE(lib.engine(), nullptr);
    ASSERT_NE(lib.log(), nullptr);
    EXPECT_EQ(lib.api().GetCPUSpeed(), 1000u);
    EXPECT_EQ(lib.api().GetCPUTicksPerMS(), 1000000u);
    EXPECT_EQ(lib.engine()->UsesTickService(), 1u);
    gTicks = 0;
    lib.engine()->RegisterTickCallback(CountTick);
    const uint64_t start = testsupport::MonoNowNs();
    while (testsupport::MonoNowNs() - start < 1000000000ull) {
        lib.api().WaitMicroSeconds(50000);
    }
    lib.engine()->UnregisterTickCallback(CountTick);
    const uint64_t ticks = gTicks.load();
    const uint64_t elapsedMs = (testsupport::MonoNowNs() - start) / 1000000;
    std::printf("ticks in one second: %llu\n", static_cast<unsigned long long>(ticks));
    // One tick per millisecond. A late pass restarts the grid at once (one
    // extra tick right behind it) and never replays the missed ones.
    EXPECT_GT(ticks, elapsedMs / 2);
    EXPECT_LE(ticks, elapsedMs + elapsedMs / 10 + 5);
}

TEST(LibraryLifetime, EpochOffsetInUtcIs1904) {
    setenv("TZ", "UTC", 1);
    LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    ClockTime g;
    const uint64_t before = testsupport::RealNowNs();
    lib.engine()->ReadGlobal2(g);
    const uint64_t after = testsupport::RealNowNs();
    const uint64_t offset = 2082844800ull * 1000000000ull;
    const uint64_t global = (static_cast<uint64_t>(g.high) << 32) | g.low;
    EXPECT_GE(global, before + offset);
    EXPECT_LE(global, after + offset);
    unsetenv("TZ");
}

TEST(LibraryLifetime, RepeatedLoadUnloadLeavesNothingBehind) {
    { LoadedLibrary warm; ASSERT_TRUE(warm.ok()) << warm.error(); }
    const int threads = testsupport::CountThreads();
    const int fds = testsupport::CountOpenFds();
    for (int i = 0; i < 20; ++i) {
        const uint64_t t0 = testsupport::MonoNowNs();
        {
            LoadedLibrary lib;
            ASSERT_TRUE(lib.ok()) << lib.error();
            ASSERT_NE(lib.engine(), nullptr);
            EXPECT_EQ(testsupport::CountThreads(), threads + 1);  // the timer thread
        }
        EXPECT_LT(testsupport::MonoNowNs() - t0, 2000000000ull) << "load+unload took too long";
        EXPECT_EQ(testsupport::CountThreads(), threads);
        EXPECT_EQ(testsupport::CountOpenFds(), fds);
    }
    // After dlclose the library is really gone from the process.
    EXPECT_EQ(dlopen(QUELTA_SO_PATH, RTLD_NOW | RTLD_NOLOAD), nullptr);
}

}  // namespace
