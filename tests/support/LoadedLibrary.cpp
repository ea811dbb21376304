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
        if (fn == nullptr) complete_ = false, error_ += std::string("missing ") + name + "; ";
    };
#define QUELTA_API_GET(field, symbol) get(api_.field, #symbol);
    QUELTA_API_ENTRIES(QUELTA_API_GET)
#undef QUELTA_API_GET
}

LoadedLibrary::~LoadedLibrary() {
    if (handle_ != nullptr) dlclose(handle_);
}

PalSemaphore* NewRuntimeSemaphore() {
    static std::once_flag once;  // as a runtime's start-up would, once
    std::call_once(once, [] { quelta::PalInitialize(); });
    PalSemaphore* s = nullptr;
    quelta::PalSemaphoreCreate(&s);
    return s;
}

void DeleteRuntimeSemaphore(PalSemaphore* s) { quelta::PalSemaphoreDestroy(s); }

}  // namespace testsupport
