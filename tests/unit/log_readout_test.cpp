// The log engine's read-out through iKPLogEngine: merge order across CPUs,
// ties, clipping, wrapped rings, data words, the bank switch, heads that are
// never selected, real pinned threads, and recorders racing read-outs.
#include <sched.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <memory>
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

TEST_F(LogFixture, MergeUsesTheClockTimeOrderAndBreaksTiesByCpu) {
    log->SetEnabled(1);
    At(0, 0x00000001FFFFFFFFull, 1);
    At(1, 0xFFFFFFFE00000000ull, 2);
    At(2, 0x0000000200000000ull, 3);
    At(3, 0xFFFFFFFF00000005ull, 4);  // high word 0xFFFFFFFF: before 0, never selected
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{0x001, 0x203, 0x102}));

    Restart();
    At(3, 100, 3);
    At(0, 100, 0);
    At(1, 100, 1);
    At(2, 50, 2);
    // Equal times: the lower CPU index lands at the higher array index.
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{0x202, 0x303, 0x101, 0x000}));
}

TEST_F(LogFixture, WrappedRingReturnsExactlyItsCapacityAcrossTheEnd) {
    log->Configure(8);
    log->SetEnabled(1);
    At(0, 1, 100);
    At(0, 2, 101);
    for (uint32_t t = 3; t <= 15; ++t) At(1, t, t);  // 13 into 8 slots: wraps at slot 5
    ASSERT_EQ(Record(1).writeIndex.load(), 5u);
    EXPECT_EQ(ReadOut(log, 100).Times(), (std::vector<uint64_t>{1, 2, 8, 9, 10, 11, 12, 13, 14, 15}));
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

// One writer per CPU: every entry is a recording of that CPU's writer, and
// each CPU's entries come out in recorded order except at the ring's ends,
// which a writer that chose its ring just before the bank switch may still be
// filling: its newest slot may be stale or torn, and in a full ring the
// writes that reach memory only after the cursors were taken overwrite the
// oldest slots (as many as the writer's stores still in flight). At least
// half of each ring must come out whole and in order.
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
            if (!d.wordsValid || (r.events[k] & 0xFFu) != cpu || cpu >= kWriters) ++failures;
            perCpu[cpu].push_back(d);
        }
        for (auto& [cpu, list] : perCpu) {
            // Leaving out the newest, the list must end in a whole, strictly
            // ascending run; what precedes it was overwritten late.
            const size_t last = list.size() - 1;
            size_t first = last;
            while (first > 0 && list[first - 1].whole && (first == last || list[first - 1].seq < list[first].seq)) {
                --first;
            }
            if (last - first < kCapacity / 2) ++failures;
        }
    });
    EXPECT_EQ(failures, 0);
}

// Writers on real CPUs share records, so entries may tear, but every word
// handed out is one some writer recorded and the CPU index is in range.
TEST(LogReadOutConcurrency, ReadOutsRacingWritersThatShareRecords) {
    std::unique_ptr<tKPLogEngine> engine(tKPLogEngine::Create());
    ASSERT_NE(engine, nullptr);
    engine->Configure(32);
    engine->SetEnabled(1);
    const uint32_t writers = std::min(2 * engine->CpuCount() + 1, 7u);  // 3 bits in the time
    RaceReadOuts(engine.get(), writers, false, [&](const ReadOutResult& r) {
        for (uint32_t k = 0; k < r.count; ++k) {
            ASSERT_TRUE(Decode(r, k, writers).wordsValid) << k;
            ASSERT_LT(Cpu(r.events[k]), engine->CpuCount());
        }
    });
}
