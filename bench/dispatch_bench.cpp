/* The chained-pipe dispatch benchmark (as libevent's and libev's bench):
 * N pipes, A of them made readable at the start of a round; each callback
 * reads its byte and writes one into the next pipe, until the round's
 * writes are used up. Reports the cost per dispatched event, in select and
 * in epoll mode.
 *
 * The pipes are the two directions of AF_UNIX stream socket pairs: pipe 2k
 * is read on one end of pair k and fed through the other, pipe 2k+1 the
 * other way round. N pipes thus take N descriptors, which lets 10000 of
 * them fit the usual descriptor limit.
 *
 *   build/default/bench/qorbu_dispatch_bench
 */
#include <benchmark/benchmark.h>
#include <sys/socket.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cstdint>
#include <vector>

#include "selector/sel.h"

namespace {

constexpr int kWritesPerRound = 1000;
constexpr int kSpareDescriptors = 64;

struct Chain {
    std::vector<int> ends; /* pipe i is read on ends[i] and fed through ends[i ^ 1] */
    int writesLeft = 0;
    long fired = 0;
};

Chain g_chain;

int relay_byte(int fd, unsigned, void *arg, SelFdEntry *) {
    char byte;
    if (read(fd, &byte, 1) != 1) return 0;
    ++g_chain.fired;
    if (g_chain.writesLeft > 0) {
        --g_chain.writesLeft;
        const size_t next = (reinterpret_cast<uintptr_t>(arg) + 1) % g_chain.ends.size();
        (void)!write(g_chain.ends[next ^ 1], "e", 1);
    }
    return 0;
}

bool raise_descriptor_limit(rlim_t wanted) {
    struct rlimit lim;
    if (getrlimit(RLIMIT_NOFILE, &lim) != 0) return false;
    if (lim.rlim_cur >= wanted) return true;
    if (lim.rlim_max < wanted) lim.rlim_max = wanted; /* needs privilege */
    lim.rlim_cur = wanted;
    return setrlimit(RLIMIT_NOFILE, &lim) == 0;
}

bool open_chain(int pipes) {
    for (int i = 0; i < pipes; i += 2) {
        int pair[2];
        if (socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0) return false;
        g_chain.ends.push_back(pair[0]);
        g_chain.ends.push_back(pair[1]);
    }
    for (int i = 0; i < pipes; ++i)
        if (SelAddFD(g_chain.ends[i], SEL_READ, 0, relay_byte, reinterpret_cast<void *>(static_cast<uintptr_t>(i))) != 0)
            return false;
    return true;
}

void close_chain() {
    for (int fd : g_chain.ends) {
        SelRemFD(fd);
        close(fd);
    }
    g_chain = Chain{};
}

/* One round: A bytes in flight, relayed until the writes are used up. */
long run_round(int active, int (*pass)()) {
    const int pipes = static_cast<int>(g_chain.ends.size());
    const int spacing = pipes / active;
    g_chain.fired = 0;
    g_chain.writesLeft = kWritesPerRound;
    for (int i = 0; i < active; ++i) (void)!write(g_chain.ends[(i * spacing) ^ 1], "e", 1);
    const long expected = active + kWritesPerRound;
    long passes = 0;
    while (g_chain.fired < expected) {
        pass();
        ++passes;
    }
    return passes;
}

void chained_pipes(benchmark::State &state, bool epoll) {
    const int pipes = static_cast<int>(state.range(0));
    const int active = static_cast<int>(state.range(1));
    if (SelInit() != 0 || !raise_descriptor_limit(pipes + kSpareDescriptors)) {
        state.SkipWithError("cannot get enough descriptors");
        return;
    }
    if (epoll && SelUseEpoll() != 0) {
        state.SkipWithError("epoll_create failed");
        return;
    }
    if (!open_chain(pipes)) {
        close_chain();
        state.SkipWithError("cannot open the pipes");
        return;
    }
    long events = 0, passes = 0;
    for (auto _ : state) {
        passes += run_round(active, epoll ? SelEpoll : SelSelect);
        events += g_chain.fired;
    }
    close_chain();
    if (epoll) {
        close(GetEpollFd());
        DeInitEpoll();
    }
    state.SetItemsProcessed(events);
    state.counters["per_event"] = benchmark::Counter(static_cast<double>(events),
                                                     benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
    state.counters["events_per_pass"] = static_cast<double>(events) / static_cast<double>(passes);
}

void BM_SelectChainedPipes(benchmark::State &state) { chained_pipes(state, false); }
void BM_EpollChainedPipes(benchmark::State &state) { chained_pipes(state, true); }

} // namespace

BENCHMARK(BM_SelectChainedPipes)->ArgNames({"pipes", "active"})->ArgsProduct({{100, 1000}, {1, 100}});
BENCHMARK(BM_EpollChainedPipes)->ArgNames({"pipes", "active"})->ArgsProduct({{100, 1000, 10000}, {1, 100}});

BENCHMARK_MAIN();
