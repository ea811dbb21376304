// The log engine's read-out through iKPLogEngine: merge order across CPUs,
// ties, clipping, wrapped rings, data words, the bank switch, heads that are
// never selected, torn entries, the selection against the straightforward
// one on 1 to 256 CPUs, real pinned threads, and recorders racing read-outs.
#include <sched.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <random>
#include <thread>

#include "log_test_helpers.h"

using namespace logtest;

// --- merge order ----------------------------------------------------------------

// The newest entries, clipped to the room given, in ascending time order
// across CPUs; a read-out consumes nothing and recording goes on in the same
// bank. Nothing is written beyond the entries returned.
TEST_F(LogFixture, InterleavedCpusMergeNewestFirstIntoAscendingArrays) {
    log->SetEnabled(1);
    for (uint32_t t = 10; t <= 90; t += 10) At(static_cast<int>((t / 10 - 1) % 3), t, 0xABCDFF00u | t);
    for (int pass = 0; pass < 2; ++pass) {
        const ReadOutResult r = ReadOut(log, 5);
        EXPECT_EQ(r.Times(), (std::vector<uint64_t>{50, 60, 70, 80, 90}));
        for (uint32_t i = 0; i < r.count; ++i) {  // bits 8-15 are replaced by the CPU
            EXPECT_EQ(r.events[i], 0xABCD0000u | (((r.low[i] / 10 - 1) % 3) << 8) | r.low[i]) << i;
        }
    }
    EXPECT_EQ(engine->activeBank.load(), 0u);
    At(0, 100, 100);
    const ReadOutResult r = ReadOut(log, 14);
    EXPECT_EQ(r.Times(), (std::vector<uint64_t>{10, 20, 30, 40, 50, 60, 70, 80, 90, 100}));
    for (uint32_t i = 10; i <= 14; ++i) {
        EXPECT_EQ((std::vector<uint32_t>{r.low[i], r.high[i], r.events[i], r.data[i]}),
                  std::vector<uint32_t>(4, kUntouched)) << i;
    }
}

// --- the bank switch --------------------------------------------------------------

TEST_F(LogFixture, CountZeroOrAnEmptyLogStartsAfreshInTheOtherBank) {
    log->SetEnabled(1);
    At(0, 1, 1);
    At(1, 2, 2);
    ReadOutResult r = ReadOut(log, 0);
    EXPECT_EQ(r.count, 0u);
    EXPECT_EQ(r.low[0], kUntouched);
    EXPECT_EQ(engine->activeBank.load(), kCpus) << "recording moved to the other bank";
    At(2, 3, 3);
    EXPECT_EQ(ReadOut(log, 10).Times(), std::vector<uint64_t>{3}) << "older entries are gone";
    At(0, 4, 4);  // the bank written since the count-0 read-out stays active
    EXPECT_EQ(ReadOut(log, 10).Times(), (std::vector<uint64_t>{3, 4}));
    EXPECT_EQ(engine->activeBank.load(), kCpus);

    log->Reconfigure();  // empty: each read-out finds nothing and switches
    for (uint32_t bank : {0u, kCpus}) {
        r = ReadOut(log, 10);
        EXPECT_EQ(r.count, 0u);
        EXPECT_EQ(r.low[0], kUntouched);
        EXPECT_EQ(engine->activeBank.load(), bank);
    }
}

// A time of 0, or one with high word 0xFFFFFFFF, is never selected. When only
// such heads remain the merge stops, `count` becomes what was copied, and the
// copied entries are moved down to start at index 0.
TEST_F(LogFixture, NeverSelectedHeadsStopTheMergeAndTheResultIsCompacted) {
    log->SetEnabled(1);
    At(0, 0, 0x10);
    log->LogAtWithData(T(5), 50, 0x11);
    log->LogAtWithData(T(7), 70, 0x12);
    At(1, 0xFFFFFFFF00000010ull, 0x20);
    tFakeCpu = 1;
    log->LogAtWithData(T(6), 60, 0x21);
    tFakeCpu = 0;
    for (int pass = 0; pass < 2; ++pass) {
        const ReadOutResult r = ReadOut(log, 10);
        EXPECT_EQ(r.Times(), (std::vector<uint64_t>{5, 6, 7}));
        EXPECT_EQ(r.Events(), (std::vector<uint32_t>{0x11, 0x121, 0x12}));
        EXPECT_EQ(r.Data(), (std::vector<uint32_t>{50, 60, 70}));
        EXPECT_EQ(engine->activeBank.load(), 0u) << "entries were held: switched back";
    }
    EXPECT_EQ(ReadOut(log, 2).Times(), (std::vector<uint64_t>{6, 7}));

    // Such a head hides the older entries of its ring; alone it gives nothing.
    Restart();
    At(0, 5, 1);
    At(0, 0, 2);
    At(1, 3, 3);
    At(1, 4, 4);
    EXPECT_EQ(ReadOut(log, 10).Times(), (std::vector<uint64_t>{3, 4}));
    Restart();
    At(2, 0xFFFFFFFF12345678ull, 1);
    EXPECT_EQ(ReadOut(log, 4).count, 0u);
    EXPECT_EQ(engine->activeBank.load(), 0u);
}

