#include "probe/LoadedQuelta.h"

#include <dlfcn.h>
#include <link.h>
#include <sys/stat.h>

#include <cerrno>
#include <type_traits>
#include <cstring>

namespace qprobe {

LoadedQuelta::~LoadedQuelta() { Unload(); }

void LoadedQuelta::Unload() {
    engine_ = nullptr;
    log_ = nullptr;
    fn_ = QueltaEntries{};
    if (handle_ != nullptr) {
        dlclose(handle_);
        handle_ = nullptr;
    }
}

std::string LoadedQuelta::ResolvedPath() const {
    link_map* map = nullptr;
    if (handle_ != nullptr && dlinfo(handle_, RTLD_DI_LINKMAP, &map) == 0 && map != nullptr && map->l_name &&
        map->l_name[0] != '\0') {
        return map->l_name;
    }
    return path_;
}

bool LoadedQuelta::Load(const std::string& path) {
    Unload();
    path_ = path;
    // A path with a slash names a file: say plainly when it is not one. A bare
    // name is left to the dynamic loader's search, as a runtime would.
    if (path.find('/') != std::string::npos) {
        struct stat st{};
        if (stat(path.c_str(), &st) != 0) {
            error_ = "cannot load library '" + path + "': " + std::strerror(errno);
            return false;
        }
        if (!S_ISREG(st.st_mode)) {
            error_ = "cannot load library '" + path + "': not a regular file";
            return false;
        }
    }
    dlerror();
    handle_ = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (handle_ == nullptr) {
        const char* e = dlerror();
        error_ = "cannot load library '" + path + "': " + (e ? e : "dlopen failed");
        return false;
    }
    std::string missing;
    auto get = [&](auto& slot, const char* name) {
        slot = reinterpret_cast<std::remove_reference_t<decltype(slot)>>(dlsym(handle_, name));
        if (slot == nullptr) missing += missing.empty() ? name : std::string(", ") + name;
    };
    get(fn_.waitUntilClocks64, "quelta_iTSC_WaitUntilClocks64_C");
    get(fn_.waitUntilGlobalClocks64, "quelta_iTSC_WaitUntilGlobalClocks64_C");
    get(fn_.eventWait, "quelta_iTSCEvent_Wait_C");
    get(fn_.eventWaitCallback, "quelta_iTSCEvent_Wait_Callback_C");
    get(fn_.setCallback, "quelta_iTSC_SetCallback");
    get(fn_.setCallbackTime, "quelta_iTSC_SetCallbackTime");
    get(fn_.getEngine, "GetEngine__MERIDOX");
    get(fn_.getLogEngine, "GetLogEngine__MERIDOX");
    if (!missing.empty()) {
        error_ = "library '" + path + "' lacks symbol(s): " + missing;
        Unload();
        return false;
    }
    engine_ = fn_.getEngine();
    log_ = fn_.getLogEngine();
    if (engine_ == nullptr || log_ == nullptr) {
        error_ = "library '" + path + "' loaded but did not start: " +
                 (engine_ == nullptr ? "GetEngine__MERIDOX" : "GetLogEngine__MERIDOX") + " returned null";
        Unload();
        return false;
    }
    return true;
}

}  // namespace qprobe
