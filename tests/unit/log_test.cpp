// The log engine through iKPLogEngine, as the runtime drives it: every slot by
// position, configuration, the read-out against a straightforward selection,
// torn entries, and the nested switch used by many threads.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "engine/ClockTimeOps.h"
#include "log/tKPLogEngine.h"
#include "tLinux/PalMemory.h"
#include "tLinux/PalThreads.h"

namespace {

using quelta::gPalAllocCount, quelta::gPalAllocFailCountdown;
thread_local int tFakeCpu = 0;  // what the CPU seam reports to this thread
int FakeCpuQuery() { return tFakeCpu; }
struct FakeCpuSeam {
    int (*saved)() = quelta::gLogCpuQuery;
    FakeCpuSeam() { quelta::gLogCpuQuery = FakeCpuQuery; }
    ~FakeCpuSeam() { quelta::gLogCpuQuery = saved; tFakeCpu = 0; }
};

// An engine built as if `cpus` CPUs were online (it reads the count once).
tKPLogEngine* CreateWithCpus(int32_t cpus) {
    const int32_t saved = quelta::gCpuCount.exchange(cpus);
    tKPLogEngine* engine = tKPLogEngine::Create();
    quelta::gCpuCount.store(saved);
    return engine;
}
ClockTime T(uint64_t v) { return quelta::FromU64(v); }
constexpr uint32_t kUntouched = 0xDEADBEEFu;

// A read-out through slot 23 into arrays with room for `room` entries and one
// word more each, to show nothing is written beyond.
struct ReadOutResult {
    uint32_t count = 0;
    std::vector<uint32_t> low, high, events, data;
    std::vector<uint32_t> Events() const { return {events.begin(), events.begin() + count}; }
    std::vector<uint64_t> Times() const {
        std::vector<uint64_t> out;
        for (uint32_t i = 0; i < count; ++i) out.push_back((uint64_t(high[i]) << 32) | low[i]);
        return out;
    }
};
ReadOutResult Blank(uint32_t room) {
    ReadOutResult r;
    r.count = room;
    for (auto* v : {&r.low, &r.high, &r.events, &r.data}) v->assign(room + 1, kUntouched);
    return r;
}
ReadOutResult ReadOut(iKPLogEngine* log, uint32_t room) {
    ReadOutResult r = Blank(room);
    return log->ReadOutMerged(r.count, r.low.data(), r.high.data(), r.events.data(), r.data.data(), 0), r;
}
uint32_t Held(iKPLogEngine* log) { return ReadOut(log, 100).count; }

// An engine of four fake CPUs; the test thread is on fake CPU 0.
class LogFixture : public ::testing::Test {
protected:
    static constexpr uint32_t kCpus = 4;
    void At(int cpu, uint64_t t, uint32_t event) { tFakeCpu = cpu, log->LogAt1(T(t), event), tFakeCpu = 0; }
    const quelta::LogCpuRecord& Record(uint32_t i) const { return engine->records[i]; }
    FakeCpuSeam seam;
    std::unique_ptr<tKPLogEngine> engine{CreateWithCpus(kCpus)};
    iKPLogEngine* log = engine.get();
};

using testsupport::Slot;

// Each row calls one slot with event (and, for slots taking one, time) i, its
// row index; slot 23 then reads out the rows marked 1 with their data words.
// The switch nests; a keyed slot records only when its key equals the
// enabled word, and a key of 0 never; stamps come back even while off.
TEST_F(LogFixture, EverySlotByPosition) {
    struct Row { int slot; int32_t arg; bool records; uint32_t data; };
    constexpr uint32_t N = quelta::kLogNoData;
    const Row rows[] = {
        {1, 0, 0, 0}, {5, 0, 0, 0}, {3, 0, 0, 0},                                       // a new engine is off
        {11, 5, 0, 0}, {12, -4, 0, 0}, {1, 0, 1, N}, {12, -1, 0, 0}, {20, 0, 0, 0},     // count 0: off
        {12, -3, 0, 0}, {12, 3, 0, 0}, {2, 0, 0, 0}, {12, 1, 0, 0}, {2, 0, 1, N},       // -3 + 3: still 0
        {11, 0, 0, 0}, {6, 0, 0, 0}, {15, 0, 0, 0}, {17, 0, 0, 0},                      // off: key 0 never records
        {13, 7, 0, 0}, {11, 0, 0, 0}, {11, 1, 0, 0},                                    // switching on takes the last key
        {18, 1, 0, 0}, {15, 7, 1, N}, {16, 7, 1, N}, {17, 7, 1, N}, {18, 7, 1, N}, {16, 8, 0, 0},
        {3, 0, 1, N}, {4, 0, 1, N}, {5, 0, 1, N}, {6, 0, 1, N},
        {20, 0x1234, 1, 0x1234}, {21, 0, 1, 256}, {22, 0, 1, 0},
        {8, 9, 0, 0}, {9, 0, 0, 0}, {10, 0, 0, 0}, {15, 7, 0, 0}, {16, 9, 1, N}, {8, 0, 0, 0}, {1, 0, 0, 0}};
    using CT = const ClockTime*; using U = uint32_t*;
    tFakeCpu = 2;  // every event read back carries 0x200
    EXPECT_EQ((Slot<uint32_t, int32_t>(log, 0, 50)), 50u);
    EXPECT_EQ(Record(2).capacity.load(), 50u);
    std::vector<uint32_t> events, data;
    std::vector<uint64_t> times;  // 0: stamped by the log's own clock
    const uint64_t before = testsupport::RealNowNs();
    for (uint32_t i = 0; i < sizeof rows / sizeof rows[0]; ++i) {
        const Row& r = rows[i];
        const ClockTime t = T(i + 1);
        ClockTime stamp{0, 0};
        const uint32_t arg = static_cast<uint32_t>(r.arg);
        switch (r.slot) {
            case 1: case 2: Slot<void, CT, uint32_t>(log, r.slot, &t, i); break;
            case 3: case 4: Slot<void, ClockTime*, uint32_t>(log, r.slot, &stamp, i); break;
            case 5: case 6: case 21: case 22: Slot<void, uint32_t>(log, r.slot, i); break;
            case 8: case 11: case 13: Slot<void, uint32_t>(log, r.slot, arg); break;
            case 9: case 10: Slot(log, r.slot); break;
            case 12: Slot<void, int32_t>(log, 12, r.arg); break;
            case 15: case 16: Slot<void, CT, uint32_t, uint32_t>(log, r.slot, &t, i, arg); break;
            case 17: case 18: Slot<void, uint32_t, uint32_t>(log, r.slot, i, arg); break;
            case 20: Slot<void, CT, uint32_t, uint32_t>(log, 20, &t, arg, i); break;
        }
        EXPECT_TRUE((r.slot != 3 && r.slot != 4) || quelta::ToU64(stamp) >= before) << i;
        if (!r.records) continue;
        events.push_back(i | 0x200u), data.push_back(r.data);
        const bool own = r.slot == 1 || r.slot == 2 || r.slot == 15 || r.slot == 16 || r.slot == 20;
        times.push_back(own ? i + 1 : quelta::ToU64(stamp));
    }
    ReadOutResult r = Blank(60), r7 = Blank(60);
    Slot<void, U, U, U, U, U, uint32_t>(log, 23, &r.count, r.low.data(), r.high.data(), r.events.data(), r.data.data(), 0u);
    EXPECT_EQ(r.Events(), events);
    EXPECT_EQ(std::vector<uint32_t>(r.data.begin(), r.data.begin() + r.count), data);
    for (uint32_t i = 0; i < r.count && i < times.size(); ++i) {
        const uint64_t t = r.Times()[i];
        EXPECT_TRUE(times[i] != 0 ? t == times[i] : t >= before && t <= testsupport::RealNowNs()) << i;
    }
    Slot<void, U, U, U, U, uint32_t>(log, 7, &r7.count, r7.low.data(), r7.high.data(), r7.events.data(), 0u);
    EXPECT_TRUE(r7.Times() == r.Times() && r7.Events() == r.Events());

    // 14 makes an independent engine; 19 reconfigures (5000, emptied); 24
    // destroys without freeing (a double free were 24 and 25 swapped).
    iKPLogEngine* other = Slot<iKPLogEngine*>(log, 14);
    ASSERT_TRUE(other != nullptr && other != log);
    Slot(log, 19);
    EXPECT_TRUE(Record(2).capacity.load() == 5000u && Held(log) == 0u);
    Slot(other, 24);
    quelta::PalMemFree(other);
    Slot(tKPLogEngine::Create(), 25);
}

TEST_F(LogFixture, ConfigureKeepsEmptiesOrReplacesRings) {
    EXPECT_EQ(engine->capacityPerCpu.load(), 5000u);
    log->SetEnabled(1), At(1, 1, 1);
    quelta::LogEntry* ring0 = Record(0).entries.load();
    const uint32_t allocs = gPalAllocCount.load();
    EXPECT_EQ(log->Configure(-1), 5000u);  // the capacity in force: same rings, emptied, off
    EXPECT_TRUE(gPalAllocCount.load() == allocs && Record(0).entries.load() == ring0);
    EXPECT_TRUE(engine->enabled.load() == 0u && Held(log) == 0u);
    EXPECT_EQ(log->Configure(0), 0u);  // inline rings of 10 (their wrapping: the selection test)
    log->SetEnabled(1);
    log->Reconfigure();  // Configure's result was not stored: back to 5000, off
    EXPECT_TRUE(Record(0).capacity.load() == 5000u && engine->enabled.load() == 0u);

    // Sizes that overflow a 32-bit byte count are refused without asking the
    // allocator; a refused allocation puts just that record on its inline ring.
    for (int32_t oversized : {int32_t(1) << 28, INT32_MAX, -2, INT32_MIN}) {
        const uint32_t before = gPalAllocCount.load();
        EXPECT_EQ(log->Configure(oversized), 10u) << oversized;
        EXPECT_EQ(gPalAllocCount.load(), before) << oversized;
        for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(Record(i).entries.load(), Record(i).inlineEntries);
    }
    const uint32_t failing = engine->activeBank.load() + 2;  // CPU 2's record in the bank in use
    gPalAllocFailCountdown.store(static_cast<int32_t>(failing) + 1);
    EXPECT_EQ(log->Configure(40), 10u);
    for (uint32_t i = 0; i < 2 * kCpus; ++i) EXPECT_EQ(Record(i).capacity.load(), i == failing ? 10u : 40u);
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 15; ++i) At(2, i, i), At(0, 100 + i, i);
    EXPECT_EQ(Held(log), 25u);
    log->Configure(64);
    gPalAllocFailCountdown.store(1);
    log->Reconfigure();  // stores the fallback 10, so the next one asks for 10
    EXPECT_EQ(engine->capacityPerCpu.load(), 10u);
    log->Reconfigure();
    EXPECT_EQ(Record(1).capacity.load(), 10u);
    EXPECT_EQ(log->Configure(1), 1u);  // rings of one entry
}

