// The log engine's recording side, driven through iKPLogEngine as the
// runtime drives it: enabling and keys, rings and wrapping, configuration and
// its allocation failures, construction failures, the CPU index seam and the
// virtual table's slot order.
#include <malloc.h>

#include <functional>

#include "log_test_helpers.h"
#include "TestSupport.h"
#include "engine/LibraryFrame.h"

using namespace logtest;
using quelta::LogCpuRecord;
using quelta::tKPLogEngine;

namespace {

uint32_t Held(iKPLogEngine* log) { return ReadOut(log, 100).count; }

// Bytes the C allocator has handed out and not taken back.
size_t BytesInUse() { return mallinfo2().uordblks; }

}  // namespace

// --- switching recording on and off ---------------------------------------

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
    const ReadOutResult r = ReadOut(log, 10);
    ASSERT_EQ(r.count, 1u);
    EXPECT_EQ(r.events[0], 4u);
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
    log->LogAt1(T(100), 1);
    EXPECT_EQ(Held(log), 1u);

    log->AdjustEnabled(-1);
    log->LogAt1(T(200), 2);
    EXPECT_EQ(Held(log), 1u) << "the count reached 0: recording is off";

    // Below zero stays off until the count is positive again.
    log->AdjustEnabled(-3);
    log->AdjustEnabled(3);
    log->LogAt1(T(300), 3);
    EXPECT_EQ(Held(log), 1u);
    log->AdjustEnabled(1);
    log->LogAt1(T(400), 4);
    EXPECT_EQ(Held(log), 2u);

    log->SetEnabled(0);
    log->LogAt1(T(500), 5);
    EXPECT_EQ(Held(log), 2u);
}

TEST_F(LogFixture, KeyedOperationsRecordOnlyWithTheCurrentKey) {
    log->SetEnableValue(7);
    log->LogNowIfKey17(1, 7);
    log->LogNowIfKey17(2, 1);
    log->LogNowIfKey18(3, 7);
    log->LogNowIfKey18(4, 1);
    log->LogAtIfKey15(T(1000), 5, 7);
    log->LogAtIfKey15(T(1001), 6, 1);
    log->LogAtIfKey16(T(1002), 7, 7);
    log->LogAtIfKey16(T(1003), 8, 1);
    // Mixed times (clock stamps, then small caller times) on one CPU: the
    // read-out returns ring order, so compare events only.
    EXPECT_EQ(Events(ReadOut(log, 10)), (std::vector<uint32_t>{1, 3, 5, 7}));

    // Switching on by count uses the key set last.
    log->SetEnabled(0);
    log->SetEnabled(1);
    EXPECT_EQ(engine->enabled.load(), 7u);
    log->LogAtIfKey15(T(1004), 9, 7);
    EXPECT_EQ(ReadOut(log, 10).count, 5u);
}

TEST_F(LogFixture, KeyZeroNeverRecords) {
    log->LogAtIfKey15(T(100), 1, 0);
    log->LogAtIfKey16(T(100), 2, 0);
    log->LogNowIfKey17(3, 0);
    log->LogNowIfKey18(4, 0);
    log->SetEnableValue(0);  // switches on with key 0, which is off
    log->LogAtIfKey15(T(100), 5, 0);
    EXPECT_EQ(Held(log), 0u);
}

TEST_F(LogFixture, StampingHandsTheTimeBackEvenWhileOff) {
    ASSERT_EQ(quelta::gEngine.load(), nullptr) << "without an engine the log reads CLOCK_REALTIME";
    ClockTime t3{0, 0}, t4{0, 0};
    const uint64_t before = testsupport::RealNowNs();
    log->StampAndLog3(t3, 1);
    log->StampAndLog4(t4, 2);
    const uint64_t after = testsupport::RealNowNs();
    EXPECT_GE(quelta::ToU64(t3), before);
    EXPECT_LE(quelta::ToU64(t4), after);
    EXPECT_LE(quelta::ToU64(t3), quelta::ToU64(t4));
    EXPECT_EQ(Held(log), 0u);

    log->SetEnabled(1);
    log->StampAndLog3(t3, 3);
    const ReadOutResult r = ReadOut(log, 10);
    ASSERT_EQ(r.count, 1u);
    EXPECT_EQ(r.Time(0), quelta::ToU64(t3)) << "the entry carries the time handed back";
}

// --- rings ------------------------------------------------------------------

