// The log engine's recording side, driven through iKPLogEngine as the runtime
// drives it: enabling and keys, rings and wrapping, the CPU index seam,
// configuration and construction with their allocation failures, and every
// slot called by its position in the virtual table.
#include <malloc.h>

#include <memory>

#include "TestSupport.h"
#include "engine/LibraryFrame.h"
#include "log_test_helpers.h"

using namespace logtest;

// --- switching recording on and off -------------------------------------------

// (Every way of switching on and the keyed slots are also called by
// position in EverySlotByPosition below.)
TEST_F(LogFixture, EnableCountNests) {
    log->LogAt1(T(1), 0x10);  // a new engine is off
    log->LogNow5(0x11);
    log->SetEnabled(5);
    log->AdjustEnabled(-4);
    log->LogAt1(T(2), 1);
    log->AdjustEnabled(-1);
    log->LogAtWithData(T(3), 0, 0x12);  // count 0: off
    log->AdjustEnabled(-3);
    log->AdjustEnabled(3);
    log->LogAt1(T(4), 0x13);  // still 0
    log->AdjustEnabled(1);
    log->LogAt1(T(5), 2);
    log->SetEnabled(0);
    log->LogAt1(T(6), 0x14);
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{1, 2}));
}

TEST_F(LogFixture, KeyZeroNeverRecordsAndSwitchingOnTakesTheLastKey) {
    log->LogAtIfKey15(T(1), 0x10, 0);  // off, the key word is 0: still nothing
    log->LogNowIfKey17(0x11, 0);
    log->SetEnableValue(7);
    log->SetEnabled(0);
    log->SetEnabled(1);
    log->LogNowIfKey18(0x12, 1);
    log->LogAtIfKey16(T(2), 1, 7);
    EXPECT_EQ(ReadOut(log, 10).Events(), std::vector<uint32_t>{1});
}

TEST_F(LogFixture, StampingHandsTheTimeBackEvenWhileOff) {
    ASSERT_EQ(quelta::gEngine.load(), nullptr) << "without an engine the log reads CLOCK_REALTIME";
    ClockTime t3{0, 0}, t4{0, 0};
    const uint64_t before = testsupport::RealNowNs();
    log->StampAndLog3(t3, 1);
    log->StampAndLog4(t4, 2);
    EXPECT_GE(quelta::ToU64(t3), before);
    EXPECT_LE(quelta::ToU64(t3), quelta::ToU64(t4));
    EXPECT_LE(quelta::ToU64(t4), testsupport::RealNowNs());
    EXPECT_EQ(Held(log), 0u);
    log->SetEnabled(1);
    log->StampAndLog3(t3, 3);
    EXPECT_EQ(ReadOut(log, 10).Times(), std::vector<uint64_t>{quelta::ToU64(t3)});
}

// --- rings and the CPU index ---------------------------------------------------

TEST_F(LogFixture, EntryAfterDefaultCapacityWrapsToSlotZero) {
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 5000; ++i) At(1, i, i);
    EXPECT_EQ(Record(1).writeIndex.load(), 5000u);
    EXPECT_EQ(Record(1).wrapCount.load(), 0u);
    At(1, 5001, 5001);
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
    EXPECT_EQ(Held(log), 0u);
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
    for (uint32_t i = 1; i <= 15; ++i) {
        At(2, i, i);
        At(0, 100 + i, i);
    }
    EXPECT_EQ(Held(log), 25u);
}

TEST(LogEngineCreate, FailedAllocationsAndAnUnreadableCpuCount) {
    quelta::PalGetCpuCount();  // a first query might allocate; keep it out
    for (int32_t failing : {1, 2}) {  // the object, the record array
        const size_t before = mallinfo2().uordblks;
        quelta::gPalAllocFailCountdown.store(failing);
        EXPECT_EQ(tKPLogEngine::Create(), nullptr) << failing;
        quelta::gPalAllocFailCountdown.store(0);
        EXPECT_EQ(mallinfo2().uordblks, before) << "leaked after failure " << failing;
    }
    quelta::gPalAllocFailCountdown.store(3);  // a ring: still an engine
    std::unique_ptr<tKPLogEngine> engine(tKPLogEngine::Create());
    ASSERT_NE(engine, nullptr);
    EXPECT_EQ(engine->capacityPerCpu.load(), 10u);
    engine.reset(CreateWithCpus(0));
    ASSERT_NE(engine, nullptr);
    EXPECT_EQ(engine->CpuCount(), 1u);
}

// --- every slot by position, as the runtime calls them ---------------------------

namespace {
template <typename R = void, typename... A>  // the object goes first on both ABIs
R Slot(iKPLogEngine* object, int slot, A... args) {
    return reinterpret_cast<R (*)(iKPLogEngine*, A...)>((*reinterpret_cast<void***>(object))[slot])(object, args...);
}
}  // namespace

