// iKPusTimingEngine: the timing engine as the runtime sees it.
//
// The runtime calls this object by virtual-slot position, so the order of the
// declarations below is the interface: never reorder, insert or remove one.
// The slot number of each operation is given in its comment. The virtual
// destructor sits between slots 49 and 52 and takes slots 50 and 51.
#ifndef QUELTA_IKPUSTIMINGENGINE_H
#define QUELTA_IKPUSTIMINGENGINE_H

#include "quelta/ClockTime.h"

class QUELTA_EXPORT iKPusTimingEngine {
public:
    // Clock reads: monotonic (0, 1, 4, 5), global (2, 3, 6, 7), raw (8, 9).
    virtual void ReadMonotonic0(ClockTime& out) = 0;                       // 0
    virtual void ReadMonotonic1(ClockTime& out) = 0;                       // 1
    virtual void ReadGlobal2(ClockTime& out) = 0;                          // 2
    virtual void ReadGlobal3(ClockTime& out) = 0;                          // 3
    virtual void ReadMonotonic4(ClockTime& out) = 0;                       // 4
    virtual void ReadMonotonic5(ClockTime& out) = 0;                       // 5
    virtual void ReadGlobal6(ClockTime& out) = 0;                          // 6
    virtual void ReadGlobal7(ClockTime& out) = 0;                          // 7
    virtual void ReadRaw8(ClockTime& out) = 0;                             // 8
    virtual void ReadRaw9(ClockTime& out) = 0;                             // 9
    virtual ClockTime GetClocksPerSecond() = 0;                            // 10
    virtual ClockTime GetRawClockResolution() = 0;                         // 11
    virtual double GetClockRate() = 0;                                     // 12
    virtual void SetClockRate(double ticksPerSecond) = 0;                  // 13
    virtual int32_t StepGlobalClock(const ClockTime& delta) = 0;           // 14
    virtual ClockTime MonotonicToGlobal(const ClockTime& t) = 0;           // 15
    virtual ClockTime MonotonicToGlobalImpl(const ClockTime& t) = 0;       // 16
    virtual ClockTime GlobalToMonotonic(const ClockTime& t) = 0;           // 17
    virtual ClockTime GlobalToMonotonicImpl(const ClockTime& t) = 0;       // 18
    virtual ClockTime MicrosecondsToClocks64(const ClockTime& us) = 0;     // 19
    virtual uint32_t MicrosecondsToClocks32(const uint32_t& us) = 0;       // 20
    virtual ClockTime ClocksToMicroseconds64(const ClockTime& ns) = 0;     // 21
    virtual uint32_t ClocksToMicroseconds32(const uint32_t& ns) = 0;       // 22
    virtual ClockTime MonotonicToGlobalFwd(const ClockTime& t) = 0;        // 23
    virtual ClockTime MonotonicToGlobalImplFwd(const ClockTime& t) = 0;    // 24
    virtual ClockTime GlobalToMonotonicFwd(const ClockTime& t) = 0;        // 25
    virtual ClockTime GlobalToMonotonicImplFwd(const ClockTime& t) = 0;    // 26
    virtual ClockTime MicrosecondsToClocks64Fwd(const ClockTime& us) = 0;  // 27
    virtual uint32_t MicrosecondsToClocks32Fwd(const uint32_t& us) = 0;    // 28
    virtual ClockTime ClocksToMicroseconds64Fwd(const ClockTime& ns) = 0;  // 29
    virtual uint32_t ClocksToMicroseconds32Fwd(const uint32_t& ns) = 0;    // 30
    virtual void CopyStatistics(void* destination, uint32_t full) = 0;     // 31
    virtual uint32_t HistogramMode(const uint32_t* samples, uint32_t count,
                                   uint32_t bucketWidth,
                                   uint32_t bucketLimit) = 0;              // 32
    virtual uint32_t EventWait(PalSemaphore* semaphore, uint32_t timeout) = 0; // 33
    virtual uint32_t EventWaitCallback(PalSemaphore* semaphore,
                                       const ClockTime& deadline,
                                       QueltaWaitCallbackFn callback,
                                       void* callbackArg, uint32_t isGlobal,
                                       WaitNode** nodeOut) = 0;            // 34
    virtual void ReleaseWait(WaitNode* node) = 0;                          // 35
    virtual uint32_t WaitMicroSeconds(uint32_t us) = 0;                    // 36
    virtual uint32_t WaitUntilNextMultipleMicroSeconds(uint32_t us) = 0;   // 37
    virtual uint32_t WaitUntilMicroSeconds(uint32_t us) = 0;               // 38
    virtual uint32_t WaitClocks(uint32_t clocks) = 0;                      // 39
    virtual uint32_t WaitUntilNextMultipleClocks(uint32_t clocks) = 0;     // 40
    virtual uint32_t WaitUntilClocks64(const ClockTime* target) = 0;       // 41
    virtual uint32_t WaitUntilClocks(uint32_t target) = 0;                 // 42
    virtual void SetControlFlag(uint32_t action) = 0;                      // 43
    virtual uint32_t UsesTickService() = 0;                                // 44
    virtual void LoadLastMonotonicFwd(ClockTime& out) = 0;                 // 45
    virtual void LoadLastMonotonic(ClockTime& out) = 0;                    // 46
    virtual void LoadLastGlobalFwd(ClockTime& out) = 0;                    // 47
    virtual void LoadLastGlobal(ClockTime& out) = 0;                       // 48
    virtual ClockTime WaitUntilNextMultipleClocks64(const ClockTime& period) = 0; // 49
    virtual ~iKPusTimingEngine() {}                                        // 50, 51
    virtual void WaitUntilGlobalClocks64(const ClockTime* target,
                                         uint32_t* abortFlag,
                                         ClockTime* timeAfter,
                                         uint32_t generation) = 0;         // 52
    virtual void ReadGlobalWithGeneration(ClockTime& out,
                                          uint32_t& generation) = 0;       // 53
    virtual void RegisterTickCallback(QueltaTickCallbackFn fn) = 0;        // 54
    virtual void UnregisterTickCallback(QueltaTickCallbackFn fn) = 0;      // 55
};

#endif
