// The log engine's recording side, driven through iKPLogEngine as the
// runtime drives it: enabling and keys, rings and wrapping, the CPU index
// seam, configuration and construction with their allocation failures, and
// the virtual table's slot order.
#include <malloc.h>

#include <functional>

#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "log_test_helpers.h"

using namespace logtest;
using quelta::tKPLogEngine;

namespace {
uint32_t Held(iKPLogEngine* log) { return ReadOut(log, 100).count; }
}  // namespace

// --- switching recording on and off -------------------------------------------

struct EnableWay {
    const char* name;
    std::function<void(iKPLogEngine*)> enable;
};
class LogEnableWays : public LogFixture, public ::testing::WithParamInterface<EnableWay> {};

TEST_P(LogEnableWays, NewEngineRecordsOnlyOnceSwitchedOn) {
    log->LogAt1(T(100), 1);
    log->LogNow5(2);
    log->LogAtWithData(T(101), 5, 3);
    EXPECT_EQ(Held(log), 0u);
    GetParam().enable(log);
    log->LogAt1(T(200), 4);
    EXPECT_EQ(ReadOut(log, 10).Events(), std::vector<uint32_t>{4});
}

INSTANTIATE_TEST_SUITE_P(
    AllWays, LogEnableWays,
    ::testing::Values(EnableWay{"SetEnabled", [](iKPLogEngine* l) { l->SetEnabled(1); }},
                      EnableWay{"AdjustEnabled", [](iKPLogEngine* l) { l->AdjustEnabled(1); }},
                      EnableWay{"SetEnableValue", [](iKPLogEngine* l) { l->SetEnableValue(3); }},
                      EnableWay{"SetEnabledWord", [](iKPLogEngine* l) { l->SetEnabledWord(9); }}),
    [](const ::testing::TestParamInfo<EnableWay>& info) { return std::string(info.param.name); });

TEST_F(LogFixture, EnableCountNests) {
    log->SetEnabled(5);
    log->AdjustEnabled(-4);
    log->LogAt1(T(1), 1);
    log->AdjustEnabled(-1);
    log->LogAt1(T(2), 2);  // count 0: off
    log->AdjustEnabled(-3);
    log->AdjustEnabled(3);
    log->LogAt1(T(3), 3);  // still 0
    log->AdjustEnabled(1);
    log->LogAt1(T(4), 4);
    log->SetEnabled(0);
    log->LogAt1(T(5), 5);
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{1, 4}));
}

TEST_F(LogFixture, KeyedOperationsRecordOnlyWithTheCurrentKey) {
    log->LogAtIfKey15(T(1), 0x90, 0);  // key 0 never records, not even while off
    log->LogNowIfKey17(0x91, 0);
    log->SetEnableValue(7);
    log->LogNowIfKey17(1, 7);
    log->LogNowIfKey17(2, 1);
    log->LogNowIfKey18(3, 7);
    log->LogNowIfKey18(4, 1);
    log->LogAtIfKey15(T(1000), 5, 7);
    log->LogAtIfKey15(T(1001), 6, 1);
    log->LogAtIfKey16(T(1002), 7, 7);
    log->LogAtIfKey16(T(1003), 8, 1);
    log->SetEnabled(0);
    log->SetEnabled(1);  // switches on with the key set last
    log->LogAtIfKey16(T(1004), 9, 7);
    // One CPU: the read-out returns ring order whatever the times.
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{1, 3, 5, 7, 9}));
}

TEST_F(LogFixture, StampingHandsTheTimeBackEvenWhileOff) {
    ASSERT_EQ(quelta::gEngine.load(), nullptr) << "without an engine the log reads CLOCK_REALTIME";
    ClockTime t3{0, 0}, t4{0, 0};
    const uint64_t before = testsupport::RealNowNs();
    log->StampAndLog3(t3, 1);
    log->StampAndLog4(t4, 2);
    const uint64_t after = testsupport::RealNowNs();
    EXPECT_GE(quelta::ToU64(t3), before);
    EXPECT_LE(quelta::ToU64(t3), quelta::ToU64(t4));
    EXPECT_LE(quelta::ToU64(t4), after);
    EXPECT_EQ(Held(log), 0u);

    log->SetEnabled(1);
    log->StampAndLog3(t3, 3);
    EXPECT_EQ(ReadOut(log, 10).Times(), std::vector<uint64_t>{quelta::ToU64(t3)});
}

