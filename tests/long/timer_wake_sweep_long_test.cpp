// The wake sweep of tests/rt/timer_wake_sweep_test.cpp, more than ten times as long:
// tens of thousands of wakes landed across the timer thread's way into its
// sleep (a qualification run for a new target or kernel).
#define QUELTA_WAKE_SWEEP_ROUNDS 250000
#include "../rt/timer_wake_sweep_test.cpp"
