// A program built against the installed libquelta: it links -lquelta (no
// dlopen), takes the engine, waits 2 ms and checks that the wait did not
// return early. Prints OK on success.
#include <quelta/quelta.h>

#include <stdio.h>

int main() {
    iKPusTimingEngine* engine = GetEngine__MERIDOX();
    if (engine == nullptr || GetLogEngine__MERIDOX() == nullptr) {
        puts("library not started");
        return 1;
    }
    ClockTime before;
    engine->ReadMonotonic0(before);
    const uint32_t after = quelta_iTSC_WaitClocks_C(2000000);  // 2 ms, plain wait
    const int32_t waited = static_cast<int32_t>(after - before.low);
    if (waited < 2000000) {
        printf("early: waited %d ns\n", waited);
        return 1;
    }
    puts("OK");
    return 0;
}
