// Green threads: switch cost next to a bare swapcontext pair, creation and
// completion with record reuse, and echo round trips over loopback.
//
//   build/default/bench/qorbu_greenthread_bench
#include <benchmark/benchmark.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <ucontext.h>
#include <unistd.h>

#include <vector>

#include "greenthreads/greenthread_private.h"
#include "nbio/nb.h"
#include "selector/sel.h"

using namespace qorbu::gt;

namespace {

void init_once()
{
    static bool done = false;
    if (done)
        return;
    SelInit();
    greenthreads_init();
    done = true;
}

/* Reports time per switch next to the time per iteration. */
void count_switches(benchmark::State &state, int perIteration)
{
    state.counters["per_switch"] = benchmark::Counter(static_cast<double>(state.iterations()) * perIteration,
                                                      benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}

// --- bare swapcontext: the floor for any ucontext-based switch -------------

ucontext_t bareMain, bareOther;

void bare_partner()
{
    for (;;)
        swapcontext(&bareOther, &bareMain);
}

void BM_BareSwapcontextPair(benchmark::State &state)
{
    constexpr size_t kStack = 64 * 1024;
    std::vector<char> stack(kStack);
    getcontext(&bareOther);
    bareOther.uc_stack.ss_sp = stack.data();
    bareOther.uc_stack.ss_size = kStack;
    bareOther.uc_link = nullptr;
    makecontext(&bareOther, bare_partner, 0);
    for (auto _ : state)
        swapcontext(&bareMain, &bareOther); // there and back: two switches
    count_switches(state, 2);
}
BENCHMARK(BM_BareSwapcontextPair);

// --- green-thread yields ------------------------------------------------------

bool stopYielding;

void yield_until_stopped(void *)
{
    while (!stopYielding)
        greenthread_yield();
}

void drain_threads()
{
    stopYielding = true;
    greenthreads_run();
    stopYielding = false;
}

/* The main context and one green thread yielding to each other. */
void BM_YieldPair(benchmark::State &state)
{
    init_once();
    greenthread_create(yield_until_stopped, nullptr);
    for (auto _ : state)
        greenthread_yield(); // there and back: two switches
    count_switches(state, 2);
    drain_threads();
}
BENCHMARK(BM_YieldPair);

/* Two green threads yielding, with the main context taking its turn. */
void BM_YieldTwoThreadsAndMain(benchmark::State &state)
{
    init_once();
    greenthread_create(yield_until_stopped, nullptr);
    greenthread_create(yield_until_stopped, nullptr);
    for (auto _ : state)
        greenthread_yield(); // main -> A -> B -> main: three switches
    count_switches(state, 3);
    drain_threads();
}
BENCHMARK(BM_YieldTwoThreadsAndMain);

// --- creation and completion ----------------------------------------------

void finish_at_once(void *) {}

/* Each iteration creates a thread on the record the previous one left and
 * runs it to completion. */
void BM_CreateAndFinishReused(benchmark::State &state)
{
    init_once();
    greenthread_create(finish_at_once, nullptr);
    greenthread_yield(); // leaves one finished record behind
    for (auto _ : state) {
        greenthread_create(finish_at_once, nullptr);
        greenthread_yield();
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_CreateAndFinishReused);

// --- echo round trips over loopback ---------------------------------------

constexpr size_t kMessage = 64;

void set_nonblocking_nodelay(int fd)
{
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
    const int on = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
}

void echo_server_connection(void *arg)
{
    const int fd = static_cast<int>(reinterpret_cast<intptr_t>(arg));
    char buffer[kMessage];
    for (;;) {
        const int n = nb_read(fd, buffer, sizeof buffer);
        if (n <= 0 || nb_write(fd, buffer, static_cast<size_t>(n)) != n)
            break;
    }
    close(fd);
}

struct EchoBench {
    int listener = -1;
    sockaddr_in address{};
    int connections = 0;
    int connected = 0;
    int roundTrips = 0; // completed in the current iteration
    int failures = 0;
    bool stopping = false;
    std::vector<Greenthread *> clients;
};

void accept_all(void *arg)
{
    auto *bench = static_cast<EchoBench *>(arg);
    for (int i = 0; i < bench->connections; ++i) {
        const int fd = nb_accept(bench->listener, nullptr, nullptr);
        if (fd < 0) {
            ++bench->failures;
            return;
        }
        set_nonblocking_nodelay(fd);
        greenthread_create(echo_server_connection, reinterpret_cast<void *>(static_cast<intptr_t>(fd)));
    }
}

/* One round trip per wakeup, then blocks until the next iteration. */
void echo_client(void *arg)
{
    auto *bench = static_cast<EchoBench *>(arg);
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking_nodelay(fd);
    if (nb_connect(fd, reinterpret_cast<sockaddr *>(&bench->address), sizeof bench->address) != 0)
        ++bench->failures;
    ++bench->connected;
    char out[kMessage] = {'p'}, in[kMessage];
    for (;;) {
        greenthread_block();
        if (bench->stopping)
            break;
        if (nb_write(fd, out, sizeof out) != static_cast<int>(sizeof out) ||
            nb_readall(fd, in, sizeof in) != static_cast<int>(sizeof in))
            ++bench->failures;
        ++bench->roundTrips;
    }
    close(fd);
}

bool open_listener(EchoBench &bench)
{
    bench.listener = socket(AF_INET, SOCK_STREAM, 0);
    bench.address.sin_family = AF_INET;
    bench.address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof bench.address;
    if (bind(bench.listener, reinterpret_cast<sockaddr *>(&bench.address), sizeof bench.address) != 0 ||
        getsockname(bench.listener, reinterpret_cast<sockaddr *>(&bench.address), &len) != 0 ||
        listen(bench.listener, 4096) != 0)
        return false;
    fcntl(bench.listener, F_SETFL, fcntl(bench.listener, F_GETFL) | O_NONBLOCK);
    return true;
}

void run_until(const EchoBench &bench, int roundTrips)
{
    while (bench.roundTrips < roundTrips && bench.failures == 0)
        run_one_turn();
}

void BM_EchoRoundTrips(benchmark::State &state)
{
    init_once();
    const bool epoll = state.range(1) != 0;
    EchoBench bench;
    bench.connections = static_cast<int>(state.range(0));
    rlimit limit;
    getrlimit(RLIMIT_NOFILE, &limit);
    if (limit.rlim_cur < limit.rlim_max) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
    if (epoll)
        SelUseEpoll();
    if (!open_listener(bench)) {
        state.SkipWithError("cannot listen on loopback");
        return;
    }
    greenthread_create(accept_all, &bench);
    for (int i = 0; i < bench.connections; ++i)
        bench.clients.push_back(greenthread_create(echo_client, &bench));
    // Let every client connect and block until its first round trip.
    while ((bench.connected < bench.connections || run_queue_head != nullptr) && bench.failures == 0)
        run_one_turn();

    for (auto _ : state) {
        bench.roundTrips = 0;
        for (Greenthread *client : bench.clients)
            greenthread_wakeup(client);
        run_until(bench, bench.connections);
    }
    if (bench.failures != 0)
        state.SkipWithError("echo failed");
    state.SetItemsProcessed(state.iterations() * bench.connections);
    state.counters["round_trips_per_s"] =
        benchmark::Counter(static_cast<double>(state.iterations()) * bench.connections, benchmark::Counter::kIsRate);

    bench.stopping = true;
    for (Greenthread *client : bench.clients)
        greenthread_wakeup(client);
    greenthreads_run();
    close(bench.listener);
    if (epoll)
        DeInitEpoll();
}
BENCHMARK(BM_EchoRoundTrips)
    ->ArgNames({"connections", "epoll"})
    ->Args({1, 0})
    ->Args({100, 0})
    ->Args({1, 1})
    ->Args({100, 1})
    ->Args({1000, 1})
    ->UseRealTime();

} // namespace

BENCHMARK_MAIN();