TEST(LogEngineRings, EntryAfterDefaultCapacityWrapsToSlotZero) {
    FakeCpus fake;
    tKPLogEngine* engine = CreateWithCpus(2);
    ASSERT_NE(engine, nullptr);
    iKPLogEngine* log = engine;
    log->SetEnabled(1);
    tFakeCpu = 1;
    for (uint32_t i = 1; i <= 5000; ++i) log->LogAt1(T(i), i);
    const LogCpuRecord& record = engine->records[1];
    EXPECT_EQ(record.writeIndex.load(), 5000u);
    EXPECT_EQ(record.wrapCount.load(), 0u);

    log->LogAt1(T(5001), 5001);
    EXPECT_EQ(record.writeIndex.load(), 1u);
    EXPECT_EQ(record.wrapCount.load(), 1u);
    EXPECT_EQ(record.entries.load()[0].event.load(), 5001u);
    EXPECT_EQ(engine->records[0].writeIndex.load(), 0u) << "other CPUs untouched";
    tFakeCpu = 0;
    delete log;
}

TEST_F(LogFixture, CpuIndexOutsideTheBankIsFoldedIntoIt) {
    log->Configure(8);
    log->SetEnabled(1);
    tFakeCpu = -1;  // the query failed: record 0
    log->LogAt1(T(100), 1);
    tFakeCpu = kCpus + 6;  // a CPU that came online later: 10 mod 4
    log->LogAt1(T(200), 2);
    tFakeCpu = 1000003;  // mod 4 = 3
    log->LogAt1(T(300), 3);
    tFakeCpu = 0;

    EXPECT_EQ(engine->records[0].writeIndex.load(), 1u);
    EXPECT_EQ(engine->records[1].writeIndex.load(), 0u);
    EXPECT_EQ(engine->records[2].writeIndex.load(), 1u);
    EXPECT_EQ(engine->records[3].writeIndex.load(), 1u);
    for (uint32_t i = kCpus; i < 2 * kCpus; ++i) EXPECT_EQ(engine->records[i].writeIndex.load(), 0u);

    const ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(Events(r), (std::vector<uint32_t>{0x001, 0x202, 0x303}));
}

// --- configuration ---------------------------------------------------------

TEST_F(LogFixture, ConfigureBuildsEmptiesAndReleasesRings) {
    EXPECT_EQ(engine->capacityPerCpu.load(), 5000u);
    EXPECT_EQ(log->Configure(-1), 5000u);

    // The same capacity keeps every ring and only empties it (and stops
    // recording).
    log->SetEnabled(1);
    log->LogAt1(T(100), 1);
    quelta::LogEntry* ring0 = engine->records[0].entries.load();
    const uint32_t allocsBefore = quelta::gPalAllocCount.load();
    EXPECT_EQ(log->Configure(5000), 5000u);
    EXPECT_EQ(quelta::gPalAllocCount.load(), allocsBefore);
    EXPECT_EQ(engine->records[0].entries.load(), ring0);
    EXPECT_EQ(Held(log), 0u);
    EXPECT_EQ(engine->enabled.load(), 0u);

    // 0: every record on its inline ring of 10.
    EXPECT_EQ(log->Configure(0), 0u);
    for (uint32_t i = 0; i < 2 * kCpus; ++i) {
        EXPECT_EQ(engine->records[i].capacity.load(), 10u);
        EXPECT_EQ(engine->records[i].entries.load(), engine->records[i].inlineEntries);
    }
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 25; ++i) log->LogAt1(T(i), i);
    ReadOutResult r = ReadOut(log, 100);
    ASSERT_EQ(r.count, 10u);
    EXPECT_EQ(r.Time(0), 16u);
    EXPECT_EQ(r.Time(9), 25u);

    // 1: a one-entry ring keeps only the newest entry.
    EXPECT_EQ(log->Configure(1), 1u);
    log->SetEnabled(1);
    log->LogAt1(T(7), 7);
    log->LogAt1(T(8), 8);
    r = ReadOut(log, 100);
    ASSERT_EQ(r.count, 1u);
    EXPECT_EQ(r.events[0], 8u);
    // The empty read-outs above left bank 1 active.
    EXPECT_EQ(engine->records[engine->activeBank.load()].wrapCount.load(), 1u);
}

