// A controlled scheduler for deterministic tests: a fake timer that records
// its arming instead of running a thread, an engine whose global clock equals
// the monotonic clock (conversion by an epoch offset of 0), a pool of wait
// nodes without the rest of start-up, and a settable "now" for tick passes.
#ifndef QUELTA_TESTS_SCHEDULERHARNESS_H
#define QUELTA_TESTS_SCHEDULERHARNESS_H

#include <cstdint>
#include <vector>

#include "engine/WaitList.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"

namespace testsupport {

class FakeTimer : public quelta::tKPusLinuxNanoSleepTimer {
public:
    FakeTimer();
    // Records each arming. A scheduler that re-arms without end (a fault)
    // ends the test process rather than filling the machine's memory.
    void SetExpiry(ClockTime when) override;
    void ExpireNow() override { expireNowCalls++; }
    uint64_t LastArmed() const;
    std::vector<ClockTime> armed;
    int expireNowCalls = 0;
};

class SchedulerHarness {
public:
    SchedulerHarness();   // pool ready, gTimer = fake, gEngine = engine, now = 1 s
    ~SchedulerHarness();  // everything restored to load-time state

    void SetNow(uint64_t ns) { now_ = ns; }
    uint64_t Now() const { return now_; }
    void Pass();          // one tick service pass at Now()
    void RemoveTimer();   // gTimer = null
    // Gives every node its own semaphore, as start-up does (the waits that
    // block on a node need one); the harness destroys them.
    void GiveNodesSemaphores();

    ::WaitNode* Take();  // a node as the event waits take it
    FakeTimer* timer = nullptr;
    ::WaitNode pool[quelta::kWaitNodeCount];

private:
    static uint64_t NowHook();
    static uint64_t now_;
};

}  // namespace testsupport

#endif
