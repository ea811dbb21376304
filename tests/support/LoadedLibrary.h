// The built libquelta.so.6 loaded the way a runtime loads it: dlopen, then
// every entry resolved by name.
#ifndef QUELTA_TESTS_LOADEDLIBRARY_H
#define QUELTA_TESTS_LOADEDLIBRARY_H

#include <string>

#include "quelta/quelta.h"

namespace testsupport {

// Every entry a runtime resolves by name: X(field, exported symbol).
#define QUELTA_API_ENTRIES(X)                                                                              \
    X(WaitUntilClocks, quelta_iTSC_WaitUntilClocks_C) X(WaitUntilClocks64, quelta_iTSC_WaitUntilClocks64_C) \
    X(WaitClocks, quelta_iTSC_WaitClocks_C) X(WaitUntilNextMultipleClocks, quelta_iTSC_WaitUntilNextMultipleClocks_C) \
    X(WaitMicroSeconds, quelta_iTSC_WaitMicroSeconds_C) X(WaitUntilMicroSeconds, quelta_iTSC_WaitUntilMicroSeconds_C) \
    X(WaitUntilNextMultipleMicroSeconds, quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C)                   \
    X(GetCPUSpeed, quelta_iTSC_GetCPUSpeed_C) X(GetCPUTicksPerMS, quelta_iTSC_GetCPUTicksPerMS_C)           \
    X(WaitUntilGlobalClocks64, quelta_iTSC_WaitUntilGlobalClocks64_C) X(EventWait, quelta_iTSCEvent_Wait_C) \
    X(EventWaitCallback, quelta_iTSCEvent_Wait_Callback_C) X(SetCallback, quelta_iTSC_SetCallback)          \
    X(SetCallbackTime, quelta_iTSC_SetCallbackTime) X(GetEngine, GetEngine__MERIDOX)                        \
    X(GetLogEngine, GetLogEngine__MERIDOX)

struct QueltaApi {
#define QUELTA_API_FIELD(field, symbol) decltype(&symbol) field;
    QUELTA_API_ENTRIES(QUELTA_API_FIELD)
#undef QUELTA_API_FIELD
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

// The runtime's own semaphore, made with the test's copy of the platform
// layer (as a runtime would with its own); initialises that layer once.
PalSemaphore* NewRuntimeSemaphore();
void DeleteRuntimeSemaphore(PalSemaphore* s);

}  // namespace testsupport

#endif
