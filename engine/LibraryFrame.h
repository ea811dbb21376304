// The library frame: start-up, shutdown and the three long-lived objects.
//
// The library owns the timer, the timing engine and the log engine from
// start-up to stop; callers only borrow them. The pointers are written by
// start-up and stop (on the loading/unloading thread) and read everywhere.
#ifndef QUELTA_ENGINE_LIBRARYFRAME_H
#define QUELTA_ENGINE_LIBRARYFRAME_H

#include <atomic>
#include <cstdint>

class tKPusTimingEngine;
class tKPLogEngine;

namespace quelta {

class tKPusLinuxNanoSleepTimer;

extern std::atomic<tKPLogEngine*> gLogEngine;
extern std::atomic<tKPusLinuxNanoSleepTimer*> gTimer;
extern std::atomic<tKPusTimingEngine*> gEngine;
extern std::atomic<uint32_t> gCpuSpeed;  // timer ticks per microsecond (1000)

// Command 1: LibraryStart, returns its result. Command 0: the stop, returns 1.
// Anything else: nothing, returns 1. Only `command` is read.
uint32_t LibraryControl(uintptr_t unused1, uintptr_t command, uintptr_t unused2);
uint32_t LibraryStart();        // 1 up, 0 failed
uint32_t EventSystemStart();    // 0 success, 1 failure
void EventSystemStop();

// Resets the scheduler's times to their load-time values (NeverTime, period 0).
void SetLoadTimeSchedulerState();

// The stop wakes every caller blocked inside the library, then waits at most
// this long for all of them to leave before it destroys what they use.
constexpr uint32_t kStopWaiterGraceMs = 100;

}  // namespace quelta

#endif
