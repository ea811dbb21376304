// The atomics policy of tLinux/PalAtomic.h over Relacy's memory model, and the
// models' driver: every load may return any value the model allows, and an
// rl::var read without happens-before from its write is a race. Include the
// library's headers BEFORE this one (Relacy's macros would rewrite them). Each
// ordered operation knows its call site, so `--weaken-each` can weaken one.
#ifndef QUELTA_MODELS_RELACYATOMICS_H
#define QUELTA_MODELS_RELACYATOMICS_H

#include <relacy/relacy.hpp>

#include <cstdio>
#include <cstring>
#include <iostream>
#include <streambuf>

namespace models {

// Nothing here allocates: Relacy's operator new belongs to each simulation.
struct Site {
    const char* file;  // __builtin_FILE: static storage
    int line;
    rl::memory_order order;
    char kind;  // 'l' load, 's' store, 'r' read-modify-write, 'f' fence

    bool Is(const char* f, int l, char k) const { return line == l && kind == k && std::strcmp(file, f) == 0; }
};

struct Weakening {
    bool recording = false;
    Site seen[64];  // the ordered sites the models went through
    size_t count = 0;
    const Site* weakened = nullptr;  // the site run weaker, and how
    rl::memory_order to = rl::mo_relaxed;
};
inline Weakening gWeak;

inline rl::memory_order At(rl::memory_order order, char kind, const char* file, int line) {
    Weakening& w = gWeak;
    if (order == rl::mo_relaxed) return order;
    if (w.recording) {
        bool known = false;
        for (size_t i = 0; i < w.count; ++i) known = known || w.seen[i].Is(file, line, kind);
        if (!known && w.count < sizeof w.seen / sizeof w.seen[0]) w.seen[w.count++] = Site{file, line, order, kind};
    }
    return w.weakened != nullptr && w.weakened->Is(file, line, kind) ? w.to : order;
}

#define QUELTA_MODEL_SITE const char *file = __builtin_FILE(), int line = __builtin_LINE()

struct RlAtomics {
    template <class T>
    using Atomic = rl::atomic<T>;
    using Order = rl::memory_order;

    static constexpr Order kRelaxed = rl::mo_relaxed, kAcquire = rl::mo_acquire, kRelease = rl::mo_release,
                           kAcqRel = rl::mo_acq_rel, kSeqCst = rl::mo_seq_cst;
    // The library's relaxed load kept in order by an address dependency: the
    // model reads it as consume (which Relacy treats as acquire).
    static constexpr Order kDependency = rl::mo_consume;

    template <class W>
    static auto Load(const W& word, Order order, QUELTA_MODEL_SITE) {
        return word.load(At(order, 'l', file, line), rl::debug_info("", file, line));
    }
    template <class W, class T>
    static void Store(W& word, T value, Order order, QUELTA_MODEL_SITE) {
        word.store(value, At(order, 's', file, line), rl::debug_info("", file, line));
    }
    template <class W, class T>
    static auto FetchAdd(W& word, T delta, Order order, QUELTA_MODEL_SITE) {
        return word.fetch_add(delta, At(order, 'r', file, line), rl::debug_info("", file, line));
    }
    template <class W, class T>
    static auto Exchange(W& word, T value, Order order, QUELTA_MODEL_SITE) {
        return word.exchange(value, At(order, 'r', file, line), rl::debug_info("", file, line));
    }
    static void Fence(Order order, QUELTA_MODEL_SITE) {
        const Order o = At(order, 'f', file, line);
        if (o != rl::mo_relaxed) rl::atomic_thread_fence(o, rl::debug_info("", file, line));
    }
    // The library's store barrier, read as the release fence it stands in for.
    static void StoreFence(QUELTA_MODEL_SITE) { Fence(rl::mo_release, file, line); }
};

#undef QUELTA_MODEL_SITE

// A model, searched through every schedule with at most `preemptions`
// switches away from a thread that could go on.
struct Case {
    const char* name;
    bool (*run)(rl::test_params&);
    unsigned preemptions;
};

// Discards Relacy's reports without allocating (they are written inside a simulation).
struct NullBuffer : std::streambuf {
    int overflow(int c) override { return c; }
};

// Runs every case; unless quiet, the failing one's history goes to standard output.
inline const char* RunAll(const Case* cases, size_t n, bool quiet) {
    static NullBuffer nullBuffer;
    static std::ostream null(&nullBuffer);
    for (size_t i = 0; i < n; ++i) {
        rl::test_params params;
        params.iteration_count = 100000000;  // a bound the searches end well before
        params.search_type = rl::fair_context_bound_scheduler_type;
        params.context_bound = cases[i].preemptions;
        params.output_stream = &null;
        params.progress_stream = &null;
        if (!cases[i].run(params)) {
            if (!quiet) {
                // Once more, reporting: schedules are seeded by number, so the same one fails.
                std::printf("%s: FAILED\n", cases[i].name);
                params.output_stream = &std::cout;
                cases[i].run(params);
            }
            return cases[i].name;
        }
        if (!quiet) std::printf("%s: ok (%llu schedules)\n", cases[i].name,
                                static_cast<unsigned long long>(params.stop_iteration));
    }
    return nullptr;
}

// Every case, status 0 when all hold; with --weaken-each one line per ordered
// call site and weaker order, naming the case that caught it or "NOT caught".
inline int RunModels(int argc, char** argv, const Case* cases, size_t n) {
    if (argc < 2 || std::strcmp(argv[1], "--weaken-each") != 0) return RunAll(cases, n, false) == nullptr ? 0 : 1;
    Weakening& w = gWeak;
    w.recording = true;
    if (RunAll(cases, n, true) != nullptr) return 1;
    w.recording = false;
    for (size_t i = 0; i < w.count; ++i) {
        // Relaxed, and for a seq_cst operation first the acquire/release order of its kind.
        const Site& site = w.seen[i];
        const rl::memory_order paired = site.kind == 'l' ? rl::mo_acquire
                                        : site.kind == 's' ? rl::mo_release
                                                           : rl::mo_acq_rel;
        const rl::memory_order tries[] = {paired, rl::mo_relaxed};
        for (size_t k = site.order == rl::mo_seq_cst ? 0 : 1; k < 2; ++k) {
            w.weakened = &site;
            w.to = tries[k];
            const char* caught = RunAll(cases, n, true);
            std::printf("%s:%d %c %s -> %s: %s%s\n", site.file, site.line, site.kind, rl::format(site.order),
                        rl::format(w.to), caught ? "caught by " : "NOT caught", caught ? caught : "");
        }
    }
    w.weakened = nullptr;
    return 0;
}

}  // namespace models

#endif
