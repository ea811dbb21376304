// The log engine's read-out through iKPLogEngine: merge order across CPUs,
// ties, clipping, wrapped rings, data words, the bank switch, heads that are
// never selected, real pinned threads, and recorders racing read-outs.
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

// --- merge order ----------------------------------------------------------------

TEST_F(LogFixture, InterleavedCpusMergeNewestFirstIntoAscendingArrays) {
    log->SetEnabled(1);
    for (uint32_t t = 10; t <= 90; t += 10) {  // CPUs 0, 1, 2, 0, 1, 2, ...
        const int cpu = static_cast<int>((t / 10 - 1) % 3);
        At(cpu, t, 0xABCDFF00u | t);  // bits 8-15 are replaced by the CPU
    }
    ReadOutResult r = ReadOut(log, 5);
    EXPECT_EQ(r.Times(), (std::vector<uint64_t>{50, 60, 70, 80, 90}));
    for (uint32_t i = 0; i < r.count; ++i) {
        const uint32_t t = r.low[i];
        EXPECT_EQ(r.events[i], 0xABCD0000u | (((t / 10 - 1) % 3) << 8) | t) << i;
    }
    EXPECT_EQ(ReadOut(log, 9).Times(), (std::vector<uint64_t>{10, 20, 30, 40, 50, 60, 70, 80, 90}));
}

TEST_F(LogFixture, MergeUsesTheClockTimeOrderAndBreaksTiesByCpu) {
    log->SetEnabled(1);
    At(0, 0x00000001FFFFFFFFull, 1);
    At(1, 0xFFFFFFFE00000000ull, 2);
    At(2, 0x0000000200000000ull, 3);
    At(3, 0xFFFFFFFF00000005ull, 4);  // high word 0xFFFFFFFF: before 0, never selected
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{0x001, 0x203, 0x102}));

    log->Reconfigure();
    log->SetEnabled(1);
    At(3, 100, 3);
    At(0, 100, 0);
    At(1, 100, 1);
    At(2, 50, 2);
    // Equal times: the lower CPU index lands at the higher array index.
    EXPECT_EQ(ReadOut(log, 10).Events(), (std::vector<uint32_t>{0x202, 0x303, 0x101, 0x000}));
}

TEST_F(LogFixture, ReadOutRepeatsWithoutConsumingAndClipsTheCount) {
    log->SetEnabled(1);
    for (uint32_t i = 1; i <= 6; ++i) At(static_cast<int>(i % 2), i, i);
    EXPECT_EQ(ReadOut(log, 4).Times(), (std::vector<uint64_t>{3, 4, 5, 6}));
    EXPECT_EQ(ReadOut(log, 4).Times(), (std::vector<uint64_t>{3, 4, 5, 6}));
    EXPECT_EQ(engine->activeBank.load(), 0u) << "recording resumes in the same bank";
    At(0, 7, 7);

    const ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(r.Times(), (std::vector<uint64_t>{1, 2, 3, 4, 5, 6, 7}));
    for (uint32_t i = 7; i <= 10; ++i) {
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
    for (uint32_t t = 3; t <= 15; ++t) At(1, t, t);  // 13 into 8 slots: wraps at slot 5
    ASSERT_EQ(Record(1).writeIndex.load(), 5u);
    EXPECT_EQ(ReadOut(log, 100).Times(), (std::vector<uint64_t>{1, 2, 8, 9, 10, 11, 12, 13, 14, 15}));
}

// --- the bank switch --------------------------------------------------------------

TEST_F(LogFixture, CountZeroStartsTheLogAfresh) {
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
}

TEST_F(LogFixture, EmptyLogReadsNothingAndSwitchesBanks) {
    ReadOutResult r = ReadOut(log, 10);
    EXPECT_EQ(r.count, 0u);
    EXPECT_EQ(r.low[0], kUntouched);
    EXPECT_EQ(engine->activeBank.load(), kCpus);
    EXPECT_EQ(ReadOut(log, 10).count, 0u);
    EXPECT_EQ(engine->activeBank.load(), 0u);
}

// --- heads that are never selected ------------------------------------------------

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
    log->Reconfigure();
    log->SetEnabled(1);
    At(0, 5, 1);
    At(0, 0, 2);
    At(1, 3, 3);
    At(1, 4, 4);
    EXPECT_EQ(ReadOut(log, 10).Times(), (std::vector<uint64_t>{3, 4}));
    log->Reconfigure();
    log->SetEnabled(1);
    At(2, 0xFFFFFFFF12345678ull, 1);
    EXPECT_EQ(ReadOut(log, 4).count, 0u);
    EXPECT_EQ(engine->activeBank.load(), 0u);
}

