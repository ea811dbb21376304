#include "probe/MachineNoise.h"

#include <dirent.h>
#include <fcntl.h>
#include <sched.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

namespace qprobe {

namespace {

constexpr int64_t kTimerReadEveryNs = 100000;
constexpr int64_t kSpinStretchNs = 900000000;  // then a rest, below the kernel's 95 % real-time share
constexpr int64_t kRestNs = 100000000;

// CPU time of a thread, in ns, from its schedstat; -1 when not known.
int64_t ThreadCpuNs(int fd) {
    if (fd < 0) return -1;
    char buf[96];
    const ssize_t n = pread(fd, buf, sizeof buf - 1, 0);
    if (n <= 0) return -1;
    buf[n] = '\0';
    return std::strtoll(buf, nullptr, 10);
}

}  // namespace

int64_t MonoNs() {
    timespec t{};
    clock_gettime(CLOCK_MONOTONIC, &t);
    return static_cast<int64_t>(t.tv_sec) * 1000000000LL + t.tv_nsec;
}

pid_t LibraryTimerThread() {
    DIR* d = opendir("/proc/self/task");
    if (d == nullptr) return -1;
    pid_t tid = -1;
    while (dirent* e = readdir(d)) {
        if (e->d_name[0] == '.') continue;
        std::ifstream comm(std::string("/proc/self/task/") + e->d_name + "/comm");
        std::string name;
        if (std::getline(comm, name) && name == "QUELTAisr") {
            tid = static_cast<pid_t>(std::atoi(e->d_name));
            break;
        }
    }
    closedir(d);
    return tid;
}

// The spin itself: each Step() reads the clock and gives the time since the
// previous reading that was not this thread's, less the library's share.
// The timer thread's CPU time is read every 100 us and after every gap, and
// the clock read again after it, so the reading itself never counts as a
// stall; the timer thread's running on another CPU in those 100 us may be
// taken for a part of a gap, which only ever makes a stall look shorter.
struct MachineNoise::Spinner {
    NoiseFigures& figures;
    int timerFd;
    int64_t prev = 0;
    int64_t timerRef = -1;
    int64_t nextTimerRead = 0;

    Spinner(NoiseFigures& f, int fd) : figures(f), timerFd(fd) { Restart(); }

    void Restart() {
        timerRef = ThreadCpuNs(timerFd);
        prev = MonoNs();
        nextTimerRead = prev + kTimerReadEveryNs;
    }

    int64_t Step() {
        const int64_t now = MonoNs();
        int64_t gap = now - prev;
        prev = now;
        figures.spunNs += gap;
        if (timerFd >= 0 && (gap > kStallThresholdNs || now >= nextTimerRead)) {
            const int64_t cpu = ThreadCpuNs(timerFd);
            if (cpu >= 0 && timerRef >= 0 && gap > kStallThresholdNs) {
                const int64_t library = std::clamp<int64_t>(cpu - timerRef, 0, gap);
                figures.libraryNs += library;
                gap -= library;
            }
            timerRef = cpu;
            prev = MonoNs();
            nextTimerRead = prev + kTimerReadEveryNs;
        }
        if (gap > kStallThresholdNs) {
            ++figures.stalls;
            figures.stalledNs += gap;
        }
        return gap;
    }
};

MachineNoise::MachineNoise(std::size_t seriesCount, pid_t timerTid) {
    figures_.perSeries.resize(seriesCount);
    if (timerTid > 0) {
        timerFd_ = open(("/proc/self/task/" + std::to_string(timerTid) + "/schedstat").c_str(),
                        O_RDONLY | O_CLOEXEC);
    }
    if (timerFd_ >= 0) figures_.libraryNs = 0;
}

MachineNoise::~MachineNoise() {
    Stop();
    if (timerFd_ >= 0) close(timerFd_);
}

void MachineNoise::Charge(uint32_t series, int64_t longestNs) {
    if (series >= figures_.perSeries.size()) return;
    const double us = static_cast<double>(longestNs) / 1000.0;
    figures_.perSeries[series].Add(us);
    figures_.all.Add(us);
}

bool MachineNoise::StartSpare(int cpu, int priority) {
    pthread_attr_t attr;
    pthread_attr_init(&attr);
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    pthread_attr_setaffinity_np(&attr, sizeof set, &set);
    pthread_attr_setinheritsched(&attr, PTHREAD_EXPLICIT_SCHED);
    pthread_attr_setschedpolicy(&attr, SCHED_FIFO);
    sched_param p{};
    p.sched_priority = priority;
    pthread_attr_setschedparam(&attr, &p);
    figures_.mode = NoiseMode::SpareCpu;
    figures_.cpu = cpu;
    threadRunning_ = pthread_create(&thread_, &attr, &MachineNoise::SpareMain, this) == 0;
    pthread_attr_destroy(&attr);
    if (!threadRunning_) {
        figures_.mode = NoiseMode::Off;
        figures_.cpu = -1;
    }
    return threadRunning_;
}

void* MachineNoise::SpareMain(void* self) {
    static_cast<MachineNoise*>(self)->SpareRun();
    return nullptr;
}

void MachineNoise::SpareRun() {
    Spinner spin(figures_, timerFd_);
    uint64_t tag = 0;         // the sample being watched, as published
    bool wholeSpan = false;   // watched from its start, with no rest in it
    int64_t longest = 0;
    int64_t restAt = spin.prev + kSpinStretchNs;
    while (!stop_.load(std::memory_order_relaxed)) {
        // The gap first, then who it belongs to: a stall that delayed a
        // wake-up ends after the sample did, and is still that sample's.
        longest = std::max(longest, spin.Step());
        const uint64_t now = current_.load(std::memory_order_relaxed);
        if (now != tag) {
            if (tag != 0 && wholeSpan) Charge(static_cast<uint32_t>(tag & 0xFFu), longest);
            tag = now;
            wholeSpan = true;
            longest = 0;
        }
        if (spin.prev >= restAt) {
            const timespec rest{0, kRestNs};
            clock_nanosleep(CLOCK_MONOTONIC, 0, &rest, nullptr);
            spin.Restart();
            restAt = spin.prev + kSpinStretchNs;
            wholeSpan = false;
        }
    }
}

void MachineNoise::Begin(uint32_t series) {
    if (figures_.mode == NoiseMode::SpareCpu) {
        current_.store((++sequence_ << 8) | (series & 0xFFu), std::memory_order_relaxed);
    }
}

void MachineNoise::End() {
    if (figures_.mode == NoiseMode::SpareCpu) current_.store(0, std::memory_order_relaxed);
}

void MachineNoise::Window(uint32_t series) {
    if (figures_.mode == NoiseMode::Windows) {
        Spinner spin(figures_, timerFd_);
        const int64_t until = spin.prev + kNoiseWindowNs;
        int64_t longest = 0;
        while (spin.prev < until) longest = std::max(longest, spin.Step());
        Charge(series, longest);
    }
}

NoiseFigures& MachineNoise::Stop() {
    if (threadRunning_) {
        stop_.store(true, std::memory_order_relaxed);
        pthread_join(thread_, nullptr);
        threadRunning_ = false;
    }
    return figures_;
}

}  // namespace qprobe