// --- rings ---------------------------------------------------------------------

TEST_F(LogFixture, EntryAfterDefaultCapacityWrapsToSlotZero) {
    log->SetEnabled(1);
    tFakeCpu = 1;
    for (uint32_t i = 1; i <= 5000; ++i) log->LogAt1(T(i), i);
    EXPECT_EQ(Record(1).writeIndex.load(), 5000u);
    EXPECT_EQ(Record(1).wrapCount.load(), 0u);
    log->LogAt1(T(5001), 5001);
    tFakeCpu = 0;
    EXPECT_EQ(Record(1).writeIndex.load(), 1u);
    EXPECT_EQ(Record(1).wrapCount.load(), 1u);
    EXPECT_EQ(Record(1).entries.load()[0].event.load(), 5001u);
    EXPECT_EQ(Record(0).writeIndex.load(), 0u);
}

// A failed query lands on record 0, a CPU beyond the count on index mod n;
// nothing reaches the other bank or beyond it.
TEST_F(LogFixture, CpuIndexOutsideTheBankIsFoldedIntoIt) {
    log->SetEnabled(1);
    At(-1, 100, 1);
    At(kCpus + 6, 200, 2);  // 10 mod 4
    At(1000003, 300, 3);    // mod 4 = 3
    const uint32_t expected[2 * kCpus] = {1, 0, 1, 1, 0, 0, 0, 0};
    for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(Record(i).writeIndex.load(), expected[i]) << i;
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{0x001, 0x202, 0x303}));
}

// --- configuration and construction -------------------------------------------

TEST_F(LogFixture, ConfigureKeepsEmptiesOrReplacesRings) {
    EXPECT_EQ(engine->capacityPerCpu.load(), 5000u);
    log->SetEnabled(1);
    log->LogAt1(T(100), 1);
    quelta::LogEntry* ring0 = Record(0).entries.load();
    const uint32_t allocs = quelta::gPalAllocCount.load();
    EXPECT_EQ(log->Configure(-1), 5000u);  // the capacity in force: same rings, emptied, off
    EXPECT_EQ(quelta::gPalAllocCount.load(), allocs);
    EXPECT_EQ(Record(0).entries.load(), ring0);
    EXPECT_EQ(engine->enabled.load(), 0u);
    EXPECT_EQ(Held(log), 0u);  // empty: leaves bank 1 active
    EXPECT_EQ(log->Configure(5000), 5000u);

    EXPECT_EQ(log->Configure(0), 0u);  // every record on its inline ring of 10
    for (uint32_t i = 0; i < 2 * kCpus; ++i) {
        EXPECT_EQ(Record(i).capacity.load(), 10u);
        EXPECT_EQ(Record(i).entries.load(), Record(i).inlineEntries);
    }
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 25; ++i) log->LogAt1(T(i), i);
    EXPECT_EQ(ReadOut(log, 100).Times(), (std::vector<uint64_t>{16, 17, 18, 19, 20, 21, 22, 23, 24, 25}));

    EXPECT_EQ(log->Configure(1), 1u);  // a one-entry ring keeps the newest entry
    log->SetEnabled(1);
    log->LogAt1(T(7), 7);
    log->LogAt1(T(8), 8);
    EXPECT_EQ(ReadOut(log, 100).Events(), std::vector<uint32_t>{8});
}

TEST_F(LogFixture, ReconfigureStoresTheResultAndClears) {
    log->Configure(16);  // not stored: Reconfigure goes back to 5000
    log->SetEnabled(1);
    log->LogAt1(T(100), 1);
    log->Reconfigure();
    EXPECT_EQ(engine->capacityPerCpu.load(), 5000u);
    EXPECT_EQ(Record(0).capacity.load(), 5000u);
    EXPECT_EQ(engine->enabled.load(), 0u);
    EXPECT_EQ(Held(log), 0u);

    log->Configure(64);
    quelta::gPalAllocFailCountdown.store(1);
    log->Reconfigure();  // stores the fallback 10, so the next one asks for 10
    EXPECT_EQ(engine->capacityPerCpu.load(), 10u);
    log->Reconfigure();
    for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(Record(i).capacity.load(), 10u);
}