// A slot whose words come from two recordings (a recorder overwriting it as
// it is read) fails its check word and is left out; the ring's older entries
// still come, and the result is compacted as for a stopped merge.
TEST_F(LogFixture, TornEntriesAreLeftOut) {
    log->SetEnabled(1);
    for (uint32_t t = 1; t <= 4; ++t) At(1, t * 10, t);
    At(2, 25, 5);
    quelta::LogEntry* ring = Record(1).entries.load();
    ring[1].timeHigh.store(1);  // a later recording's high word over 20's
    ring[3].event.store(9);     // and one's event word over 40's
    const ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(r.Times(), (std::vector<uint64_t>{10, 25, 30}));
    EXPECT_EQ(r.Events(), (std::vector<uint32_t>{0x101, 0x205, 0x103}));
}

// --- the selection against the straightforward one --------------------------------

namespace {

// What was recorded on one CPU, in recording order; its ring holds the last
// `capacity` of them.
struct ModelEntry {
    uint64_t time;
    uint32_t event, data;
};
using Model = std::vector<std::vector<ModelEntry>>;

// The read-out as the straightforward selection does it: for every output
// entry scan the heads of all rings in CPU order, starting from a best time
// of 0 and replacing it only by a strictly later one; stop when no head is
// later than 0, and move what was copied down to index 0.
ReadOutResult ReferenceReadOut(const Model& model, uint32_t capacity, uint32_t room) {
    ReadOutResult r;
    for (auto* v : {&r.low, &r.high, &r.events, &r.data}) v->assign(room + 1, kUntouched);
    const size_t n = model.size();
    std::vector<std::vector<ModelEntry>> held(n);  // each ring, oldest first
    uint64_t total = 0;
    for (size_t i = 0; i < n; ++i) {
        const size_t keep = std::min<size_t>(model[i].size(), capacity);
        held[i].assign(model[i].end() - keep, model[i].end());
        total += keep;
    }
    const uint32_t m = static_cast<uint32_t>(std::min<uint64_t>(room, total));
    uint32_t k = m;
    while (k > 0) {
        size_t best = n;
        uint64_t bestTime = 0;
        for (size_t i = 0; i < n; ++i) {
            if (!held[i].empty() && quelta::Earlier(bestTime, held[i].back().time)) {
                best = i;
                bestTime = held[i].back().time;
            }
        }
        if (best == n) break;
        const ModelEntry e = held[best].back();
        held[best].pop_back();
        --k;
        r.low[k] = static_cast<uint32_t>(e.time);
        r.high[k] = static_cast<uint32_t>(e.time >> 32);
        r.events[k] = (e.event & ~0xFF00u) | ((static_cast<uint32_t>(best) & 0xFFu) << 8);
        r.data[k] = e.data;
    }
    r.count = m - k;
    for (auto* v : {&r.low, &r.high, &r.events, &r.data}) std::copy(v->begin() + k, v->begin() + m, v->begin());
    return r;
}

}  // namespace

