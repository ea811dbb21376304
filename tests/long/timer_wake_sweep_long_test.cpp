// The timer tests of tests/rt/timer_rt_test.cpp with a wake sweep more than
// ten times as long: hundreds of thousands of wakes landed across the timer
// thread's way into its sleep (a qualification run for a new target or kernel).
#define QUELTA_WAKE_SWEEP_ROUNDS 250000
#include "../rt/timer_rt_test.cpp"