TEST_F(LogFixture, ReconfigureStoresItsResultAndClears) {
    log->Configure(16);  // not stored: Reconfigure goes back to 5000
    log->SetEnabled(1);
    log->LogAt1(T(100), 1);
    log->Reconfigure();
    EXPECT_EQ(engine->capacityPerCpu.load(), 5000u);
    EXPECT_EQ(engine->records[0].capacity.load(), 5000u);
    EXPECT_EQ(engine->enabled.load(), 0u);
    EXPECT_EQ(Held(log), 0u);

    // A Reconfigure whose allocation fails stores the fallback result, so the
    // next one asks for 10-entry rings.
    log->Configure(64);
    quelta::gPalAllocFailCountdown.store(1);
    log->Reconfigure();
    EXPECT_EQ(quelta::gPalAllocFailCountdown.load(), 0);
    EXPECT_EQ(engine->capacityPerCpu.load(), 10u);
    EXPECT_EQ(engine->records[1].capacity.load(), 5000u);
    log->Reconfigure();
    EXPECT_EQ(engine->capacityPerCpu.load(), 10u);
    for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(engine->records[i].capacity.load(), 10u);
}

class LogConfigureFallback : public LogFixture, public ::testing::WithParamInterface<int32_t> {};

// Capacities whose byte size does not fit 32 bits are refused without asking
// the allocator; every record keeps working on its inline ring.
TEST_P(LogConfigureFallback, OversizedCapacityFallsBackToTheInlineRing) {
    log->Configure(0);
    const uint32_t allocsBefore = quelta::gPalAllocCount.load();
    EXPECT_EQ(log->Configure(GetParam()), 10u);
    EXPECT_EQ(quelta::gPalAllocCount.load(), allocsBefore) << "no allocation attempted";
    for (uint32_t i = 0; i < 2 * kCpus; ++i) {
        EXPECT_EQ(engine->records[i].capacity.load(), 10u);
        EXPECT_EQ(engine->records[i].entries.load(), engine->records[i].inlineEntries);
    }
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 12; ++i) log->LogAt1(T(i), i);
    EXPECT_EQ(Held(log), 10u);
}

INSTANTIATE_TEST_SUITE_P(Capacities, LogConfigureFallback,
                         ::testing::Values(int32_t(1) << 28, INT32_MAX, -2, INT32_MIN));

TEST_F(LogFixture, FailedRingAllocationFallsBackForThatRecordOnly) {
    quelta::gPalAllocFailCountdown.store(3);  // the third record's ring
    EXPECT_EQ(log->Configure(40), 10u);
    for (uint32_t i = 0; i < 2 * kCpus; ++i) {
        const bool failed = i == 2;
        EXPECT_EQ(engine->records[i].capacity.load(), failed ? 10u : 40u) << i;
        EXPECT_EQ(engine->records[i].entries.load() == engine->records[i].inlineEntries, failed) << i;
    }
    log->SetEnabled(1);
    tFakeCpu = 2;
    for (uint32_t i = 1; i <= 15; ++i) log->LogAt1(T(i), i);
    tFakeCpu = 0;
    for (uint32_t i = 1; i <= 15; ++i) log->LogAt1(T(100 + i), i);
    const ReadOutResult r = ReadOut(log, 100);
    EXPECT_EQ(r.count, 25u) << "10 on the inline ring, 15 on a full one";
}

// --- construction -----------------------------------------------------------

TEST(LogEngineCreate, FailedObjectOrRecordAllocationYieldsNullAndLeaksNothing) {
    quelta::PalGetCpuCount();  // the first query may allocate; keep it out
    for (int32_t failing : {1, 2}) {
        const size_t before = BytesInUse();
        quelta::gPalAllocFailCountdown.store(failing);
        tKPLogEngine* engine = tKPLogEngine::Create();
        quelta::gPalAllocFailCountdown.store(0);
        EXPECT_EQ(engine, nullptr) << "allocation " << failing;
        EXPECT_EQ(BytesInUse(), before) << "allocation " << failing;
    }
}

TEST(LogEngineCreate, FailedRingAllocationStillYieldsAWorkingEngine) {
    quelta::gPalAllocFailCountdown.store(3);  // the first ring
    tKPLogEngine* engine = tKPLogEngine::Create();
    quelta::gPalAllocFailCountdown.store(0);
    ASSERT_NE(engine, nullptr);
    EXPECT_EQ(engine->capacityPerCpu.load(), 10u);
    EXPECT_EQ(engine->records[0].capacity.load(), 10u);
    EXPECT_EQ(engine->records[1].capacity.load(), 5000u);
    delete static_cast<iKPLogEngine*>(engine);
}