// Random logs on 1 to 256 CPUs (engines built through the CPU-count seam),
// read out by the engine and by the reference: the same count, the same word
// in every slot of every array, the same bank afterwards. The logs have equal
// stamps across CPUs, wrapped, empty and inline rings, never-selected times,
// rings out of time order, and read-outs of 0, some, all and more than held.
TEST(LogReadOutSelection, MatchesTheStraightforwardSelection) {
    struct RestoreSeam {
        int (*saved)() = quelta::gLogCpuQuery;
        ~RestoreSeam() { quelta::gLogCpuQuery = saved; }
    } restore;
    quelta::gLogCpuQuery = FakeCpuQuery;
    std::mt19937 rng(20261123);
    auto pick = [&](uint32_t bound) { return std::uniform_int_distribution<uint32_t>(0, bound - 1)(rng); };
    constexpr uint64_t kBase = 0x1FFFFFFE0ull;  // stamps cross a high-word boundary
    auto oddTime = [&]() -> uint64_t {          // never selected, or the latest there is
        switch (pick(3)) {
            case 0: return 0;
            case 1: return 0xFFFFFFFF00000000ull | pick(4);
            default: return 0xFFFFFFFE00000000ull | pick(4);
        }
    };
    for (uint32_t cpus : {1u, 2u, 3u, 5u, 16u, 64u, 255u, 256u, 1 + pick(256)}) {
        std::unique_ptr<tKPLogEngine> engine(CreateWithCpus(static_cast<int32_t>(cpus)));
        ASSERT_NE(engine, nullptr);
        ASSERT_EQ(engine->CpuCount(), cpus);
        iKPLogEngine* log = engine.get();
        for (int round = 0, rounds = cpus >= 64 ? 8 : 30; round < rounds; ++round) {
            const uint32_t capacity = std::vector<uint32_t>{1, 2, 3, 7, 10, 16}[pick(6)];
            log->Configure(capacity == 10 ? 0 : static_cast<int32_t>(capacity));  // 0: inline rings of 10
            log->SetEnabled(1);
            const bool ordered = pick(3) != 0;  // each ring in time order, as the log's own stamps are
            Model model(cpus);
            uint64_t held = 0;
            for (uint32_t cpu = 0; cpu < cpus; ++cpu) {
                const uint32_t records = pick(4) == 0 ? 0 : pick(3 * capacity);
                uint64_t time = kBase + pick(8);
                tFakeCpu = static_cast<int>(cpu);
                for (uint32_t i = 0; i < records; ++i) {
                    time += pick(3);
                    const ModelEntry e{pick(ordered ? 60 : 4) == 0 ? oddTime() : ordered ? time : kBase + pick(40),
                                       static_cast<uint32_t>(rng()), static_cast<uint32_t>(rng())};
                    log->LogAtWithData(T(e.time), e.data, e.event);
                    model[cpu].push_back(e);
                }
                held += std::min(records, capacity);
            }
            tFakeCpu = 0;
            const uint32_t room = std::vector<uint32_t>{0, 1, pick(uint32_t(held) + 1), uint32_t(held),
                                                        uint32_t(held) + 1 + pick(5)}[pick(5)];
            SCOPED_TRACE(testing::Message() << cpus << " CPUs, round " << round << ", capacity " << capacity
                                            << ", room " << room << " of " << held);
            const uint32_t bank = engine->activeBank.load();
            const ReadOutResult want = ReferenceReadOut(model, capacity, room);
            for (int pass = 0; pass < (room > 0 && held > 0 ? 2 : 1); ++pass) {  // nothing is consumed
                const ReadOutResult got = ReadOut(log, room);
                ASSERT_EQ(got.count, want.count);
                ASSERT_EQ(got.low, want.low);
                ASSERT_EQ(got.high, want.high);
                ASSERT_EQ(got.events, want.events);
                ASSERT_EQ(got.data, want.data);
                ASSERT_EQ(engine->activeBank.load(), std::min<uint64_t>(room, held) == 0 ? cpus - bank : bank);
            }
        }
    }
}

// --- real CPUs ------------------------------------------------------------------

// With the real CPU query each entry is tagged with the CPU it was recorded
// on, and the read-out merges them by the log's own clock.
TEST(LogReadOutRealCpus, EntriesCarryTheCpuTheyWereRecordedOn) {
    ASSERT_EQ(quelta::PalInitialize(), 1u);
    if (quelta::PalGetCpuCount() < 2) GTEST_SKIP() << "needs 2 CPUs";
    std::unique_ptr<iKPLogEngine> log(tKPLogEngine::Create());
    ASSERT_NE(log, nullptr);
    log->SetEnabled(1);
    bool pinned = true;
    std::thread([&] {
        for (int cpu : {1, 0, 1}) {
            pinned = pinned && quelta::PalSetAffinityOne(cpu) == 0 && sched_getcpu() == cpu;
            log->LogNow5(0x10u + static_cast<uint32_t>(cpu));
            pinned = pinned && sched_getcpu() == cpu;
        }
    }).join();
    if (!pinned) GTEST_SKIP() << "the thread could not be kept on CPUs 0 and 1";
    EXPECT_EQ(ReadOut(log.get(), 10).Events(), (std::vector<uint32_t>{0x111, 0x010, 0x111}));
}

// --- recorders racing read-outs ----------------------------------------------------