TEST(LogEngineCreate, AnUnreadableCpuCountGivesOne) {
    std::unique_ptr<tKPLogEngine> engine(CreateWithCpus(0));
    EXPECT_TRUE(engine != nullptr && engine->CpuCount() == 1u);
}

// A slot whose words come from two recordings fails its check word and is
// left out; the ring's older entries still come, compacted to index 0.
TEST_F(LogFixture, TornEntriesAreLeftOut) {
    log->SetEnabled(1);
    for (uint32_t t = 1; t <= 4; ++t) At(1, t * 10, t);
    At(2, 25, 5);
    Record(1).entries.load()[1].timeHigh.store(1);  // a later recording's high word over 20's
    Record(1).entries.load()[3].event.store(9);     // and one's event word over 40's
    const ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(r.Times(), (std::vector<uint64_t>{10, 25, 30}));
    EXPECT_EQ(r.Events(), (std::vector<uint32_t>{0x101, 0x205, 0x103}));
}

struct ModelEntry { uint64_t time; uint32_t event, data; };

// The read-out done the straightforward way: for each output entry scan the
// ring heads in CPU order from a best time of 0, replacing it only by a
// strictly later one; stop when no head is later than 0; move the copy down.
ReadOutResult ReferenceReadOut(const std::vector<std::vector<ModelEntry>>& model, uint32_t capacity, uint32_t room,
                               uint64_t total) {
    ReadOutResult r = Blank(room);
    std::vector<std::vector<ModelEntry>> held;  // each ring, oldest first
    for (const auto& cpu : model) held.emplace_back(cpu.end() - std::min<size_t>(cpu.size(), capacity), cpu.end());
    const uint32_t m = static_cast<uint32_t>(std::min<uint64_t>(room, total));
    uint32_t k = m;
    for (; k > 0; --k) {
        size_t best = held.size();
        uint64_t bestTime = 0;
        for (size_t i = 0; i < held.size(); ++i) {
            if (!held[i].empty() && quelta::Earlier(bestTime, held[i].back().time)) best = i, bestTime = held[i].back().time;
        }
        if (best == held.size()) break;
        const ModelEntry e = held[best].back();
        held[best].pop_back();
        r.low[k - 1] = static_cast<uint32_t>(e.time), r.high[k - 1] = static_cast<uint32_t>(e.time >> 32);
        r.events[k - 1] = (e.event & ~0xFF00u) | ((static_cast<uint32_t>(best) & 0xFFu) << 8), r.data[k - 1] = e.data;
    }
    r.count = m - k;
    for (auto* v : {&r.low, &r.high, &r.events, &r.data}) std::copy(v->begin() + k, v->begin() + m, v->begin());
    return r;
}