// --- real CPUs ------------------------------------------------------------------

// Threads pinned to CPUs 0 and 1 take turns recording with the log's clock:
// the read-out interleaves them in time order, each tagged with its CPU.
TEST(LogReadOutRealCpus, PinnedThreadsMergeInTimeOrder) {
    ASSERT_EQ(quelta::PalInitialize(), 1u);
    if (quelta::PalGetCpuCount() < 2) GTEST_SKIP() << "needs 2 CPUs";
    iKPLogEngine* log = tKPLogEngine::Create();
    ASSERT_NE(log, nullptr);
    log->Configure(100);
    log->SetEnabled(1);

    constexpr uint32_t kTurns = 40;
    std::atomic<uint32_t> turn{0};
    std::atomic<bool> pinned{true};
    auto worker = [&](uint32_t cpu) {
        if (quelta::PalSetAffinityOne(static_cast<int32_t>(cpu)) != 0) pinned = false;
        for (uint32_t i = cpu; i < kTurns; i += 2) {
            while (turn.load(std::memory_order_acquire) != i) std::this_thread::yield();
            if (sched_getcpu() != static_cast<int>(cpu)) pinned = false;
            log->LogNow5(i << 16);
            turn.store(i + 1, std::memory_order_release);
        }
    };
    std::thread a(worker, 0u), b(worker, 1u);
    a.join();
    b.join();
    const ReadOutResult r = ReadOut(log, 100);
    delete log;
    if (!pinned) GTEST_SKIP() << "threads could not be kept on CPUs 0 and 1";

    ASSERT_EQ(r.count, kTurns);
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
}

// --- recorders racing read-outs ----------------------------------------------------

namespace {

// Recording `seq` of writer w: time 2^32 + 8 seq + w, event (seq << 16) | w,
// data (w << 24) | seq, so a read-out can tell whole entries from torn ones.
constexpr uint32_t kSeqLimit = 1u << 24;

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
    d.wordsValid = (lo == 0 || (d.writer < writers && d.seq >= 1)) && hi <= 1 &&
                   (ev & 0xFFu) < writers && (da == 0 || ((da >> 24) < writers && (da & 0xFFFFFFu) >= 1));
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
            for (uint32_t seq = 1; seq < kSeqLimit && !stop.load(std::memory_order_relaxed); ++seq) {
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
    iKPLogEngine* log = CreateWithCpus(4);
    ASSERT_NE(log, nullptr);
    log->Configure(kCapacity);
    log->SetEnabled(1);
    int failures = 0;
    RaceReadOuts(log, kWriters, true, [&](const ReadOutResult& r) {
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
            const size_t end = list.size() - 1;
            size_t first = end;
            while (first > 0 && list[first - 1].whole &&
                   (first == end || list[first - 1].seq < list[first].seq)) {
                --first;
            }
            if (end - first < kCapacity / 2) ++failures;
        }
    });
    EXPECT_EQ(failures, 0);
    delete log;
}

// Writers on real CPUs share records, so entries may tear, but every word
// handed out is one some writer recorded and the CPU index is in range.
TEST(LogReadOutConcurrency, ReadOutsRacingWritersThatShareRecords) {
    tKPLogEngine* engine = tKPLogEngine::Create();
    ASSERT_NE(engine, nullptr);
    iKPLogEngine* log = engine;
    log->Configure(32);
    log->SetEnabled(1);
    const uint32_t writers = std::min(2 * engine->CpuCount() + 1, 7u);  // 3 bits in the time
    RaceReadOuts(log, writers, false, [&](const ReadOutResult& r) {
        for (uint32_t k = 0; k < r.count; ++k) {
            ASSERT_TRUE(Decode(r, k, writers).wordsValid) << k;
            ASSERT_LT(Cpu(r.events[k]), engine->CpuCount());
        }
    });
    delete log;
}
