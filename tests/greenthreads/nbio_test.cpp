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
    enum Target { Idle, Invalid, Busy }; // Idle: readable only once the peer writes
    const struct {
        int events, timeout;
        Target target;
        bool peer_writes;
        Outcome expected; // errno checked when not 0
        unsigned watched;
    } cases[] = {
        {POLLPRI, 0, Idle, false, failure(EINVAL), 0}, // nothing watched, no time-out
        {POLLPRI, 20, Idle, false, {-1, 0}, 0},        // a plain sleep
        {POLLIN | POLLPRI, 20, Idle, false, {-1, 0}, SEL_READ},
        {POLLIN, 0, Idle, true, {1, 0}, SEL_READ}, // 0: no time-out at all
        {POLLIN, 1500, Idle, true, {1, 0}, SEL_READ},
        {POLLOUT, 20, Idle, false, {1, 0}, SEL_WRITE},
        {POLLIN | POLLOUT, 0, Idle, false, {1, 0}, SEL_READ | SEL_WRITE},
        {POLLIN, 0, Invalid, false, failure(EINVAL), 0},
        {POLLIN, 100, Busy, false, failure(EBUSY), SEL_EXCEPT}, // someone else's registration stays
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(&c - cases);
        SocketPair pair;
        const int fd = c.target == Invalid ? -1 : pair.fd[0];
        if (c.target == Busy) {
            ASSERT_EQ(SelAddFD(fd, SEL_EXCEPT, 0, ignore, nullptr), 0);
        }
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
        EXPECT_EQ(got.first, c.expected.first);
        if (c.expected.second != 0) {
            EXPECT_EQ(got.second, c.expected.second);
        }
        EXPECT_EQ(watched, c.watched);
        if (c.timeout > 0 && c.expected.second == 0) {
            EXPECT_GT(timer_due_in, c.timeout / 1e3 - 0.25);
            EXPECT_LE(timer_due_in, c.timeout / 1e3);
            if (got.first == -1) {
                EXPECT_GE(took, c.timeout / 1e3);
            }
        } else {
            EXPECT_EQ(timer_due_in, -1) << "a timer was armed";
        }
        EXPECT_EQ(registered(fd), c.target == Busy ? SEL_EXCEPT : 0u);
        EXPECT_EQ(SelCurrentContext()->timerCount, timers_before);
        SelRemFD(fd);
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

TEST_F(NbIo, CallsReturnEndOfFileShortCountsAndErrorsAtOnce) {
    SocketPair empty, full, ended;
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
    };
    auto caller = [&] {
        for (const auto &[call, expected] : cases)
            EXPECT_EQ(OUTCOME(call()), expected) << &expected - &cases[0].second;
    };
    spawn(&caller);
    ASSERT_TRUE(run_for(10));
    for (int fd : busy) EXPECT_EQ(registered(fd), SEL_EXCEPT), SelRemFD(fd);
    close(client);
}

/* The descriptor is left blocking, so that read itself sleeps until SIGALRM
 * interrupts it. A call that retried would get the byte a later signal
 * writes. */
int rescue_fd;
volatile sig_atomic_t alarms;

TEST_F(NbIo, ReadInterruptedByASignalEndsWithEintr) {
    SocketPair pair(false);
    rescue_fd = pair.fd[1];
    struct sigaction action = {}; // without SA_RESTART
    action.sa_handler = [](int) {
        alarms = alarms + 1;
        if (alarms == 2) (void)!write(rescue_fd, "r", 1);
    };
    sigaction(SIGALRM, &action, nullptr);
    char byte;
    Outcome got;
    auto reader = [&] {
        const itimerval every = {{0, 100'000}, {0, 100'000}};
        setitimer(ITIMER_REAL, &every, nullptr);
        got = OUTCOME(nb_read(pair.fd[0], &byte, 1));
    };
    spawn(&reader);
    ASSERT_TRUE(run_for(10));
    const itimerval off = {};
    setitimer(ITIMER_REAL, &off, nullptr);
    EXPECT_EQ(got, failure(EINTR));
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
    expect_released(pair.fd[0]);
    expect_released(pair.fd[1]);
}

// Echo load: the server accepts before any client connects, then echoes
// each connection in its own green thread; every byte is checked.
constexpr size_t kMaxMessage = 16 * 1024; // on the heap: stacks are 16 KiB
struct Server {
    int listener, expected, accepted = 0, finished = 0, errors = 0;
} * server;

/* Small unacknowledged pieces: without this, Nagle meets delayed ACKs. */
void no_delay(int fd) {
    const int on = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
}

void echo(void *arg) {
    const int fd = static_cast<int>(reinterpret_cast<intptr_t>(arg));
    std::vector<char> buffer(kMaxMessage);
    set_nonblocking(fd), no_delay(fd);
    for (int n; (n = nb_read(fd, buffer.data(), kMaxMessage)) != 0;)
        if (n < 0 || nb_write(fd, buffer.data(), static_cast<size_t>(n)) != n) {
            ++server->errors;
            break;
        }
    close(fd), ++server->finished;
}

struct Client {
    const Listener *listener;
    int messages, echoed = 0;
    uint32_t random; // xorshift: each client its own sequence
    uint32_t next() { return random ^= random << 13, random ^= random >> 17, random ^= random << 5; }
};

void run_client(void *arg) {
    auto &c = *static_cast<Client *>(arg);
    std::vector<unsigned char> out(kMaxMessage), in(kMaxMessage);
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking(fd), no_delay(fd);
    bool ok = nb_connect(fd, c.listener->address(), sizeof c.listener->addr) == 0;
    for (int m = 0; ok && m < c.messages; ++m) {
        const size_t size = 1 + c.next() % kMaxMessage;
        std::generate_n(out.begin(), size, [&] { return static_cast<unsigned char>(c.next()); });
        ok = nb_write(fd, out.data(), size) == static_cast<int>(size) &&
             nb_readall(fd, in.data(), size) == static_cast<int>(size) &&
             memcmp(out.data(), in.data(), size) == 0;
        c.echoed += ok;
    }
    close(fd);
}

void run_echo_load(int connections, int messages) {
    Listener listener(4096);
    Server state{listener.fd, connections};
    server = &state;
    auto acceptor = [] {
        for (int fd; server->accepted < server->expected; ++server->accepted)
            if ((fd = nb_accept(server->listener, nullptr, nullptr)) < 0 ||
                greenthread_create(echo, reinterpret_cast<void *>(static_cast<intptr_t>(fd))) == nullptr)
                return void(++server->errors);
    };
    ASSERT_NE(spawn(&acceptor), nullptr);
    std::vector<Client> clients;
    for (int i = 0; i < connections; ++i)
        clients.push_back({&listener, messages, 0, 0x9e3779b9u + 7919u * i});
    for (Client &client : clients) ASSERT_NE(greenthread_create(run_client, &client), nullptr);
    ASSERT_TRUE(run_for(150));
    EXPECT_EQ(state.accepted, connections);
    EXPECT_EQ(state.finished, connections);
    EXPECT_EQ(state.errors, 0);
    EXPECT_EQ(
        std::count_if(clients.begin(), clients.end(), [&](const Client &c) { return c.echoed != messages; }),
        0)
        << "clients that did not get every message back";
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
