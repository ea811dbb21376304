// The machine's own stalls, measured beside the survey, so that a late
// wake-up can be put down to the machine or to the library.
//
// A thread at the survey's SCHED_FIFO priority spins reading CLOCK_MONOTONIC
// (as kernel noise tracers do, from user space); a gap between two readings
// is time the CPU was taken from it: an interrupt, an SMI, the hypervisor
// running something else, a task of higher priority. The library's own timer
// thread is not the machine: its CPU time during a gap (its schedstat, read
// every 100 us and after each gap) is taken out of the gap.
//
// Two ways to run it:
//  - Windows (few CPUs): the survey thread itself spins for 200 us after
//    each sample, on its own CPU at its own priority; the window's longest
//    stall is charged to the series just sampled.
//  - Spare CPU: a thread of its own, pinned to a CPU the survey does not
//    use, spins throughout; the longest stall during each sample (call to
//    wake-up) is charged to that sample's series. It rests 100 ms a second,
//    so that the kernel's real-time throttling never cuts into a spin.
//
// Concurrency: in windows mode all of it belongs to the survey thread. In
// spare-CPU mode the spinning thread owns the figures until Stop() has joined
// it; `current_` (the sample in progress) is written by the survey thread and
// read by the spinning one, `stop_` written by the survey thread; both
// relaxed, as no other data hangs on them.
#ifndef QUELTA_PROBE_MACHINENOISE_H
#define QUELTA_PROBE_MACHINENOISE_H

#include <pthread.h>
#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <vector>

#include "LatencyHistogram.h"

namespace qprobe {

// CLOCK_MONOTONIC now, in ns.
int64_t MonoNs();

enum class NoiseMode { Off, Windows, SpareCpu };

constexpr int64_t kStallThresholdNs = 5000;  // a gap above this counts as a stall
constexpr int64_t kNoiseWindowNs = 200000;

struct NoiseFigures {
    NoiseMode mode = NoiseMode::Off;
    int cpu = -1;            // spare-CPU mode: where it spun
    int64_t spunNs = 0;      // time covered by the spinning
    uint64_t stalls = 0;     // gaps above the threshold
    int64_t stalledNs = 0;   // their sum
    int64_t libraryNs = -1;  // the timer thread's CPU time taken out of gaps; -1: not known
    // Longest stall (us) per window or sample, per series and overall.
    std::vector<qtools::LatencyHistogram> perSeries;
    qtools::LatencyHistogram all;
};

// The library's timer thread ("QUELTAisr") of this process; -1 when none.
pid_t LibraryTimerThread();

class MachineNoise {
public:
    // `timerTid`: the library's timer thread, whose CPU time is not counted.
    MachineNoise(std::size_t seriesCount, pid_t timerTid);
    ~MachineNoise();
    MachineNoise(const MachineNoise&) = delete;
    MachineNoise& operator=(const MachineNoise&) = delete;

    void UseWindows() { figures_.mode = NoiseMode::Windows; }
    // Starts the spinning thread on `cpu` at SCHED_FIFO `priority`; false
    // (and nothing started) when that is refused.
    bool StartSpare(int cpu, int priority);

    // Called by the survey thread around each sample (spare-CPU mode), and
    // after it (windows mode: the window).
    void Begin(uint32_t series);
    void End();
    void Window(uint32_t series);

    // Joins the spinning thread, if any; the figures are final.
    NoiseFigures& Stop();

private:
    struct Spinner;
    static void* SpareMain(void* self);
    void SpareRun();
    void Charge(uint32_t series, int64_t longestNs);

    NoiseFigures figures_;
    int timerFd_ = -1;
    pthread_t thread_{};
    bool threadRunning_ = false;
    uint64_t sequence_ = 0;              // survey thread's own
    std::atomic<uint64_t> current_{0};   // (sequence << 8) | series, 0 between samples
    std::atomic<bool> stop_{false};
};

}  // namespace qprobe

#endif
