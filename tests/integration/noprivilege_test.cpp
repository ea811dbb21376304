// Without real-time privilege the library loads, says so once, refuses the timer's waits at once, keeps plain waits.
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include "LibraryFixture.h"
#include "TestSupport.h"

using testsupport::MonoNowNs;

namespace {

constexpr uint64_t kMs = 1000000;

bool DropRealtimePrivilege() {
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2] = {};
    if (syscall(SYS_capget, &header, data) != 0) return false;
    for (auto* set : {&data[0].effective, &data[0].permitted, &data[0].inheritable}) *set &= ~(1u << CAP_SYS_NICE);
    if (syscall(SYS_capset, &header, data) != 0) return false;
    rlimit none{0, 0};
    setrlimit(RLIMIT_RTPRIO, &none);
    return !testsupport::CanUseRealtime();
}

// Runs in the child; returns a failure description, empty on success.
std::string ChildChecks() {
    if (!DropRealtimePrivilege()) return "could not drop real-time privilege";
    const uint64_t loadStart = MonoNowNs();
    testsupport::LoadedLibrary lib;
    if (!lib.ok() || lib.engine() == nullptr || lib.log() == nullptr) return "load failed: " + lib.error();
    if (MonoNowNs() - loadStart > 2000 * kMs) return "load took too long";
    const auto& api = lib.api();
    const uint64_t t0 = MonoNowNs();
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    ClockTime now, g, after{};
    lib.engine()->ReadMonotonic0(now);
    const ClockTime deadline = testsupport::CT(testsupport::U64(now) + 500 * kMs), past{0, 0};
    WaitNode* node = nullptr;
    if (api.EventWait(s, 500000) != 1) return "event wait did not report no timer";
    if (api.EventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr) != 1) return "own-semaphore wait ran";
    if (api.EventWaitCallback(s, &deadline, nullptr, nullptr, 0, &node) != 1) return "caller-semaphore wait ran";
    lib.engine()->ReleaseWait(node);
    if (api.SetCallbackTime(&past, 0) != 0) return "callback time was accepted without a timer";  // needs arming
    uint32_t generation = 0, abortFlag = 5;
    lib.engine()->ReadGlobalWithGeneration(g, generation);
    api.WaitUntilGlobalClocks64(&g, &abortFlag, &after, generation);
    if (MonoNowNs() - t0 > 200 * kMs) return "a refused wait blocked";
    const uint64_t p0 = MonoNowNs();
    api.WaitMicroSeconds(3000);
    if (MonoNowNs() < p0 + 3 * kMs) return "plain wait returned early";
    testsupport::DeleteRuntimeSemaphore(s);
    return "";
}

TEST(NoRealtimePrivilege, LibraryLoadsRefusesTimerWaitsAndUnloadsPromptly) {
    int errPipe[2];
    ASSERT_EQ(pipe(errPipe), 0);
    fflush(nullptr);
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        dup2(errPipe[1], STDERR_FILENO);
        close(errPipe[0]);
        const uint64_t t0 = MonoNowNs();
        std::string failure = ChildChecks();  // includes the unload
        if (failure.empty() && MonoNowNs() - t0 > 5000 * kMs) failure = "too slow";
        std::printf("%s\n", failure.empty() ? "CHILD-OK" : failure.c_str());
        std::fflush(stdout);
        _exit(failure.empty() ? 0 : 1);
    }
    close(errPipe[1]);
    std::string err;
    char buf[1024];
    for (ssize_t r; (r = read(errPipe[0], buf, sizeof buf)) > 0;) err.append(buf, static_cast<size_t>(r));
    close(errPipe[0]);
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0) << "see the child's line above";
    EXPECT_EQ(std::count(err.begin(), err.end(), '\n'), 1) << err;  // one line, and only one
    EXPECT_NE(err.find("real-time priority"), std::string::npos) << err;
}

}  // namespace
