// The log engine's read-out through iKPLogEngine: merge order across CPUs,
// ties, clipping, wrapped rings, data words, the bank switch (count 0, empty
// log), heads that are never selected, real pinned threads, and recorders
// racing read-outs.
#include <sched.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <thread>

#include "log_test_helpers.h"

using namespace logtest;
using quelta::tKPLogEngine;

namespace {

uint32_t Cpu(uint32_t event) { return (event >> 8) & 0xFFu; }

}  // namespace

// --- merge order --------------------------------------------------------------

TEST_F(LogFixture, InterleavedCpusMergeNewestFirstIntoAscendingArrays) {
    log->SetEnabled(1);
    // Bits 8-15 of the caller's event are replaced by the CPU index.
    for (uint32_t round = 0; round < 3; ++round) {
        for (int cpu = 0; cpu < 3; ++cpu) {
            const uint64_t t = 10 + 30 * round + 10 * cpu;  // 10, 20, ..., 90
            At(cpu, t, 0xABCD0000u | 0xFF00u | static_cast<uint32_t>(t));
        }
    }

    ReadOutResult r = ReadOut(log, 5);
    ASSERT_EQ(r.count, 5u);
    EXPECT_EQ(Times(r), (std::vector<uint64_t>{50, 60, 70, 80, 90}));
    for (uint32_t i = 0; i < r.count; ++i) {
        const uint64_t t = r.Time(i);
        const uint32_t cpu = static_cast<uint32_t>((t / 10 - 1) % 3);
        EXPECT_EQ(r.events[i], 0xABCD0000u | (cpu << 8) | static_cast<uint32_t>(t)) << i;
    }
    EXPECT_EQ(r.low[5], kUntouched);

    r = ReadOut(log, 9);
    EXPECT_EQ(Times(r), (std::vector<uint64_t>{10, 20, 30, 40, 50, 60, 70, 80, 90}));
}

TEST_F(LogFixture, EqualTimesPutTheLowerCpuAtTheHigherIndex) {
    log->SetEnabled(1);
    At(3, 100, 0x3);
    At(0, 100, 0x0);
    At(1, 100, 0x1);
    At(2, 50, 0x2);
    const ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(Events(r), (std::vector<uint32_t>{0x202, 0x303, 0x101, 0x000}));
}

// The ClockTime order puts a high word of 0xFFFFFFFF before 0 and compares
// the rest unsigned.
TEST_F(LogFixture, MergeUsesTheClockTimeOrder) {
    log->SetEnabled(1);
    At(0, 0x00000001FFFFFFFFull, 1);
    At(1, 0xFFFFFFFE00000000ull, 2);
    At(2, 0x0000000200000000ull, 3);
    EXPECT_EQ(Events(ReadOut(log, 10)), (std::vector<uint32_t>{0x001, 0x203, 0x102}));
}

TEST_F(LogFixture, ReadOutDoesNotConsume) {
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 6; ++i) At(static_cast<int>(i % 2), i, i);
    const ReadOutResult first = ReadOut(log, 4);
    const ReadOutResult second = ReadOut(log, 4);
    EXPECT_EQ(Events(first), Events(second));
    EXPECT_EQ(Times(first), Times(second));
    EXPECT_EQ(Times(first), (std::vector<uint64_t>{3, 4, 5, 6}));
    EXPECT_EQ(engine->activeBank.load(), 0u) << "recording resumes in the same bank";

    At(0, 7, 7);  // and goes on in the ring it was writing
    EXPECT_EQ(Times(ReadOut(log, 3)), (std::vector<uint64_t>{5, 6, 7}));
}

TEST_F(LogFixture, CountBeyondWhatIsHeldIsClipped) {
    log->SetEnabled(1);
    At(0, 1, 1);
    At(2, 2, 2);
    At(1, 3, 3);
    const ReadOutResult r = ReadOut(log, 10);
    ASSERT_EQ(r.count, 3u);
    for (uint32_t i = 3; i <= 10; ++i) {
        EXPECT_EQ(r.low[i], kUntouched);
        EXPECT_EQ(r.events[i], kUntouched);
        EXPECT_EQ(r.data[i], kUntouched);
    }
}

TEST_F(LogFixture, WrappedRingReturnsExactlyItsCapacityAcrossTheEnd) {
    log->Configure(8);
    log->SetEnabled(1);
    At(0, 1, 100);
    At(0, 2, 101);
    for (uint32_t t = 3; t <= 15; ++t) At(1, t, t);  // 13 into 8 slots
    ASSERT_EQ(engine->records[1].wrapCount.load(), 1u);
    ASSERT_EQ(engine->records[1].writeIndex.load(), 5u);

    const ReadOutResult r = ReadOut(log, 100);
    ASSERT_EQ(r.count, 10u);
    EXPECT_EQ(Times(r), (std::vector<uint64_t>{1, 2, 8, 9, 10, 11, 12, 13, 14, 15}));
}

