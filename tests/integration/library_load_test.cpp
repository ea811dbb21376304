// Loading, ticking and unloading libquelta.so.6 as a runtime does, and what the runtime sees of it besides
// its calls: exports, virtual slots by position, plain type names, no build paths, the shared record's layout.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <cxxabi.h>
#include <fstream>
#include <iterator>
#include <map>
#include <regex>
#include <typeinfo>
#include <cstdio>
#include <cstdlib>
#include <set>
#include <sstream>
#include <string>
#include <thread>

#include "LibraryFixture.h"
#include "TestSupport.h"
#include "Time32Layout.h"
#include "quelta/PalSemaphore.h"

using testsupport::LoadedLibrary;
using testsupport::MonoNowNs;

namespace {

std::string Capture(const std::string& command) {
    std::string out;
    if (FILE* p = popen(command.c_str(), "r")) {
        char buf[4096];
        for (size_t n; (n = fread(buf, 1, sizeof buf, p)) > 0;) out.append(buf, n);
        pclose(p);
    }
    return out;
}

// Exactly the runtime's entries (and the interfaces' type information) are
// exported, no unique symbol keeps the library mapped, and the soname is 6.
TEST(LibraryExports, OnlyTheRuntimeInterfaceIsExported) {
    EXPECT_NE(Capture(std::string("readelf -d ") + QUELTA_SO_PATH).find("Library soname: [libquelta.so.6]"),
              std::string::npos);
    const std::string table = Capture(std::string("readelf --dyn-syms -W ") + QUELTA_SO_PATH);
    ASSERT_FALSE(table.empty());
    const std::set<std::string> expected = {
        "quelta_iTSC_WaitUntilClocks_C", "quelta_iTSC_WaitUntilClocks64_C", "quelta_iTSC_WaitClocks_C",
        "quelta_iTSC_WaitUntilNextMultipleClocks_C", "quelta_iTSC_WaitMicroSeconds_C",
        "quelta_iTSC_WaitUntilMicroSeconds_C", "quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C",
        "quelta_iTSC_GetCPUSpeed_C", "quelta_iTSC_GetCPUTicksPerMS_C", "quelta_iTSC_WaitUntilGlobalClocks64_C",
        "quelta_iTSCEvent_Wait_C", "quelta_iTSCEvent_Wait_Callback_C", "quelta_iTSC_SetCallback",
        "quelta_iTSC_SetCallbackTime", "GetEngine__MERIDOX", "GetLogEngine__MERIDOX"};
    const std::set<std::string> typeInfo = {"_ZTI17iKPusTimingEngine", "_ZTS17iKPusTimingEngine",
                                            "_ZTI12iKPLogEngine",      "_ZTS12iKPLogEngine",
                                            "_ZTI15iKPusLinuxTimer",   "_ZTS15iKPusLinuxTimer"};
    std::set<std::string> defined;
    std::istringstream lines(table);
    for (std::string line; std::getline(lines, line);) {
        std::istringstream f(line);
        std::string num, value, size, type, bind, vis, ndx, name;
        if (!(f >> num >> value >> size >> type >> bind >> vis >> ndx) || num.back() != ':' || !isdigit(num[0])) continue;
        EXPECT_NE(bind, "UNIQUE") << "a unique symbol keeps the library mapped: " << line;
        if (ndx == "UND" || !(f >> name) || bind == "LOCAL") continue;  // LOCAL: section symbols some targets list
        defined.insert(name.substr(0, name.find('@')));
    }
    for (const std::string& name : expected) EXPECT_TRUE(defined.count(name)) << "missing " << name;
    for (const std::string& name : defined) {
        EXPECT_TRUE(expected.count(name) || typeInfo.count(name)) << "exported but private: " << name;
        EXPECT_NE(name.rfind("Pal", 0), 0u) << name;
    }
}

std::atomic<uint64_t> gTicks{0}, gSerialGaps{0}, gLongGaps{0}, gLastSerial{0}, gLastTickAt{0};
void CountTick(uint64_t serial) {
    const uint64_t now = MonoNowNs(), last = gLastTickAt.exchange(now);
    gSerialGaps += gTicks.fetch_add(1) > 0 && serial != gLastSerial.load() + 1;
    gLastSerial = serial;
    gLongGaps += last != 0 && now - last > 1500000;  // more than 1.5 periods: a late pass
}

// Loading starts everything: in UTC, global time since 1904, and a tick every
// millisecond with waits alongside (a late pass restarts the grid with one
// extra tick at once, never replays missed ones). The soak (tests/long) runs
// this for ten minutes, or QUELTA_SOAK_SECONDS.
TEST(LibraryLifetime, LoadStartsEverythingAndTicksKeepTime) {
#ifdef QUELTA_SOAK
    const char* env = std::getenv("QUELTA_SOAK_SECONDS");
    const uint64_t seconds = env ? std::strtoull(env, nullptr, 10) : 600, percent = 95;
#else
    const uint64_t seconds = 1, percent = 50;
#endif
    setenv("TZ", "UTC", 1);
    LoadedLibrary lib;
    unsetenv("TZ");
    ASSERT_TRUE(lib.ok()) << lib.error();
    ASSERT_NE(lib.log(), nullptr);
    EXPECT_EQ(lib.api().GetCPUSpeed(), 1000u);
    EXPECT_EQ(lib.api().GetCPUTicksPerMS(), 1000000u);
    EXPECT_EQ(lib.engine()->UsesTickService(), 1u);
    ClockTime g;
    const uint64_t epoch = 2082844800ull * 1000000000ull, before = testsupport::RealNowNs() + epoch;
    lib.engine()->ReadGlobal2(g);
    EXPECT_GE(testsupport::U64(g), before);
    EXPECT_LE(testsupport::U64(g), testsupport::RealNowNs() + epoch);
    std::atomic<bool> stop{false};
    std::atomic<int> early{0};
    std::thread waiter([&] {
        PalSemaphore* s = testsupport::NewRuntimeSemaphore();
        for (uint32_t timeout = 300; !stop.load(); timeout = timeout % 2000 + 700) {
            const uint64_t t0 = MonoNowNs();
            early += lib.api().EventWait(s, timeout) == 1 && MonoNowNs() < t0 + timeout * 1000ull;
            ClockTime now, after{};
            lib.engine()->ReadGlobal2(now);
            const ClockTime target = testsupport::CT(testsupport::U64(now) + 1700000);
            lib.api().WaitUntilGlobalClocks64(&target, nullptr, &after, 0);
            early += testsupport::U64(after) < testsupport::U64(target);
        }
        testsupport::DeleteRuntimeSemaphore(s);
    });
    lib.engine()->RegisterTickCallback(CountTick);
    const uint64_t start = MonoNowNs();
    while (MonoNowNs() - start < seconds * 1000000000ull) lib.api().WaitMicroSeconds(50000);
    lib.engine()->UnregisterTickCallback(CountTick);
    const uint64_t ticks = gTicks.load(), gaps = gLongGaps.load(), elapsedMs = (MonoNowNs() - start) / 1000000;
    stop = true;
    waiter.join();
    std::printf("%llu ms: %llu ticks, %llu grid restarts\n", static_cast<unsigned long long>(elapsedMs),
                static_cast<unsigned long long>(ticks), static_cast<unsigned long long>(gaps));
    EXPECT_EQ(early.load(), 0);
    EXPECT_EQ(gSerialGaps.load(), 0u);
    EXPECT_LE(ticks, elapsedMs + gaps + elapsedMs / 100 + 5);
    EXPECT_GE(ticks + gaps * 50, elapsedMs * percent / 100);
}

// Each load adds the timer thread; each unload takes it and every descriptor
// away, promptly, and the library leaves the process.
TEST(LibraryLifetime, RepeatedLoadUnloadLeavesNothingBehind) {
    { LoadedLibrary warm; ASSERT_TRUE(warm.ok()) << warm.error(); }
    const int threads = testsupport::CountThreads(), fds = testsupport::CountOpenFds();
    for (int i = 0; i < 50; ++i) {
        const uint64_t t0 = MonoNowNs();
        {
            LoadedLibrary lib;
            ASSERT_TRUE(lib.ok() && lib.engine() != nullptr) << lib.error();
            EXPECT_EQ(testsupport::CountThreads(), threads + 1);
        }
        EXPECT_LT(MonoNowNs() - t0, 2000000000ull) << "load+unload took too long";
        EXPECT_EQ(testsupport::CountThreads(), threads);
        EXPECT_EQ(testsupport::CountOpenFds(), fds);
    }
    EXPECT_EQ(dlopen(QUELTA_SO_PATH, RTLD_NOW | RTLD_NOLOAD), nullptr);
}


// Slot counts as the runtime indexes the tables (the object's first word
// points at slot 0): engine 0-55 and 56 SetClockRateMHz; log 24 operations and
// the two destructors. Each implementation has the interface as single base.
TEST(InterfaceIdentity, EverySlotIsItsOwnEntryPointAndTheTypesAreNamedPlainly) {
    testsupport::LoadedLibrary lib;
    ASSERT_TRUE(lib.ok() && lib.engine() && lib.log()) << lib.error();
    const struct { const void* object; const std::type_info& type; size_t slots; const char *name, *base; } rows[] = {
        {lib.engine(), typeid(*lib.engine()), 57, "17tKPusTimingEngine", "17iKPusTimingEngine"},
        {lib.log(), typeid(*lib.log()), 26, "12tKPLogEngine", "12iKPLogEngine"}};
    Dl_info info{};
    ASSERT_NE(dladdr(reinterpret_cast<const void*>(lib.api().GetEngine), &info), 0);
    const void* base = info.dli_fbase;
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        const void* const* table = *static_cast<const void* const* const*>(row.object);
        std::map<const void*, size_t> seen;
        for (size_t i = 0; i < row.slots; ++i) {
            ASSERT_NE(dladdr(table[i], &info), 0) << "slot " << i;
            EXPECT_EQ(info.dli_fbase, base) << "slot " << i << " outside the library: " << info.dli_fname;
            const auto [it, inserted] = seen.emplace(table[i], i);
            EXPECT_TRUE(inserted) << "slot " << i << " shares its address with slot " << it->second;
        }
        EXPECT_STREQ(row.type.name(), row.name);
        const auto* single = dynamic_cast<const abi::__si_class_type_info*>(&row.type);
        ASSERT_NE(single, nullptr) << "not a single-base class";
        EXPECT_STREQ(single->__base_type->name(), row.base);
    }
}