TEST_F(LogFixture, EverySlotByPosition) {
    iKPLogEngine* L = log;
    tFakeCpu = 2;  // every event read back carries 0x200
    EXPECT_EQ((Slot<uint32_t, int32_t>(L, 0, 50)), 50u);
    EXPECT_EQ(Record(0).capacity.load(), 50u);
    const ClockTime a = T(1000), b = T(2000), c = T(3000), d = T(4000);
    ClockTime t3{0, 0}, t4{0, 0};
    Slot<void, const ClockTime*, uint32_t>(L, 1, &a, 0x99);  // still off
    Slot<void, uint32_t>(L, 13, 7);                           // SetEnableValue: on, key 7
    Slot<void, const ClockTime*, uint32_t>(L, 1, &a, 0x01);
    Slot<void, const ClockTime*, uint32_t>(L, 2, &b, 0x02);
    Slot<void, ClockTime*, uint32_t>(L, 3, &t3, 0x03);
    Slot<void, ClockTime*, uint32_t>(L, 4, &t4, 0x04);
    Slot<void, uint32_t>(L, 5, 0x05);
    Slot<void, uint32_t>(L, 6, 0x06);
    for (int slot : {15, 16}) {
        Slot<void, const ClockTime*, uint32_t, uint32_t>(L, slot, &c, 0x0F + (slot - 15), 7);
        Slot<void, const ClockTime*, uint32_t, uint32_t>(L, slot, &c, 0x8F, 8);  // wrong key
    }
    for (int slot : {17, 18}) {
        Slot<void, uint32_t, uint32_t>(L, slot, 0x11 + (slot - 17), 7);
        Slot<void, uint32_t, uint32_t>(L, slot, 0x91, 8);
    }
    Slot<void, const ClockTime*, uint32_t, uint32_t>(L, 20, &d, 0x1234, 0x14);  // time, data, event
    Slot<void, uint32_t>(L, 21, 0x15);
    Slot<void, uint32_t>(L, 22, 0x16);

    const std::vector<uint32_t> events = {1, 2, 3, 4, 5, 6, 0x0F, 0x10, 0x11, 0x12, 0x14, 0x15, 0x16};
    constexpr uint32_t N = 0xFFFFFFFFu;
    const std::vector<uint32_t> data = {N, N, N, N, N, N, N, N, N, N, 0x1234, 256, 0};
    std::vector<uint32_t> lo(20), hi(20), ev(20), da(20), lo7(20), hi7(20), ev7(20);
    uint32_t count = 20, count7 = 20;
    using U = uint32_t*;
    Slot<void, U, U, U, U, U, uint32_t>(L, 23, &count, lo.data(), hi.data(), ev.data(), da.data(), 0u);
    ASSERT_EQ(count, events.size());
    for (size_t i = 0; i < events.size(); ++i) {
        EXPECT_EQ(ev[i], events[i] | 0x200u) << i;
        EXPECT_EQ(da[i], data[i]) << i;
    }
    EXPECT_EQ(lo[1], 2000u);
    EXPECT_EQ(lo[2], t3.low);
    EXPECT_EQ(hi[3], t4.high);
    EXPECT_EQ(lo[10], 4000u);
    Slot<void, U, U, U, U, uint32_t>(L, 7, &count7, lo7.data(), hi7.data(), ev7.data(), 0u);
    EXPECT_EQ(count7, count);
    EXPECT_EQ(lo7, lo);
    EXPECT_EQ(ev7, ev);

    Slot<void, uint32_t>(L, 8, 9);  // SetEnabledWord; 9 and 10 do nothing
    Slot(L, 9);
    Slot(L, 10);
    EXPECT_EQ(engine->enabled.load(), 9u);
    EXPECT_EQ(engine->enableValue.load(), 7u);
    Slot<void, uint32_t>(L, 11, 2);  // SetEnabled: count 2, key 7
    EXPECT_EQ(engine->enableCount.load(), 2);
    EXPECT_EQ(engine->enabled.load(), 7u);
    Slot<void, int32_t>(L, 12, -2);  // AdjustEnabled
    EXPECT_EQ(engine->enabled.load(), 0u);

    // 14 makes an independent engine: the first one's switch and rings stay.
    iKPLogEngine* other = Slot<iKPLogEngine*>(L, 14);
    ASSERT_NE(other, nullptr);
    EXPECT_NE(other, L);
    other->SetEnabled(1);
    other->LogAt1(T(5000), 0x77);
    other->Configure(20);
    EXPECT_EQ(engine->enabled.load(), 0u);
    EXPECT_EQ(Record(0).capacity.load(), 50u);
    EXPECT_EQ(Held(L), count);
    Slot(L, 19);  // Reconfigure: back to 5000, emptied
    EXPECT_EQ(Record(0).capacity.load(), 5000u);
    EXPECT_EQ(Held(L), 0u);

    // 24 destroys without freeing (freeing afterwards would be a double free
    // were the slots swapped); 25 destroys and frees.
    Slot(other, 24);
    quelta::PalMemFree(other);
    Slot(tKPLogEngine::Create(), 25);
}
