// nb_poll and the descriptor calls: waits, time-outs and error paths, then
// loopback echo load with one green thread per connection.
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/time.h>

#include <algorithm>
#include <functional>
#include <vector>

#include "gt_test_support.h"

using namespace qorbu::test;

namespace {

using NbIo = GreenThreads;

int ignore(int, unsigned, void *, SelFdEntry *) { return 0; }

TEST_F(NbIo, PollWatchesInAndOutTimesOutAndRefusesWaitsThatCouldNeverEnd) {
    const struct {
        int events, timeout;
        bool valid_fd, peer_writes;
        int result, error; // error checked when not 0
        unsigned watched;
    } cases[] = {
        {POLLPRI, 0, true, false, -1, EINVAL, 0}, // nothing watched, no time-out
        {POLLPRI, 20, true, false, -1, 0, 0},     // a plain sleep
        {POLLIN | POLLPRI, 20, true, false, -1, 0, SEL_READ},
        {POLLIN, 0, true, true, 1, 0, SEL_READ}, // 0: no time-out at all
        {POLLIN, 1500, true, true, 1, 0, SEL_READ},
        {POLLOUT, 20, true, false, 1, 0, SEL_WRITE},
        {POLLIN | POLLOUT, 0, true, false, 1, 0, SEL_READ | SEL_WRITE},
        {POLLIN, 0, false, false, -1, EINVAL, 0},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(&c - cases);
        SocketPair pair; // fd[0]: writable, readable once the peer writes
        const int fd = c.valid_fd ? pair.fd[0] : -1;
        Outcome got;
        double took = 0, timer_due_in = -1;
        unsigned watched = 0;
        auto waiter = [&] {
            const double start = seconds_now();
            got = OUTCOME(nb_poll(fd, c.events, c.timeout));
            took = seconds_now() - start;
        };
        auto inspector = [&] { // runs once the waiter waits
            watched = registered(fd);
            const SelContext *ctx = SelCurrentContext();
            for (int i = 1; i <= ctx->timerCount; ++i) {
                const timespec &when = ctx->timerHeap[i]->when;
                if (ctx->timerHeap[i]->callback == nb_poll_on_timeout)
                    timer_due_in = static_cast<double>(when.tv_sec) + when.tv_nsec / 1e9 - seconds_now();
            }
            if (c.peer_writes) nb_poll(-1, 0, 30), (void)!write(pair.fd[1], "x", 1);
        };
        spawn(&waiter), spawn(&inspector);
        ASSERT_TRUE(run_for(10));
        EXPECT_EQ(got.first, c.result);
        EXPECT_EQ(c.error ? got.second : 0, c.error);
        EXPECT_EQ(watched, c.watched);
        const double due = c.timeout > 0 && c.error == 0 ? c.timeout / 1e3 : -1; // -1: no timer
        EXPECT_NEAR(timer_due_in, due, 0.25);
        EXPECT_GE(took, got.first == -1 ? due : 0) << "timed out early";
        EXPECT_EQ(registered(fd), 0u);
        EXPECT_EQ(armed_timers(), 0);
    }
}

TEST_F(NbIo, ReadinessWinsOverTheTimeOutInEitherOrder) {
    for (const bool timeout_first : {false, true}) {
        NbWait wait = {current_greenthread(), 0};
        SelTimer timer = {};
        timer.arg = &wait;
        if (timeout_first) nb_poll_on_timeout(&timer);
        nb_poll_on_ready(-1, SEL_READ, &wait, nullptr);
        nb_poll_on_timeout(&timer);
        EXPECT_EQ(wait.result, 1);
    }
}

int rescue_fd, alarms; // touched only by the signal handler

TEST_F(NbIo, CallsReturnEndOfFileShortCountsAndErrorsAtOnce) {
    SocketPair empty, full, ended, blocking(false);
    Listener listener, refusing(1, false);
    const int client = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking(client);
    std::vector<char> buf(64 * 1024);
    while (write(full.fd[1], buf.data(), buf.size()) > 0) {}
    ASSERT_EQ(write(ended.fd[1], "0123456789", 10), 10);
    ended.close_end(1);
    // Registered by someone else: a call that would have to wait fails instead.
    const int busy[] = {empty.fd[0], full.fd[1], listener.fd, ended.fd[0]};
    for (int fd : busy) ASSERT_EQ(SelAddFD(fd, SEL_EXCEPT, 0, ignore, nullptr), 0);
    rescue_fd = blocking.fd[1];
    struct sigaction action = {}; // without SA_RESTART
    action.sa_handler = [](int) { (void)(++alarms < 2 || write(rescue_fd, "r", 1)); };
    sigaction(SIGALRM, &action, nullptr);
    itimerval every = {{0, 100'000}, {0, 100'000}};
    const std::pair<std::function<int()>, Outcome> cases[] = {
        {[] { return nb_readall(-1, nullptr, 0); }, {0, 0}}, // no system call for nothing
        {[] { return nb_write(-1, nullptr, 0); }, {0, 0}},
        {[&] { return nb_read(-1, buf.data(), 1); }, failure(EBADF)},
        {[&] { return nb_readall(ended.fd[0], buf.data(), 100); }, {10, 0}}, // 10 of 100, then the end
        {[&] { return nb_read(ended.fd[0], buf.data(), 100); }, {0, 0}},
        {[&] { return nb_read(empty.fd[0], buf.data(), 1); }, failure(EBUSY)},
        {[&] { return nb_readall(empty.fd[0], buf.data(), 1); }, failure(EBUSY)},
        {[&] { return nb_write(full.fd[1], buf.data(), 1); }, failure(EBUSY)},
        {[&] { return nb_accept(listener.fd, nullptr, nullptr); }, failure(EBUSY)},
        {[&] { return nb_connect(client, refusing.address(), sizeof refusing.addr); }, failure(ECONNREFUSED)},
        // read itself sleeps until a signal interrupts it; a retry would get the byte a later one writes
        {[&] { return setitimer(ITIMER_REAL, &every, nullptr), nb_read(blocking.fd[0], buf.data(), 1); },
         failure(EINTR)},
    };
    auto caller = [&] {
        for (const auto &[call, expected] : cases)
            EXPECT_EQ(OUTCOME(call()), expected) << &expected - &cases[0].second;
    };
    spawn(&caller);
    ASSERT_TRUE(run_for(10));
    every = {};
    setitimer(ITIMER_REAL, &every, nullptr);
    for (int fd : busy) EXPECT_EQ(registered(fd), SEL_EXCEPT), SelRemFD(fd);
    close(client);
}

TEST_F(NbIo, WriteAndReadallBeyondTheSocketBuffersWaitForEachOther) {
    SocketPair pair;
    const int small = 4096;
    setsockopt(pair.fd[1], SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
    setsockopt(pair.fd[0], SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
    std::vector<unsigned char> out(256 * 1024), in(out.size());
    for (size_t i = 0; i < out.size(); ++i) out[i] = static_cast<unsigned char>(i * 7 + i / 251);
    int written = 0, read_back = 0;
    auto writer = [&] { written = nb_write(pair.fd[1], out.data(), out.size()); };
    auto reader = [&] { read_back = nb_readall(pair.fd[0], in.data(), in.size()); };
    spawn(&writer), spawn(&reader);
    ASSERT_TRUE(run_for(10));
    EXPECT_EQ(written, static_cast<int>(out.size()));
    EXPECT_EQ(read_back, written);
    EXPECT_TRUE(in == out);
    EXPECT_EQ(registered(pair.fd[0]) | registered(pair.fd[1]), 0u);
    EXPECT_EQ(armed_timers(), 0);
}

// Echo load: the server accepts before any client connects, then echoes
// each connection in its own green thread; every byte is checked.
constexpr size_t kMaxMessage = 16 * 1024; // on the heap: stacks are 16 KiB
constexpr int kOn = 1;
struct Load {
    const Listener &listener;
    int connections, messages, accepted = 0, closed = 0, clients_ok = 0, errors = 0;
} * load;

/* Small unacknowledged pieces: without this, Nagle meets delayed ACKs. */
void no_delay(int fd) { setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &kOn, sizeof kOn); }

void echo(void *arg) {
    const int fd = static_cast<int>(reinterpret_cast<intptr_t>(arg));
    std::vector<char> buffer(kMaxMessage);
    set_nonblocking(fd), no_delay(fd);
    for (int n; (n = nb_read(fd, buffer.data(), kMaxMessage)) != 0;)
        if (n < 0 || nb_write(fd, buffer.data(), static_cast<size_t>(n)) != n) {
            ++load->errors;
            break;
        }
    close(fd), ++load->closed;
}

void run_client(void *index) { // random sizes and bytes, a sequence of its own per client
    uint32_t random = 0x9e3779b9u + 7919u * static_cast<uint32_t>(reinterpret_cast<intptr_t>(index));
    auto next = [&] { return random ^= random << 13, random ^= random >> 17, random ^= random << 5; };
    std::vector<unsigned char> out(kMaxMessage), in(kMaxMessage);
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking(fd), no_delay(fd);
    bool ok = nb_connect(fd, load->listener.address(), sizeof load->listener.addr) == 0;
    for (int m = 0; ok && m < load->messages; ++m) {
        const size_t size = 1 + next() % kMaxMessage;
        std::generate_n(out.begin(), size, [&] { return static_cast<unsigned char>(next()); });
        ok = nb_write(fd, out.data(), size) == static_cast<int>(size) &&
             nb_readall(fd, in.data(), size) == static_cast<int>(size) &&
             memcmp(out.data(), in.data(), size) == 0;
    }
    close(fd), load->clients_ok += ok;
}

void run_echo_load(int connections, int messages) {
    Listener listener(4096);
    Load state{listener, connections, messages};
    load = &state;
    auto acceptor = [] {
        for (int fd; load->accepted < load->connections; ++load->accepted)
            if ((fd = nb_accept(load->listener.fd, nullptr, nullptr)) < 0 ||
                greenthread_create(echo, reinterpret_cast<void *>(static_cast<intptr_t>(fd))) == nullptr)
                return void(++load->errors);
    };
    ASSERT_NE(spawn(&acceptor), nullptr);
    for (intptr_t i = 0; i < connections; ++i)
        ASSERT_NE(greenthread_create(run_client, reinterpret_cast<void *>(i)), nullptr);
    ASSERT_TRUE(run_for(scaled(60, 220))); // native runs take a few seconds
    EXPECT_EQ(state.accepted, connections);
    EXPECT_EQ(state.closed, connections);
    EXPECT_EQ(state.errors, 0);
    EXPECT_EQ(state.clients_ok, connections) << "clients got every message back";
    EXPECT_EQ(registered(listener.fd), 0u);
}

TEST_F(NbIo, EchoLoadTwoHundredClientsFiftyMessagesEachInSelectMode) {
    run_echo_load(scaled(200, 100), scaled(50, 20));
}

TEST_F(NbIo, EchoLoadThreeThousandConnectionsInEpollMode) {
    const int connections = scaled(3000, 1100); // beyond select's 1024 either way
    SKIP_UNLESS_FD_LIMIT(2 * connections + 64);
    ASSERT_EQ(SelUseEpoll(), 0);
    run_echo_load(connections, 3);
    DeInitEpoll();
}

} // namespace
