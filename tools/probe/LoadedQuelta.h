// libquelta.so.6 loaded as a runtime loads it: dlopen, every exported entry
// resolved by name, the two engines taken from their accessors.
#ifndef QUELTA_PROBE_LOADEDQUELTA_H
#define QUELTA_PROBE_LOADEDQUELTA_H

#include <string>

#include "quelta/quelta.h"

namespace qprobe {

struct QueltaEntries {
    decltype(&quelta_iTSC_WaitUntilClocks64_C) waitUntilClocks64 = nullptr;
    decltype(&quelta_iTSC_WaitUntilGlobalClocks64_C) waitUntilGlobalClocks64 = nullptr;
    decltype(&quelta_iTSCEvent_Wait_C) eventWait = nullptr;
    decltype(&quelta_iTSCEvent_Wait_Callback_C) eventWaitCallback = nullptr;
    decltype(&quelta_iTSC_SetCallback) setCallback = nullptr;
    decltype(&quelta_iTSC_SetCallbackTime) setCallbackTime = nullptr;
    decltype(&GetEngine__MERIDOX) getEngine = nullptr;
    decltype(&GetLogEngine__MERIDOX) getLogEngine = nullptr;
};

class LoadedQuelta {
public:
    LoadedQuelta() = default;
    ~LoadedQuelta();  // unloads (the library stops)
    LoadedQuelta(const LoadedQuelta&) = delete;
    LoadedQuelta& operator=(const LoadedQuelta&) = delete;

    // False with a message for a person in error().
    bool Load(const std::string& path);
    void Unload();

    const std::string& error() const { return error_; }
    // The file the loader actually opened (a bare name resolved), or the
    // name given when the loader does not say.
    std::string ResolvedPath() const;
    const QueltaEntries& fn() const { return fn_; }
    iKPusTimingEngine* engine() const { return engine_; }
    iKPLogEngine* log() const { return log_; }

private:
    void* handle_ = nullptr;
    QueltaEntries fn_;
    iKPusTimingEngine* engine_ = nullptr;
    iKPLogEngine* log_ = nullptr;
    std::string error_;
    std::string path_;
};

}  // namespace qprobe

#endif