TEST(LogEngineCreate, UnreadableCpuCountGivesOneRecordPerBank) {
    FakeCpus fake;
    for (int32_t cpus : {0, -1}) {
        const int32_t saved = quelta::gCpuCount.load();
        long (*savedQuery)() = quelta::gPalOnlineCpuQuery;
        quelta::gPalOnlineCpuQuery = [] { return -1L; };
        quelta::gCpuCount.store(cpus);
        tKPLogEngine* engine = tKPLogEngine::Create();
        quelta::gCpuCount.store(saved);
        quelta::gPalOnlineCpuQuery = savedQuery;
        ASSERT_NE(engine, nullptr);
        EXPECT_EQ(engine->CpuCount(), 1u);
        iKPLogEngine* log = engine;
        log->SetEnabled(1);
        tFakeCpu = 3;
        log->LogAt1(T(5), 5);
        tFakeCpu = 0;
        const ReadOutResult r = ReadOut(log, 4);
        ASSERT_EQ(r.count, 1u);
        EXPECT_EQ(r.events[0], 5u);
        delete log;
    }
}

TEST_F(LogFixture, CreateLogEngineGivesAnIndependentEngine) {
    iKPLogEngine* second = log->CreateLogEngine();
    ASSERT_NE(second, nullptr);
    ASSERT_NE(second, log);
    log->SetEnabled(1);
    second->LogAt1(T(100), 1);  // still off
    log->LogAt1(T(200), 2);
    second->SetEnableValue(4);
    second->LogAt1(T(300), 3);
    second->Configure(20);  // does not touch the first engine's rings

    EXPECT_EQ(Events(ReadOut(log, 10)), (std::vector<uint32_t>{2}));
    EXPECT_EQ(ReadOut(second, 10).count, 0u);
    EXPECT_EQ(engine->records[0].capacity.load(), 5000u);
    delete second;
    log->LogAt1(T(400), 4);
    EXPECT_EQ(Held(log), 2u);
}

// --- the virtual table as the runtime calls it ------------------------------

namespace {

// Slot `slot` of the object's virtual table, as a plain function taking the
// object first (the ABI of both targets).
template <typename Fn>
Fn Slot(iKPLogEngine* object, int slot) {
    void** table = *reinterpret_cast<void***>(object);
    return reinterpret_cast<Fn>(table[slot]);
}

using Void = void (*)(iKPLogEngine*);
using WithWord = void (*)(iKPLogEngine*, uint32_t);
using WithTime = void (*)(iKPLogEngine*, const ClockTime*, uint32_t);
using WithTimeOut = void (*)(iKPLogEngine*, ClockTime*, uint32_t);
using WithTimeKey = void (*)(iKPLogEngine*, const ClockTime*, uint32_t, uint32_t);
using WithWordKey = void (*)(iKPLogEngine*, uint32_t, uint32_t);
using ReadOutFn = void (*)(iKPLogEngine*, uint32_t*, uint32_t*, uint32_t*, uint32_t*, uint32_t);
using ReadOutDataFn = void (*)(iKPLogEngine*, uint32_t*, uint32_t*, uint32_t*, uint32_t*,
                               uint32_t*, uint32_t);

}  // namespace