// Neither the sources' nor the build's directory is in the file; a diagnostic
// names its source relative to the project, as a path that exists there.
TEST(InterfacePaths, NoBuildMachinePathAndDiagnosticsNameProjectPaths) {
    testsupport::LoadedLibrary lib;
    ASSERT_TRUE(lib.ok()) << lib.error();
    int notANode = 0;
    testing::internal::CaptureStderr();
    lib.engine()->ReleaseWait(reinterpret_cast<WaitNode*>(&notANode));
    const std::string printed = testing::internal::GetCapturedStderr();
    std::smatch m;
    ASSERT_TRUE(std::regex_search(printed, m, std::regex(R"(^([^:\n]+):[^:\n]+:[0-9]+::[0-9]+::)"))) << printed;
    const std::string path = m[1];
    EXPECT_NE(path[0], '/') << path;
    EXPECT_TRUE(std::ifstream(std::string(QUELTA_SOURCE_DIR) + "/" + path).good()) << path;
#ifndef QUELTA_SANITIZED  // the sanitizers keep the compiler's full paths; never shipped
    std::ifstream file(QUELTA_SO_PATH, std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    ASSERT_GT(bytes.size(), 4096u);
    for (const char* dir : {QUELTA_SOURCE_DIR, QUELTA_BINARY_DIR}) EXPECT_EQ(bytes.find(dir), std::string::npos) << dir;
#endif
}

// The library uses 64-bit time everywhere; a runtime built with 32-bit time_t
// shares PalSemaphore with it unchanged (nothing else carries a time type).
TEST(InterfaceLayout, PalSemaphoreDoesNotDependOnTheWidthOfTime) {
    const testsupport::RecordLayout runtime = testsupport::PalSemaphoreLayoutWith32BitTime();
    EXPECT_EQ(sizeof(time_t), 8u);
    EXPECT_EQ(runtime.timeTSize, sizeof(void*) == 4 ? 4u : 8u) << "the runtime's side is not default time";
    EXPECT_EQ(runtime.size, sizeof(PalSemaphore));
    EXPECT_EQ(runtime.mutexOffset, offsetof(PalSemaphore, mutex));
    EXPECT_EQ(runtime.countOffset, offsetof(PalSemaphore, count));
    EXPECT_EQ(runtime.waitersOffset, offsetof(PalSemaphore, waiters));
}

}  // namespace