// Random logs on 1 to 256 CPUs read out by the engine and by the reference agree word for word: equal
// stamps across CPUs, CPU indices to fold, wrapped, empty and inline rings, times never selected (0, high
// word 0xFFFFFFFF), rings out of time order; read-outs of 0, some, all and more than held, made twice.
TEST(LogReadOut, MatchesTheStraightforwardSelection) {
    FakeCpuSeam seam;
    std::mt19937 rng(20261123);
    auto pick = [&](uint32_t bound) { return std::uniform_int_distribution<uint32_t>(0, bound - 1)(rng); };
    constexpr uint64_t kBase = 0x1FFFFFFE0ull;  // stamps cross a high-word boundary
    const uint64_t odd[] = {0, 0xFFFFFFFF00000000ull, 0xFFFFFFFE00000000ull};
    for (uint32_t cpus : {1u, 2u, 3u, 5u, 16u, 64u, 255u, 256u, 1 + pick(256)}) {
        std::unique_ptr<tKPLogEngine> engine(CreateWithCpus(static_cast<int32_t>(cpus)));
        ASSERT_TRUE(engine != nullptr && engine->CpuCount() == cpus);
        for (int round = 0, rounds = cpus >= 64 ? 8 : 30; round < rounds; ++round) {
            const uint32_t capacity = std::vector<uint32_t>{1, 2, 3, 7, 10, 16}[pick(6)];
            engine->Configure(capacity == 10 ? 0 : static_cast<int32_t>(capacity));  // 0: inline rings of 10
            engine->SetEnabled(1);
            const bool ordered = pick(3) != 0;  // each ring in time order, as the log's own stamps are
            std::vector<std::vector<ModelEntry>> model(cpus);
            uint64_t held = 0;
            for (uint32_t cpu = 0; cpu < cpus; ++cpu) {
                const uint32_t records = pick(4) == 0 ? 0 : pick(3 * capacity);
                uint64_t time = kBase + pick(8);
                // A failed query lands on record 0, a CPU beyond the count on index mod n.
                tFakeCpu = cpu == 0 && pick(2) ? -1 : static_cast<int>(cpu + cpus * pick(3));
                for (uint32_t i = 0; i < records; ++i) {
                    time += pick(3);
                    const ModelEntry e{pick(ordered ? 60 : 4) == 0 ? odd[pick(3)] | pick(4) : ordered ? time : kBase + pick(40),
                                       static_cast<uint32_t>(rng()), static_cast<uint32_t>(rng())};
                    engine->LogAtWithData(T(e.time), e.data, e.event);
                    model[cpu].push_back(e);
                }
                held += std::min(records, capacity);
            }
            const uint32_t room = std::vector<uint32_t>{0, 1, pick(uint32_t(held) + 1), uint32_t(held),
                                                        uint32_t(held) + 1 + pick(5)}[pick(5)];
            SCOPED_TRACE(testing::Message() << cpus << " CPUs, round " << round << ", room " << room << " of " << held);
            const uint32_t bank = engine->activeBank.load();
            const ReadOutResult want = ReferenceReadOut(model, capacity, room, held);
            for (int pass = 0; pass < (room > 0 && held > 0 ? 2 : 1); ++pass) {
                const ReadOutResult got = ReadOut(engine.get(), room);
                ASSERT_TRUE(got.count == want.count && got.low == want.low && got.high == want.high &&
                            got.events == want.events && got.data == want.data);
                ASSERT_EQ(engine->activeBank.load(), std::min<uint64_t>(room, held) == 0 ? cpus - bank : bank);
            }
        }
    }
}

