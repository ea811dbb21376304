// ArmTimer and the timer's serving state.
#include "engine/TimerArming.h"

#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"

namespace quelta {

bool TimerServing() {
    tKPusLinuxNanoSleepTimer* timer = gTimer.load(std::memory_order_acquire);
    return timer != nullptr && timer->IsServing();
}

uint32_t ArmTimer(const ClockTime& when) {
    tKPusLinuxNanoSleepTimer* timer = gTimer.load(std::memory_order_acquire);
    // A timer whose thread could not get real-time priority serves nothing:
    // treat it as absent so that nobody queues a wait that would never end.
    if (timer == nullptr || !timer->IsServing()) return 0;
    iKPusLinuxTimer* t = timer;
    if (IsNever(when)) {
        t->ExpireNow();
    } else if (when.high == 0xFFFFFFFFu) {
        // Such a time comes before 0 in the library's order: it has passed.
        // Taken as an unsigned count it would park the timer for decades.
        t->SetExpiry(ClockTime{0, 0});
    } else {
        t->SetExpiry(when);
    }
    return 1;
}

}  // namespace quelta
