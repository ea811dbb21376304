// Helpers of the kernel-extension tests: a hang turned into a failure within
// seconds, standard output captured, a callback that records when it ran.
#ifndef QUELTA_TESTS_KEXT_KEXTTESTSUPPORT_H
#define QUELTA_TESTS_KEXT_KEXTTESTSUPPORT_H

#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>
#include <thread>

#include "LibraryFixture.h"
#include "TestSupport.h"

namespace kext {

constexpr uint64_t kUs = 1000, kMs = 1000 * kUs, kSec = 1000 * kMs;

// Ends the process with a message when its scope lasts longer than `limitNs`:
// a hang (an unload that never joins its timer thread) fails within seconds.
class Watchdog {
public:
    Watchdog(const char* what, uint64_t limitNs)
        : thread_([this, what, limitNs] {
              std::unique_lock<std::mutex> lock(mutex_);
              if (done_.wait_for(lock, std::chrono::nanoseconds(limitNs), [this] { return ended_; })) return;
              std::fprintf(stderr, "FAILED: %s did not end within %.1f s\n", what, limitNs / 1e9);
              std::_Exit(1);
          }) {}
    ~Watchdog() {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            ended_ = true;
        }
        done_.notify_one();
        thread_.join();
    }

private:
    std::mutex mutex_;
    std::condition_variable done_;
    bool ended_ = false;  // guarded by mutex_
    std::thread thread_;  // last: starts once the rest is built
};

// Everything written to standard output (file descriptor 1) meanwhile.
class StdoutCapture {
public:
    StdoutCapture() {
        std::fflush(stdout);
        saved_ = dup(1);
        file_ = std::tmpfile();
        dup2(fileno(file_), 1);
    }
    std::string Take() {
        std::fflush(stdout);
        dup2(saved_, 1);
        close(saved_);
        std::string text;
        std::rewind(file_);
        for (int c; (c = std::fgetc(file_)) != EOF;) text += static_cast<char>(c);
        std::fclose(file_);
        return text;
    }

private:
    int saved_;
    FILE* file_;
};

// A SetCallback function: stores CLOCK_MONOTONIC into the
// std::atomic<uint64_t> it is given.
inline void StampMonotonic(void* word) {
    static_cast<std::atomic<uint64_t>*>(word)->store(testsupport::MonoNowNs());
}

// The library's epoch offset in nanoseconds: its global clock reads
// CLOCK_REALTIME directly, so the difference is whole seconds plus the
// reading's own microseconds.
inline int64_t EpochOffsetNs(iKPusTimingEngine* engine) {
    ClockTime g;
    const int64_t real = static_cast<int64_t>(testsupport::RealNowNs());
    engine->ReadGlobal2(g);
    const int64_t d = static_cast<int64_t>(testsupport::U64(g)) - real;
    return (d + static_cast<int64_t>(kSec / 2)) / static_cast<int64_t>(kSec) * static_cast<int64_t>(kSec);
}

}  // namespace kext

#endif
