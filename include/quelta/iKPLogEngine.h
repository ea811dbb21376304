// iKPLogEngine: the per-CPU event log as the runtime sees it.
//
// The runtime calls this object by virtual-slot position: 24 operations in
// the order below, then the destructor (slots 24 and 25). Never reorder.
#ifndef QUELTA_IKPLOGENGINE_H
#define QUELTA_IKPLOGENGINE_H

#include "quelta/ClockTime.h"

class QUELTA_EXPORT iKPLogEngine {
public:
    virtual uint32_t Configure(int32_t capacity) = 0;                          // 0
    virtual void LogAt1(const ClockTime& time, uint32_t event) = 0;            // 1
    virtual void LogAt2(const ClockTime& time, uint32_t event) = 0;            // 2
    virtual void StampAndLog3(ClockTime& time, uint32_t event) = 0;            // 3
    virtual void StampAndLog4(ClockTime& time, uint32_t event) = 0;            // 4
    virtual void LogNow5(uint32_t event) = 0;                                  // 5
    virtual void LogNow6(uint32_t event) = 0;                                  // 6
    virtual void ReadOut7(uint32_t& count, uint32_t timeLow[],
                          uint32_t timeHigh[], uint32_t events[],
                          uint32_t last) = 0;                                  // 7
    virtual void SetEnabledWord(uint32_t value) = 0;                           // 8
    virtual void NoOperation9() = 0;                                           // 9
    virtual void NoOperation10() = 0;                                          // 10
    virtual void SetEnabled(uint32_t n) = 0;                                   // 11
    virtual void AdjustEnabled(int32_t delta) = 0;                             // 12
    virtual void SetEnableValue(uint32_t value) = 0;                           // 13
    virtual iKPLogEngine* CreateLogEngine() = 0;                               // 14
    virtual void LogAtIfKey15(const ClockTime& time, uint32_t event,
                              uint32_t key) = 0;                               // 15
    virtual void LogAtIfKey16(const ClockTime& time, uint32_t event,
                              uint32_t key) = 0;                               // 16
    virtual void LogNowIfKey17(uint32_t event, uint32_t key) = 0;              // 17
    virtual void LogNowIfKey18(uint32_t event, uint32_t key) = 0;              // 18
    virtual void Reconfigure() = 0;                                            // 19
    virtual void LogAtWithData(const ClockTime& time, uint32_t data,
                               uint32_t event) = 0;                            // 20
    virtual void LogNowData256(uint32_t event) = 0;                            // 21
    virtual void LogNowData0(uint32_t event) = 0;                              // 22
    virtual void ReadOutMerged(uint32_t& count, uint32_t timeLow[],
                               uint32_t timeHigh[], uint32_t events[],
                               uint32_t data[], uint32_t last) = 0;            // 23
    virtual ~iKPLogEngine() {}                                                 // 24, 25
};

#endif
