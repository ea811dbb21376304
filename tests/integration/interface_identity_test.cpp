// What the runtime sees of the loaded library besides its calls: every virtual
// slot is an entry point of its own (the runtime calls by slot position), the
// run-time types carry their plain names, no build-machine path is carried,
// and the shared semaphore record does not depend on the width of time_t.
#include <dlfcn.h>
#include <gtest/gtest.h>

#include <cxxabi.h>
#include <fstream>
#include <iterator>
#include <map>
#include <regex>
#include <string>
#include <typeinfo>

#include "LoadedLibrary.h"
#include "Time32Layout.h"
#include "quelta/PalSemaphore.h"

namespace {

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
