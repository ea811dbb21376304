// Kernel clock rate and timing statistics of the timing engine: the pieces
// outside the engine's virtual table.
#ifndef QUELTA_ENGINE_ENGINERATE_H
#define QUELTA_ENGINE_ENGINERATE_H

#include <atomic>
#include <cstdint>

namespace quelta {

// Kernel clock ticks per microsecond, sysconf(_SC_CLK_TCK) / 1e6; any
// negative value (initially -1.0) means not computed yet.
extern std::atomic<double> gKernelTickRate;

// Ticks per microsecond, computed and announced on stdout on first use.
double KernelTickRate();
// Microseconds per kernel tick.
double KernelTickPeriod();
// The kernel clock's current rate (tick and freq read with adjtimex), in
// ticks per microsecond.
double CurrentClockRate();

// Most frequent bucket of a sample set, as a value (bucket * width); 0 when
// none is found, when the counters cannot be allocated, or for a mode in the
// first or last bucket. Body of engine slot 32.
uint32_t HistogramModeOf(const uint32_t* samples, uint32_t count, uint32_t bucketWidth,
                         uint32_t bucketLimit);
// HistogramModeOf(samples, 1000, 10, 10000): the tick lateness mode.
uint32_t JitterHistogramMode(const uint32_t* samples);

}  // namespace quelta

#endif