// A byte size that overflows 32 bits is refused without asking the allocator;
// a refused allocation puts just that record on its inline ring.
TEST_F(LogFixture, UnallocatableRingsFallBackToTheInlineRing) {
    for (int32_t oversized : {int32_t(1) << 28, INT32_MAX, -2, INT32_MIN}) {
        log->Configure(0);
        const uint32_t allocs = quelta::gPalAllocCount.load();
        EXPECT_EQ(log->Configure(oversized), 10u) << oversized;
        EXPECT_EQ(quelta::gPalAllocCount.load(), allocs) << oversized;
        for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(Record(i).entries.load(), Record(i).inlineEntries);
    }
    quelta::gPalAllocFailCountdown.store(3);  // record 2's ring
    EXPECT_EQ(log->Configure(40), 10u);
    for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(Record(i).capacity.load(), i == 2 ? 10u : 40u);
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 15; ++i) At(2, i, i);
    for (uint32_t i = 1; i <= 15; ++i) At(0, 100 + i, i);
    EXPECT_EQ(Held(log), 25u);
}

TEST(LogEngineCreate, FailedObjectOrRecordAllocationYieldsNullAndLeaksNothing) {
    quelta::PalGetCpuCount();  // a first query might allocate; keep it out
    for (int32_t failing : {1, 2}) {
        const size_t before = mallinfo2().uordblks;
        quelta::gPalAllocFailCountdown.store(failing);
        EXPECT_EQ(tKPLogEngine::Create(), nullptr) << failing;
        quelta::gPalAllocFailCountdown.store(0);
        EXPECT_EQ(mallinfo2().uordblks, before) << failing;
    }
    quelta::gPalAllocFailCountdown.store(3);  // a ring: still an engine
    iKPLogEngine* log = tKPLogEngine::Create();
    ASSERT_NE(log, nullptr);
    EXPECT_EQ(static_cast<tKPLogEngine*>(log)->capacityPerCpu.load(), 10u);
    delete log;
}

TEST(LogEngineCreate, UnreadableCpuCountGivesOneRecordPerBank) {
    tKPLogEngine* engine = CreateWithCpus(0);
    ASSERT_NE(engine, nullptr);
    EXPECT_EQ(engine->CpuCount(), 1u);
    delete static_cast<iKPLogEngine*>(engine);
}

TEST_F(LogFixture, CreateLogEngineGivesAnIndependentEngine) {
    iKPLogEngine* second = log->CreateLogEngine();
    ASSERT_NE(second, nullptr);
    ASSERT_NE(second, log);
    log->SetEnabled(1);
    second->LogAt1(T(100), 1);  // still off
    log->LogAt1(T(200), 2);
    second->SetEnableValue(4);
    second->Configure(20);  // switches it off again, leaves the first alone
    second->LogAt1(T(300), 3);
    EXPECT_EQ(ReadOut(second, 10).count, 0u);
    delete second;
    log->LogAt1(T(400), 4);
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{2, 4}));
    EXPECT_EQ(Record(0).capacity.load(), 5000u);
}

// --- the virtual table, called by position as the runtime does -----------------

namespace {

template <typename Fn>
Fn Slot(iKPLogEngine* object, int slot) {  // the object goes first on both ABIs
    return reinterpret_cast<Fn>((*reinterpret_cast<void***>(object))[slot]);
}
using Void = void (*)(iKPLogEngine*);
using Word = void (*)(iKPLogEngine*, uint32_t);
using AtTime = void (*)(iKPLogEngine*, const ClockTime*, uint32_t);
using Stamp = void (*)(iKPLogEngine*, ClockTime*, uint32_t);
using AtTimeWord = void (*)(iKPLogEngine*, const ClockTime*, uint32_t, uint32_t);
using WordKey = void (*)(iKPLogEngine*, uint32_t, uint32_t);
using Read7 = void (*)(iKPLogEngine*, uint32_t*, uint32_t*, uint32_t*, uint32_t*, uint32_t);
using Read23 = void (*)(iKPLogEngine*, uint32_t*, uint32_t*, uint32_t*, uint32_t*, uint32_t*, uint32_t);

}  // namespace

