// Cost of the selector's timer heap and descriptor registry.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <unistd.h>

#include <random>
#include <vector>

#include "selector/sel_private.h"

namespace {

int noop_timer(SelTimer *) { return 0; }
int noop_fd(int, unsigned, void *, SelFdEntry *) { return 0; }

// n armed timers with deadlines spread over an hour, in random order.
struct ArmedTimers {
    std::vector<SelTimer> timers;
    SelContext *ctx;

    explicit ArmedTimers(size_t n) : timers(n) {
        SelInit();
        ctx = SelCurrentContext();
        SelRemoveAllTimers();
        std::mt19937 rng(7);
        for (SelTimer &t : timers) {
            t = SelTimer{};
            t.callback = noop_timer;
            SelMakeWhen(&t.when, 10 + static_cast<long>(rng() % 3600), static_cast<long>(rng() % 1000000000));
            SelAddTimer(&t);
        }
    }
    ~ArmedTimers() { SelRemoveAllTimers(); }
};

void BM_ArmCancel(benchmark::State &state) {
    ArmedTimers armed(static_cast<size_t>(state.range(0)));
    SelTimer t{};
    t.callback = noop_timer;
    SelMakeWhen(&t.when, 1800, 0);
    for (auto _ : state) {
        SelAddTimer(&t);
        SelRemTimer(&t);
    }
}
BENCHMARK(BM_ArmCancel)->Arg(100)->Arg(10000)->Arg(1000000);

void BM_Rearm(benchmark::State &state) {
    ArmedTimers armed(static_cast<size_t>(state.range(0)));
    std::mt19937 rng(11);
    size_t i = 0;
    for (auto _ : state) {
        SelTimer &t = armed.timers[i];
        struct timespec when = t.when;
        when.tv_sec += static_cast<long>(rng() % 64) - 32;
        SelModifyTimer(&t, &when);
        if (++i == armed.timers.size())
            i = 0;
    }
}
BENCHMARK(BM_Rearm)->Arg(100)->Arg(10000)->Arg(1000000);

// Each fired timer re-arms itself further ahead, so the heap keeps its size.
int rearm_far(SelTimer *t) {
    t->when.tv_sec += 7200;
    return SelAddTimer(t);
}

void BM_Fire(benchmark::State &state) {
    ArmedTimers armed(static_cast<size_t>(state.range(0)));
    std::vector<SelTimer> due(101);
    int64_t fired = 0;
    for (auto _ : state) {
        state.PauseTiming();
        for (SelTimer &t : due) {
            t = SelTimer{};
            t.callback = rearm_far;
            SelMakeWhen(&t.when, -1, 0);
        }
        for (SelTimer &t : due)
            SelAddTimer(&t);
        state.ResumeTiming();
        fired += SelRunTimers(armed.ctx);
        state.PauseTiming();
        for (SelTimer &t : due)
            SelRemTimer(&t);
        state.ResumeTiming();
    }
    state.SetItemsProcessed(fired);
    state.counters["ns_per_fire"] =
        benchmark::Counter(static_cast<double>(fired), benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(BM_Fire)->Arg(100)->Arg(10000)->Arg(1000000);

void BM_DescriptorAddRemove(benchmark::State &state) {
    SelInit();
    int fds[2];
    if (pipe(fds) != 0) {
        state.SkipWithError("pipe failed");
        return;
    }
    for (auto _ : state) {
        SelAddFD(fds[0], SEL_READ, 0, noop_fd, nullptr);
        SelRemFD(fds[0]);
    }
    close(fds[0]);
    close(fds[1]);
}
BENCHMARK(BM_DescriptorAddRemove);

} // namespace

BENCHMARK_MAIN();
