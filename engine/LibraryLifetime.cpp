// The load hook and the stop of the shared library.
//
// A static object of the library: its construction runs among the library's
// static initialisers when it is loaded, and its destruction is registered in
// the library's own at-exit list, so the stop runs once, at unload or at
// process exit, whichever comes first, whether or not the start succeeded.
#include "engine/LibraryFrame.h"
#include "engine/WaitList.h"

namespace quelta {
namespace {

struct LibraryLifetime {
    LibraryLifetime() {
        InitSchedLock();
        SetLoadTimeSchedulerState();
        (void)LibraryControl(0, 1, 0);
    }
    ~LibraryLifetime() { (void)LibraryControl(0, 0, 0); }
};

LibraryLifetime gLibraryLifetime;

}  // namespace
}  // namespace quelta
