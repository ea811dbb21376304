// The test process's side of the emulated kernel extension. Before any test
// (and so before any thread) the process gets a private mount namespace with
// a tmpfs over /sys/kernel for the two sysfs files, forks the supervisor,
// installs a seccomp filter whose listener it hands to the supervisor, and
// from then on every thread it creates (the library's timer thread among
// them) is served by the emulation. Where the machine refuses any of that,
// every test skips with one line saying why.
#ifndef QUELTA_TESTS_KEXT_KEXTSANDBOX_H
#define QUELTA_TESTS_KEXT_KEXTSANDBOX_H

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "KextShared.h"
#include "KextSupervisor.h"
#include "TestSupport.h"

namespace kext {

// Traps, per architecture, the two extra calls, clock_nanosleep and openat.
inline std::vector<sock_filter> FilterProgram() {
    std::vector<sock_filter> p;
    auto block = [&](const ArchCalls& a) {
        std::vector<uint32_t> nrs = {uint32_t(kWakeNr), uint32_t(kConvertNr), uint32_t(a.nanosleep64),
                                     uint32_t(a.openat)};
        if (a.nanosleep32 >= 0) nrs.push_back(uint32_t(a.nanosleep32));
        const uint8_t n = static_cast<uint8_t>(nrs.size());
        p.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)));
        for (uint8_t i = 0; i < n; ++i) p.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, nrs[i], uint8_t(n - i), 0));
        p.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
        p.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_USER_NOTIF));
    };
    p.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)));
    p.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArchs[0].arch, 2, 0));
    const size_t secondJump = p.size();
    p.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArchs[1].arch, 0, 0));
    p.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
    block(kArchs[0]);
    p[secondJump].jt = static_cast<uint8_t>(p.size() - secondJump - 1);
    block(kArchs[1]);
    return p;
}

class Sandbox {
public:
    static Sandbox& Get() {
        static Sandbox s;
        return s;
    }
    bool Ready() const { return page_ != nullptr && why_.empty(); }
    const std::string& Why() const { return why_; }
    SharedPage& Page() { return *page_; }

    // nullptr removes the file.
    static void WriteFile(const char* path, const char* content) {
        unlink(path);
        if (content == nullptr) return;
        const int f = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0444);
        if (f >= 0) (void)!write(f, content, std::strlen(content));
        close(f);
    }
    // Both files with the emulated numbers, every knob at rest.
    void Reset() {
        WriteFile(kWakeFile, "917\n");
        WriteFile(kConvertFile, "918\n");
        page_->skewNs.store(0);
        page_->loseEveryWake.store(0);
        page_->widenWindowUs.store(0);
        page_->echoWakes.store(0);
        page_->wakeReturnsEnosys.store(0);
    }

    void SetUp() {
#if !defined(__x86_64__) && !defined(__i386__)
        why_ = "it traps x86-64 and i386 system calls (under qemu the filter would apply to the emulator)";
#else
        if (geteuid() != 0) return Fail("it needs root (a mount namespace and a tmpfs over /sys/kernel)", 0);
        if (!testsupport::CanUseRealtime()) return Fail("the library's timer thread needs SCHED_FIFO", 0);
        if (unshare(CLONE_NEWNS) != 0) return Fail("unshare(CLONE_NEWNS)", errno);
        if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return Fail("private mounts", errno);
        if (mount("kext", "/sys/kernel", "tmpfs", MS_NOSUID | MS_NODEV | MS_NOEXEC, "size=64k,mode=0755") != 0) {
            return Fail("a tmpfs over /sys/kernel", errno);
        }
        void* shared = mmap(nullptr, sizeof(SharedPage), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
        if (shared == MAP_FAILED) return Fail("a shared page", errno);
        page_ = new (shared) SharedPage;
        page_->realOffsetNs.store(MeasureOffset(CLOCK_REALTIME));
        page_->rawOffsetNs.store(MeasureOffset(CLOCK_MONOTONIC_RAW));
        int sv[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0) return Fail("socketpair", errno);
        const pid_t parent = getpid();
        const pid_t child = fork();
        if (child < 0) return Fail("fork", errno);
        if (child == 0) RunSupervisor(sv[1], parent);
        close(sv[1]);
        prctl(PR_SET_PTRACER, child);  // lets it read and write this process's memory under Yama
        const int listener = InstallFilter();
        if (listener < 0) {
            kill(child, SIGKILL);
            return Fail("a seccomp user-notification filter", errno);
        }
        char ack = 0;
        const bool served = SendFd(sv[0], listener) && read(sv[0], &ack, 1) == 1;
        close(listener);
        close(sv[0]);
        if (!served) return Fail("the supervisor did not start", 0);
        Reset();
#endif
    }

private:
    void Fail(const char* what, int err) {
        why_ = what;
        if (err != 0) why_ += std::string(" failed: ") + std::strerror(err);
    }

    static int InstallFilter() {
        std::vector<sock_filter> p = FilterProgram();
        sock_fprog prog{static_cast<unsigned short>(p.size()), p.data()};
        long fd = syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_NEW_LISTENER, &prog);
        if (fd < 0 && errno == EACCES && prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0) {
            fd = syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_NEW_LISTENER, &prog);
        }
        return static_cast<int>(fd);
    }

    // One byte carrying one descriptor (SCM_RIGHTS).
    struct FdMessage {
        char data = 'L';
        iovec iov{&data, 1};
        alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
        msghdr msg{nullptr, 0, &iov, 1, control, sizeof control, 0};
        cmsghdr* header() { return CMSG_FIRSTHDR(&msg); }
    };
    static bool SendFd(int socket, int fd) {
        FdMessage m;
        *m.header() = cmsghdr{CMSG_LEN(sizeof(int)), SOL_SOCKET, SCM_RIGHTS};
        std::memcpy(CMSG_DATA(m.header()), &fd, sizeof fd);
        return sendmsg(socket, &m.msg, 0) == 1;
    }

    // The supervisor process: never returns.
    [[noreturn]] void RunSupervisor(int socket, pid_t parent) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
        FdMessage m;
        int listener;
        if (recvmsg(socket, &m.msg, 0) != 1 || m.header() == nullptr) _exit(1);
        std::memcpy(&listener, CMSG_DATA(m.header()), sizeof listener);
        sched_param p{};
        p.sched_priority = sched_get_priority_max(SCHED_FIFO);
        sched_setscheduler(0, SCHED_FIFO, &p);  // when allowed: wakes and deadlines are served first
        Supervisor supervisor(listener, page_);
        (void)!write(socket, "A", 1);
        close(socket);
        supervisor.Run();
    }

    SharedPage* page_ = nullptr;
    std::string why_;
};

class Environment : public ::testing::Environment {
public:
    void SetUp() override { Sandbox::Get().SetUp(); }
};
inline ::testing::Environment* const gEnvironment = ::testing::AddGlobalTestEnvironment(new Environment);

// Every test of the emulated extension: skipped where it cannot run; starts
// with both files present and every knob at rest.
class KextTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (!Sandbox::Get().Ready()) GTEST_SKIP() << "no emulated kernel extension: " << Sandbox::Get().Why();
        Sandbox::Get().Reset();
    }
    SharedPage& Page() { return Sandbox::Get().Page(); }
};

}  // namespace kext

#endif