TEST_F(LogFixture, DataWordsOfEachRecordingKind) {
    log->SetEnabled(1);
    log->LogAt1(T(1), 1);
    log->LogAtWithData(T(2), 0x12345678u, 2);
    log->LogAtWithData(T(3), 0xFFFFFFFFu, 3);
    log->LogNowData256(4);
    log->LogNowData0(5);
    log->LogNow5(6);
    ClockTime t{0, 0};
    log->StampAndLog4(t, 7);

    const ReadOutResult r = ReadOut(log, 10);
    ASSERT_EQ(r.count, 7u);
    EXPECT_EQ(Events(r), (std::vector<uint32_t>{1, 2, 3, 4, 5, 6, 7}));
    EXPECT_EQ(std::vector<uint32_t>(r.data.begin(), r.data.begin() + 7),
              (std::vector<uint32_t>{0xFFFFFFFFu, 0x12345678u, 0xFFFFFFFFu, 256, 0, 0xFFFFFFFFu,
                                     0xFFFFFFFFu}));

    // Without a data array the other arrays are filled alike.
    std::vector<uint32_t> lo(7), hi(7), ev(7);
    uint32_t count = 7;
    log->ReadOutMerged(count, lo.data(), hi.data(), ev.data(), nullptr, 0);
    EXPECT_EQ(count, 7u);
    EXPECT_EQ(ev, Events(r));
    EXPECT_EQ(lo[6], t.low);
    EXPECT_EQ(hi[6], t.high);
}

// --- the bank switch ----------------------------------------------------------

TEST_F(LogFixture, CountZeroStartsTheLogAfresh) {
    log->SetEnabled(1);
    At(0, 1, 1);
    At(1, 2, 2);

    ReadOutResult r = ReadOut(log, 0);
    EXPECT_EQ(r.count, 0u);
    EXPECT_EQ(r.low[0], kUntouched);
    EXPECT_EQ(engine->activeBank.load(), kCpus) << "recording moved to the other bank";

    At(2, 3, 3);
    At(0, 4, 4);
    r = ReadOut(log, 10);
    EXPECT_EQ(Times(r), (std::vector<uint64_t>{3, 4})) << "the entries before the call are gone";
    EXPECT_EQ(engine->activeBank.load(), kCpus);
    EXPECT_EQ(Times(ReadOut(log, 10)), (std::vector<uint64_t>{3, 4}));
}

TEST_F(LogFixture, EmptyLogReadsNothingAndSwitchesBanks) {
    ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(r.count, 0u);
    EXPECT_EQ(r.low[0], kUntouched);
    EXPECT_EQ(engine->activeBank.load(), kCpus);
    r = ReadOut(log, 10);
    EXPECT_EQ(r.count, 0u);
    EXPECT_EQ(engine->activeBank.load(), 0u);
}

TEST_F(LogFixture, AfterCountZeroTheOtherBankGoesOnRecording) {
    log->SetEnabled(1);
    At(0, 1, 1);
    ReadOut(log, 0);  // now bank 1 is written
    At(1, 2, 2);
    EXPECT_EQ(Times(ReadOut(log, 10)), (std::vector<uint64_t>{2}));
    At(1, 3, 3);  // still bank 1: the read-out switched back to it
    EXPECT_EQ(Times(ReadOut(log, 10)), (std::vector<uint64_t>{2, 3}));
}

// --- heads that are never selected -------------------------------------------

// A time of 0, or one with high word 0xFFFFFFFF, orders at or before the
// merge's starting point and is never selected. When only such heads remain,
// the merge stops, `count` becomes what was copied, and the copied entries
// are moved down to the start of the arrays.
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
        ASSERT_EQ(r.count, 3u);
        EXPECT_EQ(Times(r), (std::vector<uint64_t>{5, 6, 7}));
        EXPECT_EQ(Events(r), (std::vector<uint32_t>{0x11, 0x121, 0x12}));
        EXPECT_EQ(std::vector<uint32_t>(r.data.begin(), r.data.begin() + 3),
                  (std::vector<uint32_t>{50, 60, 70}));
        EXPECT_EQ(engine->activeBank.load(), 0u) << "switched back: entries were held";
    }

    // Fewer requested than selectable: the normal top-down fill.
    EXPECT_EQ(Times(ReadOut(log, 2)), (std::vector<uint64_t>{6, 7}));
}

TEST_F(LogFixture, NeverSelectedHeadHidesTheOlderEntriesBehindIt) {
    log->SetEnabled(1);
    At(0, 5, 1);
    At(0, 0, 2);  // newest of CPU 0
    At(1, 3, 3);
    At(1, 4, 4);
    EXPECT_EQ(Times(ReadOut(log, 10)), (std::vector<uint64_t>{3, 4}));
}

