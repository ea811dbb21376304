#include "LoadedLibrary.h"

#include <dlfcn.h>

#include <mutex>

#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace testsupport {

LoadedLibrary::LoadedLibrary(const char* path) {
    handle_ = dlopen(path, RTLD_NOW | RTLD_LOCAL);
    if (handle_ == nullptr) {
        const char* e = dlerror();
        error_ = e ? e : "dlopen failed";
        return;
    }
    complete_ = true;
    auto get = [&](auto& fn, const char* name) {
        fn = reinterpret_cast<std::remove_reference_t<decltype(fn)>>(dlsym(handle_, name));
        if (fn == nullptr) {
            complete_ = false;
            error_ += std::string("missing ") + name + "; ";
        }
    };
    get(api_.WaitUntilClocks, "quelta_iTSC_WaitUntilClocks_C");
    get(api_.WaitUntilClocks64, "quelta_iTSC_WaitUntilClocks64_C");
    get(api_.WaitClocks, "quelta_iTSC_WaitClocks_C");
    get(api_.WaitUntilNextMultipleClocks, "quelta_iTSC_WaitUntilNextMultipleClocks_C");
    get(api_.WaitMicroSeconds, "quelta_iTSC_WaitMicroSeconds_C");
    get(api_.WaitUntilMicroSeconds, "quelta_iTSC_WaitUntilMicroSeconds_C");
    get(api_.WaitUntilNextMultipleMicroSeconds, "quelta_iTSC_WaitUntilNextMultipleMicroSeconds_C");
    get(api_.GetCPUSpeed, "quelta_iTSC_GetCPUSpeed_C");
    get(api_.GetCPUTicksPerMS, "quelta_iTSC_GetCPUTicksPerMS_C");
    get(api_.WaitUntilGlobalClocks64, "quelta_iTSC_WaitUntilGlobalClocks64_C");
    get(api_.EventWait, "quelta_iTSCEvent_Wait_C");
    get(api_.EventWaitCallback, "quelta_iTSCEvent_Wait_Callback_C");
    get(api_.SetCallback, "quelta_iTSC_SetCallback");
    get(api_.SetCallbackTime, "quelta_iTSC_SetCallbackTime");
    get(api_.GetEngine, "GetEngine__MERIDOX");
    get(api_.GetLogEngine, "GetLogEngine__MERIDOX");
}

LoadedLibrary::~LoadedLibrary() {
    if (handle_ != nullptr) dlclose(handle_);
}

PalSemaphore* NewRuntimeSemaphore() {
    // The platform layer is initialised once, as a runtime's start-up would.
    static std::once_flag once;
    std::call_once(once, [] { quelta::PalInitialize(); });
    PalSemaphore* s = nullptr;
    quelta::PalSemaphoreCreate(&s);
    return s;
}

void DeleteRuntimeSemaphore(PalSemaphore* s) { quelta::PalSemaphoreDestroy(s); }

}  // namespace testsupport