TEST_F(LogFixture, EverySlotByPosition) {
    iKPLogEngine* L = log;
    tFakeCpu = 2;  // every event read back carries 0x200

    EXPECT_EQ(Slot<uint32_t (*)(iKPLogEngine*, int32_t)>(L, 0)(L, 50), 50u);
    EXPECT_EQ(Record(0).capacity.load(), 50u);
    Slot<Word>(L, 13)(L, 7);  // SetEnableValue
    EXPECT_EQ(engine->enableValue.load(), 7u);

    const ClockTime a = T(1000), b = T(2000), c = T(3000), d = T(4000);
    ClockTime t3{0, 0}, t4{0, 0};
    Slot<AtTime>(L, 1)(L, &a, 0x01);
    Slot<AtTime>(L, 2)(L, &b, 0x02);
    Slot<Stamp>(L, 3)(L, &t3, 0x03);
    Slot<Stamp>(L, 4)(L, &t4, 0x04);
    Slot<Word>(L, 5)(L, 0x05);
    Slot<Word>(L, 6)(L, 0x06);
    for (int slot : {15, 16}) {
        Slot<AtTimeWord>(L, slot)(L, &c, 0x0F + (slot - 15), 7);
        Slot<AtTimeWord>(L, slot)(L, &c, 0x8F, 8);  // wrong key
    }
    for (int slot : {17, 18}) {
        Slot<WordKey>(L, slot)(L, 0x11 + (slot - 17), 7);
        Slot<WordKey>(L, slot)(L, 0x91, 8);
    }
    Slot<AtTimeWord>(L, 20)(L, &d, 0x1234, 0x14);  // LogAtWithData: time, data, event
    Slot<Word>(L, 21)(L, 0x15);
    Slot<Word>(L, 22)(L, 0x16);

    const std::vector<uint32_t> events = {1, 2, 3, 4, 5, 6, 0x0F, 0x10, 0x11, 0x12, 0x14, 0x15, 0x16};
    constexpr uint32_t N = 0xFFFFFFFFu;
    const std::vector<uint32_t> data = {N, N, N, N, N, N, N, N, N, N, 0x1234, 256, 0};
    std::vector<uint32_t> lo(20), hi(20), ev(20), da(20);
    uint32_t count = 20;
    Slot<Read23>(L, 23)(L, &count, lo.data(), hi.data(), ev.data(), da.data(), 0);
    ASSERT_EQ(count, events.size());
    for (size_t i = 0; i < events.size(); ++i) {
        EXPECT_EQ(ev[i], events[i] | 0x200u) << i;
        EXPECT_EQ(da[i], data[i]) << i;
    }
    EXPECT_EQ(lo[1], 2000u);
    EXPECT_EQ(lo[2], t3.low);
    EXPECT_EQ(hi[3], t4.high);
    EXPECT_EQ(lo[10], 4000u);

    std::vector<uint32_t> lo7(20), hi7(20), ev7(20);
    uint32_t count7 = 20;
    Slot<Read7>(L, 7)(L, &count7, lo7.data(), hi7.data(), ev7.data(), 0);
    EXPECT_EQ(count7, count);
    EXPECT_EQ(lo7, lo);
    EXPECT_EQ(ev7, ev);

    Slot<Word>(L, 8)(L, 9);  // SetEnabledWord
    Slot<Void>(L, 9)(L);
    Slot<Void>(L, 10)(L);
    EXPECT_EQ(engine->enabled.load(), 9u);
    EXPECT_EQ(engine->enableValue.load(), 7u);
    Slot<Word>(L, 11)(L, 2);  // SetEnabled
    EXPECT_EQ(engine->enableCount.load(), 2);
    EXPECT_EQ(engine->enabled.load(), 7u);
    Slot<void (*)(iKPLogEngine*, int32_t)>(L, 12)(L, -2);  // AdjustEnabled
    EXPECT_EQ(engine->enabled.load(), 0u);

    iKPLogEngine* other = Slot<iKPLogEngine* (*)(iKPLogEngine*)>(L, 14)(L);
    ASSERT_NE(other, nullptr);
    EXPECT_NE(other, L);
    Slot<Void>(L, 19)(L);  // Reconfigure: back to 5000, emptied
    EXPECT_EQ(Record(0).capacity.load(), 5000u);
    EXPECT_EQ(Held(L), 0u);

    // 24 destroys without freeing (freeing afterwards would be a double free
    // were the slots swapped); 25 destroys and frees.
    Slot<Void>(other, 24)(other);
    quelta::PalMemFree(other);
    iKPLogEngine* third = tKPLogEngine::Create();
    ASSERT_NE(third, nullptr);
    Slot<Void>(third, 25)(third);
}