// AdjustEnabled from several threads at once: no adjustment is lost. Each
// thread adjusts for 200 ms (a fixed count could run one thread after another).
TEST(LogConcurrency, AdjustmentsFromManyThreadsAreAllCounted) {
    std::unique_ptr<iKPLogEngine> log(tKPLogEngine::Create());
    std::atomic<int> ready{0};
    std::atomic<bool> stop{false};
    std::atomic<int64_t> sum{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&] {
            for (ready.fetch_add(1); ready.load() < 4;) std::this_thread::yield();
            int64_t rounds = 0;
            for (; !stop.load(std::memory_order_relaxed); rounds += 256) {
                for (int i = 0; i < 256; ++i) log->AdjustEnabled(+2), log->AdjustEnabled(-1);
            }
            sum.fetch_add(rounds);
        });
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(200)), stop.store(true);
    for (auto& t : threads) t.join();
    log->AdjustEnabled(-static_cast<int32_t>(sum.load() - 1));  // one less than the sum: still on
    log->LogAt1(T(1), 1);
    log->AdjustEnabled(-1), log->LogAt1(T(2), 2);  // the last one switches off
    EXPECT_EQ(ReadOut(log.get(), 10).Times(), std::vector<uint64_t>{1}) << "adjustments made together were lost";
}

}  // namespace