TEST_F(LogFixture, OnlyNeverSelectedEntriesGiveAnEmptyResultButKeepTheBank) {
    log->SetEnabled(1);
    At(2, 0xFFFFFFFF12345678ull, 1);
    const ReadOutResult r = ReadOut(log, 4);
    EXPECT_EQ(r.count, 0u);
    EXPECT_EQ(engine->activeBank.load(), 0u);
}

// --- real CPUs ----------------------------------------------------------------

// Two threads pinned to CPUs 0 and 1 take turns recording with the log's own
// clock: the read-out interleaves them in time order and tags each entry with
// the CPU it was recorded on.
TEST(LogReadOutRealCpus, PinnedThreadsMergeInTimeOrder) {
    ASSERT_EQ(quelta::PalInitialize(), 1u);
    if (quelta::PalGetCpuCount() < 2) GTEST_SKIP() << "needs 2 CPUs";
    tKPLogEngine* engine = tKPLogEngine::Create();
    ASSERT_NE(engine, nullptr);
    iKPLogEngine* log = engine;
    log->Configure(100);
    log->SetEnabled(1);

    constexpr int kRounds = 20;
    std::atomic<int> turn{0};
    std::atomic<bool> pinned[2] = {{true}, {true}};
    auto worker = [&](int cpu) {
        if (quelta::PalSetAffinityOne(cpu) != 0 || sched_getcpu() != cpu) {
            pinned[cpu].store(false);
        }
        for (int i = 0; i < 2 * kRounds; ++i) {
            if (i % 2 != cpu) continue;
            while (turn.load(std::memory_order_acquire) != i) std::this_thread::yield();
            if (sched_getcpu() != cpu) pinned[cpu].store(false);
            log->LogNow5(static_cast<uint32_t>(i) << 16);
            turn.store(i + 1, std::memory_order_release);
        }
    };
    std::thread a(worker, 0), b(worker, 1);
    a.join();
    b.join();
    if (!pinned[0].load() || !pinned[1].load()) {
        delete log;
        GTEST_SKIP() << "threads could not be kept on CPUs 0 and 1";
    }

    const ReadOutResult r = ReadOut(log, 100);
    ASSERT_EQ(r.count, static_cast<uint32_t>(2 * kRounds));
    std::vector<uint32_t> order[2];
    for (uint32_t k = 0; k < r.count; ++k) {
        if (k > 0) {
            EXPECT_FALSE(quelta::Earlier(r.Time(k), r.Time(k - 1))) << k;
        }
        const uint32_t i = r.events[k] >> 16;
        EXPECT_EQ(Cpu(r.events[k]), i % 2) << k;
        order[i % 2].push_back(i);
    }
    for (auto& seq : order) EXPECT_TRUE(std::is_sorted(seq.begin(), seq.end()));
    delete log;
}

// --- recorders racing read-outs ----------------------------------------------

namespace {

// Each recording is (time, event, data) made from the writer and its
// sequence number, so a read-out can tell whole entries from torn ones.
constexpr uint64_t kTimeBase = 0x0000000100000000ull;
constexpr uint32_t kSeqLimit = 1u << 24;

ClockTime WriterTime(uint32_t writer, uint32_t seq) { return T(kTimeBase + uint64_t(seq) * 8 + writer); }
uint32_t WriterEvent(uint32_t writer, uint32_t seq) { return (seq << 16) | writer; }
uint32_t WriterData(uint32_t writer, uint32_t seq) { return (writer << 24) | seq; }

struct Decoded {
    bool wordsValid;  // each word on its own is one some writer recorded (or
                      // the zero of a slot not written yet)
    bool whole;       // all words from one recording of the writer owning the CPU
    uint32_t writer, seq;
};

Decoded Decode(const ReadOutResult& r, uint32_t k, uint32_t writers) {
    Decoded d{};
    const uint32_t lo = r.low[k], hi = r.high[k], ev = r.events[k], da = r.data[k];
    const bool lowValid = lo == 0 || ((lo & 7) < writers && lo / 8 >= 1 && lo / 8 < kSeqLimit);
    const bool highValid = hi == 0 || hi == 1;
    const bool eventValid = (ev & 0xFFu) < writers;
    const bool dataValid = da == 0 || ((da >> 24) < writers && (da & 0xFFFFFFu) >= 1);
    d.wordsValid = lowValid && highValid && eventValid && dataValid;
    d.writer = lo & 7;
    d.seq = lo / 8;
    d.whole = d.wordsValid && hi == 1 && d.seq >= 1 && (ev & 0xFFu) == d.writer &&
              (ev >> 16) == (d.seq & 0xFFFFu) && da == WriterData(d.writer, d.seq);
    return d;
}

// Runs `writers` recording threads (each on fake CPU `writer` when `ownCpus`,
// else wherever the scheduler puts them) against repeated read-outs, calling
// `check` on each read-out.
template <typename Check>
void RaceReadOuts(iKPLogEngine* log, uint32_t writers, bool ownCpus, Check check) {
    std::atomic<bool> stop{false};
    std::atomic<uint32_t> started{0};
    std::vector<std::thread> threads;
    for (uint32_t w = 0; w < writers; ++w) {
        threads.emplace_back([&, w] {
            if (ownCpus) tFakeCpu = static_cast<int>(w);
            for (uint32_t seq = 1; seq < kSeqLimit && !stop.load(std::memory_order_relaxed); ++seq) {
                log->LogAtWithData(WriterTime(w, seq), WriterData(w, seq), WriterEvent(w, seq));
                if (seq == 1) started.fetch_add(1);
            }
        });
    }
    // Every ring of the bank being written holds entries before the first
    // read-out, so each read-out copies some and the banks keep their roles.
    while (started.load() < writers) std::this_thread::yield();

    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(300);
    int readOuts = 0;
    while (readOuts < 50 || std::chrono::steady_clock::now() < end) {
        check(ReadOut(log, 256));
        ++readOuts;
    }
    stop.store(true);
    for (auto& t : threads) t.join();
}

}  // namespace