TEST_F(LogFixture, EverySlotByPosition) {
    iKPLogEngine* L = log;
    tFakeCpu = 2;  // the CPU bits of every event read back are 0x200

    EXPECT_EQ(Slot<uint32_t (*)(iKPLogEngine*, int32_t)>(L, 0)(L, 50), 50u);
    EXPECT_EQ(engine->records[0].capacity.load(), 50u);
    EXPECT_EQ(engine->capacityPerCpu.load(), 5000u);

    Slot<WithWord>(L, 13)(L, 7);  // SetEnableValue
    EXPECT_EQ(engine->enabled.load(), 7u);
    EXPECT_EQ(engine->enableValue.load(), 7u);

    const ClockTime a = T(1000), b = T(2000);
    Slot<WithTime>(L, 1)(L, &a, 0x01);
    Slot<WithTime>(L, 2)(L, &b, 0x02);
    ClockTime t3{0, 0}, t4{0, 0};
    Slot<WithTimeOut>(L, 3)(L, &t3, 0x03);
    Slot<WithTimeOut>(L, 4)(L, &t4, 0x04);
    EXPECT_NE(quelta::ToU64(t3), 0u);
    EXPECT_LE(quelta::ToU64(t3), quelta::ToU64(t4));
    Slot<WithWord>(L, 5)(L, 0x05);
    Slot<WithWord>(L, 6)(L, 0x06);
    const ClockTime c = T(3000);
    Slot<WithTimeKey>(L, 15)(L, &c, 0x0F, 7);
    Slot<WithTimeKey>(L, 15)(L, &c, 0x8F, 8);
    Slot<WithTimeKey>(L, 16)(L, &c, 0x10, 7);
    Slot<WithTimeKey>(L, 16)(L, &c, 0x90, 8);
    Slot<WithWordKey>(L, 17)(L, 0x11, 7);
    Slot<WithWordKey>(L, 17)(L, 0x91, 8);
    Slot<WithWordKey>(L, 18)(L, 0x12, 7);
    Slot<WithWordKey>(L, 18)(L, 0x92, 8);
    const ClockTime d = T(4000);
    Slot<WithTimeKey>(L, 20)(L, &d, 0x1234, 0x14);  // LogAtWithData: time, data, event
    Slot<WithWord>(L, 21)(L, 0x15);
    Slot<WithWord>(L, 22)(L, 0x16);

    const std::vector<uint32_t> events = {0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x0F,
                                          0x10, 0x11, 0x12, 0x14, 0x15, 0x16};
    constexpr uint32_t kNo = 0xFFFFFFFFu;
    const std::vector<uint32_t> data = {kNo, kNo, kNo, kNo, kNo, kNo, kNo,
                                        kNo, kNo, kNo, 0x1234, 256, 0};

    // Slot 23 with data, slot 7 without; both read the same ring (one CPU,
    // so ring order regardless of the mixed times).
    std::vector<uint32_t> lo(20, kUntouched), hi(20, kUntouched), ev(20, kUntouched),
        da(20, kUntouched);
    uint32_t count = 20;
    Slot<ReadOutDataFn>(L, 23)(L, &count, lo.data(), hi.data(), ev.data(), da.data(), 0);
    ASSERT_EQ(count, events.size());
    for (size_t i = 0; i < events.size(); ++i) {
        EXPECT_EQ(ev[i], events[i] | 0x200u) << i;
        EXPECT_EQ(da[i], data[i]) << i;
    }
    EXPECT_EQ(lo[0], 1000u);
    EXPECT_EQ(lo[1], 2000u);
    EXPECT_EQ((uint64_t(hi[2]) << 32) | lo[2], quelta::ToU64(t3));
    EXPECT_EQ((uint64_t(hi[3]) << 32) | lo[3], quelta::ToU64(t4));
    EXPECT_EQ(lo[10], 4000u);

    std::vector<uint32_t> lo7(20), hi7(20), ev7(20);
    uint32_t count7 = 20;
    Slot<ReadOutFn>(L, 7)(L, &count7, lo7.data(), hi7.data(), ev7.data(), 0);
    ASSERT_EQ(count7, count);
    for (uint32_t i = 0; i < count; ++i) {
        EXPECT_EQ(lo7[i], lo[i]);
        EXPECT_EQ(hi7[i], hi[i]);
        EXPECT_EQ(ev7[i], ev[i]);
    }

    Slot<WithWord>(L, 8)(L, 9);  // SetEnabledWord
    EXPECT_EQ(engine->enabled.load(), 9u);
    EXPECT_EQ(engine->enableValue.load(), 7u);
    Slot<Void>(L, 9)(L);
    Slot<Void>(L, 10)(L);
    EXPECT_EQ(engine->enabled.load(), 9u);
    EXPECT_EQ(ReadOut(L, 20).count, count);

    Slot<WithWord>(L, 11)(L, 2);  // SetEnabled
    EXPECT_EQ(engine->enableCount.load(), 2);
    EXPECT_EQ(engine->enabled.load(), 7u);
    Slot<void (*)(iKPLogEngine*, int32_t)>(L, 12)(L, -2);  // AdjustEnabled
    EXPECT_EQ(engine->enableCount.load(), 0);
    EXPECT_EQ(engine->enabled.load(), 0u);

    iKPLogEngine* other = Slot<iKPLogEngine* (*)(iKPLogEngine*)>(L, 14)(L);
    ASSERT_NE(other, nullptr);
    EXPECT_NE(other, L);
    EXPECT_EQ(static_cast<tKPLogEngine*>(other)->capacityPerCpu.load(), 5000u);

    Slot<Void>(L, 19)(L);  // Reconfigure: back to 5000, emptied
    EXPECT_EQ(engine->records[0].capacity.load(), 5000u);
    EXPECT_EQ(ReadOut(L, 20).count, 0u);

    // 24 destroys without freeing the object (freeing it again would be a
    // double free if the slots were swapped); 25 destroys and frees.
    Slot<Void>(other, 24)(other);
    quelta::PalMemFree(other);
    iKPLogEngine* third = tKPLogEngine::Create();
    ASSERT_NE(third, nullptr);
    Slot<Void>(third, 25)(third);
    tFakeCpu = 0;
}
