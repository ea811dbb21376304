#include "TestSupport.h"

#include <dirent.h>
#include <pthread.h>
#include <sched.h>

namespace testsupport {

static uint64_t Now(clockid_t id) {
    timespec ts{};
    clock_gettime(id, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * 1000000000ull + static_cast<uint64_t>(ts.tv_nsec);
}

uint64_t MonoNowNs() { return Now(CLOCK_MONOTONIC); }
uint64_t RealNowNs() { return Now(CLOCK_REALTIME); }

uint64_t AwaitNonZero(const std::atomic<uint64_t>& word, uint64_t limitNs) {
    const timespec ms{0, 1000000};
    for (const uint64_t start = MonoNowNs(); word.load() == 0 && MonoNowNs() - start < limitNs;) nanosleep(&ms, nullptr);
    return word.load();
}

bool CanUseRealtime() {
    int policy = 0;
    sched_param old{}, p{};
    pthread_getschedparam(pthread_self(), &policy, &old);
    p.sched_priority = 1;
    if (pthread_setschedparam(pthread_self(), SCHED_FIFO, &p) != 0) return false;
    pthread_setschedparam(pthread_self(), policy, &old);
    return true;
}

static int CountEntries(const char* path) {
    DIR* d = opendir(path);
    if (!d) return -1;
    int n = 0;
    while (dirent* e = readdir(d)) n += e->d_name[0] != '.';
    closedir(d);
    return n;
}

int CountThreads() { return CountEntries("/proc/self/task"); }
int CountOpenFds() { return CountEntries("/proc/self/fd") - 1; }  // minus the DIR's own

}  // namespace testsupport
