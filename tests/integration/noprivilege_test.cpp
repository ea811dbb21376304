// Without real-time privilege the timer thread cannot run at SCHED_FIFO. The
// library must still load, say so once on standard error, refuse every wait
// that needs the timer thread at once with its "no timer" result, keep the
// plain waits working, and unload promptly.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include "LoadedLibrary.h"
#include "TestSupport.h"

namespace {

constexpr uint64_t kMs = 1000000;

bool DropRealtimePrivilege() {
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2] = {};
    if (syscall(SYS_capget, &header, data) != 0) return false;
    data[0].effective &= ~(1u << CAP_SYS_NICE);
    data[0].permitted &= ~(1u << CAP_SYS_NICE);
    data[0].inheritable &= ~(1u << CAP_SYS_NICE);
    if (syscall(SYS_capset, &header, data) != 0) return false;
    rlimit none{0, 0};
    setrlimit(RLIMIT_RTPRIO, &none);
    return !testsupport::CanUseRealtime();
}

// Runs in the child; returns a failure description, empty on success.
std::string ChildChecks() {
    if (!DropRealtimePrivilege()) return "could not drop real-time privilege";
    const uint64_t loadStart = testsupport::MonoNowNs();
    testsupport::LoadedLibrary lib;
    if (!lib.ok()) return "load failed: " + lib.error();
    if (lib.engine() == nullptr || lib.log() == nullptr) return "accessors null";
    const auto& api = lib.api();
    if (testsupport::MonoNowNs() - loadStart > 2000 * kMs) return "load took too long";

    // Waits that need the timer thread come back at once with "no timer".
    const uint64_t t0 = testsupport::MonoNowNs();
    PalSemaphore* s = testsupport::NewRuntimeSemaphore();
    if (api.EventWait(s, 500000) != 1) return "event wait did not report no timer";
    ClockTime now;
    lib.engine()->ReadMonotonic0(now);
    const uint64_t n = (static_cast<uint64_t>(now.high) << 32) | now.low;
    const uint64_t d = n + 500 * kMs;
    const ClockTime deadline{static_cast<uint32_t>(d), static_cast<uint32_t>(d >> 32)};
    if (api.EventWaitCallback(nullptr, &deadline, nullptr, nullptr, 0, nullptr) != 1)
        return "own-semaphore wait did not report no timer";
    WaitNode* node = nullptr;
    if (api.EventWaitCallback(s, &deadline, nullptr, nullptr, 0, &node) != 1)
        return "caller-semaphore wait did not report no timer";
    lib.engine()->ReleaseWait(node);
    const ClockTime past{0, 0};  // earlier than any armed deadline: needs arming
    if (api.SetCallbackTime(&past, 0) != 0) return "callback time was accepted without a timer";
    ClockTime g;
    uint32_t generation = 0;
    lib.engine()->ReadGlobalWithGeneration(g, generation);
    uint32_t abortFlag = 5;
    ClockTime after{};
    api.WaitUntilGlobalClocks64(&g, &abortFlag, &after, generation);
    if (testsupport::MonoNowNs() - t0 > 200 * kMs) return "a refused wait blocked";
    // Plain waits still work, never early.
    const uint64_t p0 = testsupport::MonoNowNs();
    api.WaitMicroSeconds(3000);
    if (testsupport::MonoNowNs() < p0 + 3 * kMs) return "plain wait returned early";
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
        const uint64_t t0 = testsupport::MonoNowNs();
        std::string failure = ChildChecks();  // includes the unload
        if (failure.empty() && testsupport::MonoNowNs() - t0 > 5000 * kMs) failure = "too slow";
        std::printf("%s\n", failure.empty() ? "CHILD-OK" : failure.c_str());
        std::fflush(stdout);
        _exit(failure.empty() ? 0 : 1);
    }
    close(errPipe[1]);
    std::string err;
    char buf[1024];
    ssize_t r;
    while ((r = read(errPipe[0], buf, sizeof buf)) > 0) err.append(buf, static_cast<size_t>(r));
    close(errPipe[0]);
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0) << "see the child's line above";
    // One diagnostic line about real-time priority, and only one.
    size_t lines = 0;
    for (char c : err) lines += c == '\n';
    EXPECT_EQ(lines, 1u) << err;
    EXPECT_NE(err.find("real-time priority"), std::string::npos) << err;
}

}  // namespace