// One writer per CPU record: every entry handed out is a recording of that
// CPU's writer, and each CPU's entries come out in the order recorded, except
// at the two ends of the ring, which a writer that chose its ring just before
// the bank switch may still be filling: its newest slot may be stale or torn,
// and in a full ring the writes that reach memory only after the read-out
// took its cursors overwrite the oldest slots (a few, as many as the writer's
// stores still in flight). At least half of each ring must come out whole and
// in order.
TEST(LogReadOutConcurrency, ReadOutsRacingOneWriterPerCpu) {
    FakeCpus fake;
    constexpr uint32_t kWriters = 3;
    constexpr uint32_t kCapacity = 64;
    tKPLogEngine* engine = CreateWithCpus(4);
    ASSERT_NE(engine, nullptr);
    iKPLogEngine* log = engine;
    log->Configure(kCapacity);
    log->SetEnabled(1);

    int failures = 0;
    size_t worstLate = 0;
    RaceReadOuts(log, kWriters, true, [&](const ReadOutResult& r) {
        std::map<uint32_t, std::vector<Decoded>> perCpu;
        for (uint32_t k = 0; k < r.count; ++k) {
            const Decoded d = Decode(r, k, kWriters);
            const uint32_t cpu = Cpu(r.events[k]);
            if ((!d.wordsValid || (r.events[k] & 0xFFu) != cpu) && ++failures <= 5) {
                ADD_FAILURE() << "entry " << k << " is not a recording of CPU " << cpu;
            }
            perCpu[cpu].push_back(d);
        }
        for (auto& [cpu, list] : perCpu) {
            EXPECT_LT(cpu, kWriters);
            // Without the newest entry, the list must end in a whole,
            // strictly ascending run; what precedes it was overwritten late.
            const size_t end = list.size() - 1;
            size_t first = end;
            while (first > 0 && list[first - 1].whole &&
                   (first == end || list[first - 1].seq < list[first].seq)) {
                --first;
            }
            worstLate = std::max(worstLate, first);
            if (end - first < kCapacity / 2 && ++failures <= 5) {
                std::string all;
                for (auto& e : list) all += " " + std::to_string(e.seq) + (e.whole ? "" : "!");
                ADD_FAILURE() << "CPU " << cpu << " has only " << (end - first)
                              << " ordered entries:" << all;
            }
        }
    });
    EXPECT_EQ(failures, 0);
    RecordProperty("worst_late_entries", static_cast<int>(worstLate));
    delete log;
}

// Writers on real CPUs share records, so entries may tear, but every word
// handed out is one some writer recorded and nothing lands outside a ring.
TEST(LogReadOutConcurrency, ReadOutsRacingWritersThatShareRecords) {
    tKPLogEngine* engine = tKPLogEngine::Create();
    ASSERT_NE(engine, nullptr);
    iKPLogEngine* log = engine;
    log->Configure(32);
    log->SetEnabled(1);
    // More writers than CPUs; the writer index lives in 3 bits of the time.
    const uint32_t writers = std::min(2 * engine->CpuCount() + 1, 7u);

    RaceReadOuts(log, writers, false, [&](const ReadOutResult& r) {
        for (uint32_t k = 0; k < r.count; ++k) {
            ASSERT_TRUE(Decode(r, k, writers).wordsValid) << k;
            ASSERT_LT(Cpu(r.events[k]), engine->CpuCount());
        }
    });
    delete log;
}