namespace {

// Recording `seq` of writer w: time 2^32 + 8 seq + w, event (seq << 16) | w,
// data (w << 24) | seq, so a read-out can tell whole entries from torn ones.
struct Decoded {
    bool wordsValid;  // each word alone is one some writer recorded, or the 0 of an unwritten slot
    bool whole;       // all four words from one recording
    uint32_t writer, seq;
};

Decoded Decode(const ReadOutResult& r, uint32_t k, uint32_t writers) {
    const uint32_t lo = r.low[k], hi = r.high[k], ev = r.events[k], da = r.data[k];
    Decoded d{};
    d.writer = lo & 7;
    d.seq = lo / 8;
    d.wordsValid = (lo == 0 || (d.writer < writers && d.seq >= 1)) && hi <= 1 && (ev & 0xFFu) < writers &&
                   (da == 0 || ((da >> 24) < writers && (da & 0xFFFFFFu) >= 1));
    d.whole = d.wordsValid && hi == 1 && d.seq >= 1 && (ev & 0xFFu) == d.writer &&
              (ev >> 16) == (d.seq & 0xFFFFu) && da == ((d.writer << 24) | d.seq);
    return d;
}

// `writers` threads record (on fake CPU w when `ownCpus`, else wherever they
// run) while this thread reads out repeatedly for 300 ms, checking each.
template <typename Check>
void RaceReadOuts(iKPLogEngine* log, uint32_t writers, bool ownCpus, Check check) {
    std::atomic<bool> stop{false};
    std::atomic<uint32_t> started{0};
    std::vector<std::thread> threads;
    for (uint32_t w = 0; w < writers; ++w) {
        threads.emplace_back([&, w] {
            if (ownCpus) tFakeCpu = static_cast<int>(w);
            for (uint32_t seq = 1; seq < (1u << 24) && !stop.load(std::memory_order_relaxed); ++seq) {
                log->LogAtWithData(T((uint64_t(1) << 32) + uint64_t(seq) * 8 + w), (w << 24) | seq,
                                   (seq << 16) | w);
                if (seq == 1) started.fetch_add(1);
            }
        });
    }
    // Every written ring holds entries before the first read-out, so each
    // read-out copies some and the banks keep their roles.
    while (started.load() < writers) std::this_thread::yield();
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(300);
    for (int n = 0; n < 50 || std::chrono::steady_clock::now() < end; ++n) check(ReadOut(log, 256));
    stop = true;
    for (auto& t : threads) t.join();
}

}  // namespace

// One writer per CPU: every entry is a whole recording of that CPU's
// writer, and each CPU's entries come out in recorded order up to the newest
// one, except at the oldest end of a full ring, which a writer that chose its
// ring just before the bank switch may still be overwriting (as many slots as
// its stores still in flight). At least half of each ring must come out in
// order.
TEST(LogReadOutConcurrency, ReadOutsRacingOneWriterPerCpu) {
    struct RestoreSeam {
        int (*saved)() = quelta::gLogCpuQuery;
        ~RestoreSeam() { quelta::gLogCpuQuery = saved; }
    } restore;
    quelta::gLogCpuQuery = FakeCpuQuery;
    constexpr uint32_t kWriters = 3, kCapacity = 64;
    std::unique_ptr<iKPLogEngine> log(CreateWithCpus(4));
    ASSERT_NE(log, nullptr);
    log->Configure(kCapacity);
    log->SetEnabled(1);
    int failures = 0;
    RaceReadOuts(log.get(), kWriters, true, [&](const ReadOutResult& r) {
        std::map<uint32_t, std::vector<Decoded>> perCpu;
        for (uint32_t k = 0; k < r.count; ++k) {
            const Decoded d = Decode(r, k, kWriters);
            const uint32_t cpu = Cpu(r.events[k]);
            if (!d.whole || (r.events[k] & 0xFFu) != cpu || cpu >= kWriters) ++failures;
            perCpu[cpu].push_back(d);
        }
        for (auto& [cpu, list] : perCpu) {
            // A strictly ascending run ends the list; what precedes it was
            // overwritten late.
            size_t first = list.size() - 1;
            while (first > 0 && list[first - 1].seq < list[first].seq) --first;
            if (list.size() - first < kCapacity / 2) ++failures;
        }
    });
    EXPECT_EQ(failures, 0);
}

// Writers on real CPUs share records, so their stores into one slot mix, but
// the read-out leaves such torn entries out: every entry handed out is one
// recording, all four words, and the CPU index is in range.
TEST(LogReadOutConcurrency, ReadOutsRacingWritersThatShareRecords) {
    std::unique_ptr<tKPLogEngine> engine(tKPLogEngine::Create());
    ASSERT_NE(engine, nullptr);
    engine->Configure(32);
    engine->SetEnabled(1);
    const uint32_t writers = std::min(2 * engine->CpuCount() + 1, 7u);  // 3 bits in the time
    RaceReadOuts(engine.get(), writers, false, [&](const ReadOutResult& r) {
        for (uint32_t k = 0; k < r.count; ++k) {
            ASSERT_TRUE(Decode(r, k, writers).whole) << k;
            ASSERT_LT(Cpu(r.events[k]), engine->CpuCount());
        }
    });
}
