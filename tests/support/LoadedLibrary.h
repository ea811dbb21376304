// The built libquelta.so.6 loaded the way a runtime loads it: dlopen, then
// every entry resolved by name.
#ifndef QUELTA_TESTS_LOADEDLIBRARY_H
#define QUELTA_TESTS_LOADEDLIBRARY_H

#include <string>

#include "quelta/quelta.h"

namespace testsupport {

struct QueltaApi {
    decltype(&quelta_iTSC_WaitUntilClocks_C) WaitUntilClocks;
    decltype(&quelta_iTSC_WaitUntilClocks64_C) WaitUntilClocks64;
    decltype(&quelta_iTSC_WaitClocks_C) WaitClocks;
    decltype(&quelta_iTSC_WaitUntilNextMultipleClocks_C) WaitUntilNextMultipleClocks;
    decltype(&quelta_iTSC_WaitMicroSeconds_C) WaitMicroSeconds;
    decltype(&quelta_iTSC_WaitUntilMicroSeconds_C) WaitUntilMicroSeconds;
    decltype(&quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C) WaitUntilNextMultipleMicroSeconds;
    decltype(&quelta_iTSC_GetCPUSpeed_C) GetCPUSpeed;
    decltype(&quelta_iTSC_GetCPUTicksPerMS_C) GetCPUTicksPerMS;
    decltype(&quelta_iTSC_WaitUntilGlobalClocks64_C) WaitUntilGlobalClocks64;
    decltype(&quelta_iTSCEvent_Wait_C) EventWait;
    decltype(&quelta_iTSCEvent_Wait_Callback_C) EventWaitCallback;
    decltype(&quelta_iTSC_SetCallback) SetCallback;
    decltype(&quelta_iTSC_SetCallbackTime) SetCallbackTime;
    decltype(&GetEngine__MERIDOX) GetEngine;
    decltype(&GetLogEngine__MERIDOX) GetLogEngine;
};

class LoadedLibrary {
public:
    explicit LoadedLibrary(const char* path = QUELTA_SO_PATH);
    ~LoadedLibrary();  // dlclose: the library stops
    LoadedLibrary(const LoadedLibrary&) = delete;
    LoadedLibrary& operator=(const LoadedLibrary&) = delete;

    bool ok() const { return handle_ != nullptr && complete_; }
    const std::string& error() const { return error_; }
    const QueltaApi& api() const { return api_; }
    iKPusTimingEngine* engine() const { return api_.GetEngine ? api_.GetEngine() : nullptr; }
    iKPLogEngine* log() const { return api_.GetLogEngine ? api_.GetLogEngine() : nullptr; }

private:
    void* handle_ = nullptr;
    bool complete_ = false;
    std::string error_;
    QueltaApi api_{};
};

// The runtime's own semaphore, created with the test's copy of the platform
// layer (as a runtime would with its own). Needs PalInitialize first; this
// helper calls it.
PalSemaphore* NewRuntimeSemaphore();
void DeleteRuntimeSemaphore(PalSemaphore* s);

}  // namespace testsupport

#endif
