// The engine's small hand-offs (engine/HandOff.h) under the C++ memory
// model: the callback and its argument, the tick callback, the lateness
// samples and their count, the callers and the stop, and the long-lived
// objects. Each runs the library's own steps over RlAtomics; what a hand-off
// carries is a plain variable (rl::var), so a missing edge shows as a data
// race or a stale value.
#include "engine/HandOff.h"

#include "RelacyAtomics.h"

namespace {

using models::RlAtomics;

// The words hold functions in the library; Relacy's atomics take object
// pointers only, so a function is an object here.
struct Function {};
Function gCallback, gTickCallback;

// quelta_iTSC_SetCallback against a tick service pass: a pass that finds the
// function finds its argument, and what the setter wrote there before.
struct CallbackPair : rl::test_suite<CallbackPair, 2> {
    rl::atomic<Function*> fn;
    rl::atomic<void*> arg;
    rl::var<int> state;

    void before() {
        fn.store(nullptr, rl::mo_relaxed, $);
        arg.store(nullptr, rl::mo_relaxed, $);
    }
    void thread(unsigned index) {
        if (index == 0) {
            state($) = 42;
            quelta::PublishCallback<RlAtomics>(fn, arg, &gCallback, &state);
            return;
        }
        void* taken = nullptr;
        if (quelta::TakeCallback<RlAtomics>(fn, arg, taken) != nullptr) {
            RL_ASSERT(taken == &state);
            RL_ASSERT((*static_cast<rl::var<int>*>(taken))($) == 42);
        }
    }
};

// RegisterTickCallback against a tick: the tick that calls the function sees
// what the registering thread wrote before registering it.
struct TickCallbackRegistered : rl::test_suite<TickCallbackRegistered, 2> {
    rl::atomic<Function*> word;
    rl::var<int> state;

    void before() { word.store(nullptr, rl::mo_relaxed, $); }
    void thread(unsigned index) {
        if (index == 0) {
            state($) = 7;
            quelta::PublishTickCallback<RlAtomics>(word, &gTickCallback);
        } else if (quelta::TakeTickCallback<RlAtomics>(word) != nullptr) {
            RL_ASSERT(state($) == 7);
        }
    }
};

// The tick service's lateness samples against Calibrate: every sample the
// count covers is the one recorded, never the zero it was reset to.
struct SamplesCounted : rl::test_suite<SamplesCounted, 2> {
    static constexpr uint32_t kSize = 2;
    rl::atomic<uint32_t> samples[kSize];
    rl::atomic<int32_t> count;

    void before() {
        for (auto& s : samples) s.store(0, rl::mo_relaxed, $);
        count.store(0, rl::mo_relaxed, $);
    }
    void thread(unsigned index) {
        if (index == 0) {
            for (uint32_t value = 5; value < 5 + kSize; ++value) {
                quelta::RecordSample<RlAtomics>(samples, kSize, count, value);
            }
            return;
        }
        const int32_t n = quelta::SamplesCounted<RlAtomics>(count);
        for (int32_t i = 0; i < n; ++i) RL_ASSERT(samples[i].load(rl::mo_relaxed, $) == 5u + i);
    }
};

// A caller entering node-using code against the stop: either the caller
// turns back, or the stop waits for it; never does the stop destroy what a
// caller inside still uses.
struct CallersAndStop : rl::test_suite<CallersAndStop, 2> {
    rl::atomic<int32_t> inside;
    rl::atomic<bool> stopping;
    rl::var<int> engine;  // what the stop destroys: 1 alive, 0 destroyed

    void before() {
        inside.store(0, rl::mo_relaxed, $);
        stopping.store(false, rl::mo_relaxed, $);
        engine($) = 1;
    }
    void thread(unsigned index) {
        if (index == 0) {
            if (quelta::EnterUnlessStopping<RlAtomics>(inside, stopping)) {
                RL_ASSERT(engine($) == 1);
                quelta::LeaveInside<RlAtomics>(inside);
            }
            return;
        }
        quelta::BeginStop<RlAtomics>(stopping);
        if (quelta::NobodyInside<RlAtomics>(inside)) engine($) = 0;
    }
};

// A long-lived object built on one thread and published: the timer thread,
// which started before the engine was built, borrows it and finds it whole;
// the stop withdraws it and may destroy it.
struct Object {
    rl::var<int> field;  // stands for the object's words and virtual table
};

struct ObjectPublished : rl::test_suite<ObjectPublished, 2> {
    rl::atomic<Object*> word;
    Object object;

    void before() { word.store(nullptr, rl::mo_relaxed, $); }
    void thread(unsigned index) {
        if (index == 0) {
            object.field($) = 1;
            quelta::Publish<RlAtomics>(word, &object);
        } else if (Object* borrowed = quelta::Published<RlAtomics>(word)) {
            RL_ASSERT(borrowed->field($) == 1);
        }
    }
};

struct ObjectWithdrawn : rl::test_suite<ObjectWithdrawn, 2> {
    rl::atomic<Object*> word;
    Object object;

    void before() { word.store(nullptr, rl::mo_relaxed, $); }
    void thread(unsigned index) {
        if (index == 0) {
            object.field($) = 1;
            quelta::Publish<RlAtomics>(word, &object);
        } else if (Object* withdrawn = quelta::Withdraw<RlAtomics>(word)) {
            withdrawn->field($) = 0;  // destroyed
        }
    }
};

const models::Case kCases[] = {
    {"callback and argument", &models::Simulate<CallbackPair>, 4},
    {"tick callback", &models::Simulate<TickCallbackRegistered>, 4},
    {"lateness samples and their count", &models::Simulate<SamplesCounted>, 4},
    {"callers and the stop", &models::Simulate<CallersAndStop>, 4},
    {"object published", &models::Simulate<ObjectPublished>, 4},
    {"object withdrawn", &models::Simulate<ObjectWithdrawn>, 4},
};

}  // namespace

int main(int argc, char** argv) { return models::RunModels(argc, argv, kCases, sizeof kCases / sizeof kCases[0]); }
