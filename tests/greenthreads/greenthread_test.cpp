// Green threads and their descriptor calls. Where the run queue is checked the main context drives the
// threads a pass at a time; every other run has a deadline: a fault fails an assertion, never hangs.
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/time.h>
#include <csignal>
#include <functional>
#include <thread>
#include <vector>

#include "greenthreads/greenthread_private.h"
#include "nbio/nb_private.h"
#include "selector/sel_private.h"
#include "support/test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

template <typename Fn>
Greenthread *spawn(Fn *fn) {
    return greenthread_create([](void *arg) { (*static_cast<Fn *>(arg))(); }, fn);
}

/* greenthreads_run, ended by a ticking timer once `seconds` have passed:
 * false when some thread had not finished by then. */
inline bool run_for(double seconds) {
    static double deadline;
    static bool stopped;
    static SelTimer tick;
    deadline = seconds_now() + seconds, stopped = false;
    tick.callback = [](SelTimer *timer) {
        if (seconds_now() > deadline) stopped = true, live_threads = 0;
        SelMakeWhen(&timer->when, 0, 20'000'000);
        return SelAddTimer(timer);
    };
    tick.callback(&tick);
    greenthreads_run();
    SelRemTimer(&tick);
    return !stopped;
}
inline unsigned registered(int fd) {
    const SelFdEntry *entry = SelFdFind(SelCurrentContext(), fd);
    return entry != nullptr ? entry->events : 0;
}

class GreenThreads : public ::testing::Test {
    void SetUp() override {
        // SIGXCPU ends threads that never give the processor back.
        const rlimit cpu = {rlim_t(scaled(30, 300)), RLIM_INFINITY};
        setrlimit(RLIMIT_CPU, &cpu);
        ASSERT_EQ(SelInit(), 0);
        SelRemoveAllTimers(); // the idle reaper's
        greenthreads_init();
    }
};

std::string trace;
void *letter(char c) { return reinterpret_cast<void *>(static_cast<intptr_t>(c)); }
void log_twice(void *name) {
    for (int i = 0; i < 2; ++i)
        trace += static_cast<char>(reinterpret_cast<intptr_t>(name)), greenthread_yield();
}

/* Length of the run queue; -1 unless it is a list of runnable records that
 * ends at the tail (a cycle included). */
int queued() {
    int n = 0;
    const Greenthread *last = nullptr;
    for (const Greenthread *t = run_queue_head; t != nullptr; last = t, t = t->next)
        if (++n > 50 || t->runnable != kRunnable) return -1;
    return last == run_queue_tail ? n : -1;
}

TEST_F(GreenThreads, RunQueueIsFifoAndTheMainContextTakesOneTurnPerPass) {
    greenthread_create(log_twice, letter('A')), greenthread_create(log_twice, letter('B'));
    EXPECT_EQ(trace, "") << "a new thread waits for its creator to yield";
    EXPECT_EQ(queued(), 2);
    // Trace, queue length and live threads after each pass; in the last, yielding alone returns at once.
    const std::tuple<const char *, int, int> passes[] = {
        {"AB", 2, 2}, {"ABAB", 2, 2}, {"ABAB", 0, 0}, {"ABAB", 0, 0}};
    for (const auto &[expected, length, live] : passes) {
        greenthread_yield();
        EXPECT_EQ(trace, expected);
        EXPECT_EQ(queued(), length);
        EXPECT_EQ(live_threads, live);
    }
}

TEST_F(GreenThreads, WakeupQueuesOnlyABlockedThreadAndOnlyOnce) {
    static int wakeups;
    Greenthread *sleeper =
        greenthread_create([](void *) { greenthread_block(), ++wakeups, greenthread_block(); }, nullptr);
    greenthread_wakeup(sleeper);     // queued
    greenthread_wakeup(main_thread); // running
    EXPECT_EQ(queued(), 1);
    greenthread_yield();
    EXPECT_EQ(queued(), 0) << "a blocking thread was queued";
    greenthread_wakeup(sleeper);
    greenthread_wakeup(sleeper);
    EXPECT_EQ(queued(), 1);
    greenthread_yield();
    greenthread_yield(); // nothing to run: the sleeper stays blocked
    EXPECT_EQ(wakeups, 1);
    greenthread_wakeup(sleeper);
    greenthread_yield();
    EXPECT_EQ(free_threads, sleeper);
    greenthread_wakeup(sleeper); // finished: nothing to queue
    EXPECT_EQ(queued(), 0);

    static int queued_meanwhile; // the main context never blocks: it stays queued
    greenthread_create([](void *) { queued_meanwhile = queued(), greenthread_wakeup(main_thread); }, nullptr);
    greenthread_block();
    EXPECT_EQ(queued_meanwhile, 1);
    EXPECT_EQ(live_threads, 0);
}

TEST_F(GreenThreads, FinishedRecordsAreReusedNewestFirstWithTheirStacks) {
    static intptr_t arg;
    static void *frame;
    auto note = [](void *a) { arg = reinterpret_cast<intptr_t>(a), frame = __builtin_frame_address(0); };
    Greenthread *first = greenthread_create(note, letter(1)), *second = greenthread_create(note, letter(2));
    greenthread_yield();
    ASSERT_EQ(free_threads, second);
    void *const top = frame;
    ASSERT_EQ(greenthread_create(note, letter(3)), second);
    greenthread_yield();
    EXPECT_EQ(arg, 3);
    EXPECT_EQ(frame, top) << "a reused record starts afresh on the same stack";
    ASSERT_EQ(greenthread_create(note, letter(4)), second);
    ASSERT_EQ(greenthread_create(note, letter(5)), first);
    Greenthread *fresh = greenthread_create(note, letter(6));
    EXPECT_TRUE(fresh != first && fresh != second);
    EXPECT_EQ(queued(), 3);
    greenthread_yield();
    EXPECT_EQ(arg, 6);
}

TEST_F(GreenThreads, RunLoopWaitsInTheSelectorOnlyWhenEveryThreadIsBlocked) {
    Pipe ready;
    ready.fill();
    int passes = 0;
    auto count = [](int, unsigned, void *passes, SelFdEntry *) { return ++*static_cast<int *>(passes), 0; };
    ASSERT_EQ(SelAddFD(ready.r, SEL_READ, 0, count, &passes), 0);
    greenthreads_run(); // no thread: no selector pass
    EXPECT_EQ(passes, 0);
    SelRemFD(ready.r);
    auto sleeper = [] { nb_poll(-1, 0, 20), trace += 'T'; }; // woken by its timer
    spawn(&sleeper);
    greenthread_create(log_twice, letter('Y'));
    EXPECT_TRUE(run_for(10));
    EXPECT_EQ(trace, "YYT");
    // In epoll mode too, with no timer armed: the wait sleeps in the kernel, it does not spin.
    ASSERT_EQ(SelUseEpoll(), 0);
    Pipe late;
    set_nonblocking(late.r);
    char byte;
    auto reader = [&] { trace += nb_read(late.r, &byte, 1) == 1 ? 'R' : '!'; };
    spawn(&reader);
    const uint32_t passes_before = SelCurrentContext()->pass_count;
    std::thread writer([&] { usleep(200'000), late.fill(); });
    greenthreads_run();
    writer.join();
    EXPECT_EQ(trace, "YYTR");
    EXPECT_LT(SelCurrentContext()->pass_count - passes_before, 50u) << "the run loop spun";
}

uintptr_t guard;
__attribute__((noinline)) int recurse(int depth) {
    volatile char frame[256];
    frame[0] = static_cast<char>(depth);
    return depth < 1 << 30 ? recurse(depth + 1) + frame[0] : 0;
}

[[noreturn]] void overflow(uintptr_t guard_page) {
    static char alt_stack[64 * 1024];
    const stack_t alt = {alt_stack, 0, sizeof alt_stack};
    struct sigaction on_segv = {};
    on_segv.sa_flags = SA_SIGINFO | SA_ONSTACK;
    on_segv.sa_sigaction = [](int, siginfo_t *info, void *) {
        const uintptr_t above_guard = reinterpret_cast<uintptr_t>(info->si_addr) - guard;
        _exit(above_guard < static_cast<uintptr_t>(page_size) ? 42 : 3);
    };
    guard = guard_page;
    sigaltstack(&alt, nullptr), sigaction(SIGSEGV, &on_segv, nullptr), run_for(10);
    _exit(0);
}

TEST_F(GreenThreads, StacksAreGuardedAndNotExecutableAndOverflowFaultsOnTheThreadsOwnGuardPage) {
    const Greenthread *thread = greenthread_create([](void *) { recurse(0); }, nullptr);
    greenthread_create([](void *) {}, nullptr); // a neighbouring stack below
    const auto base = reinterpret_cast<uintptr_t>(thread->context.uc_stack.ss_sp);
    const size_t size = thread->context.uc_stack.ss_size, page = static_cast<size_t>(page_size);
    EXPECT_EQ(size - page, std::max<size_t>(16384, page)) << "16 KiB in whole pages above the guard page";
    EXPECT_TRUE(perms_at(base) == "---p" || (kEmulated && perms_at(base).empty())) << "guard page";
    EXPECT_EQ(perms_at(base + page), "rw-p");
    EXPECT_EQ(perms_at(base + size - 1), "rw-p");
    EXPECT_EXIT(overflow(base), ::testing::ExitedWithCode(42), "");
}

TEST_F(GreenThreads, PollWatchesInAndOutTimesOutAndRefusesWaitsThatCouldNeverEnd) {
    const struct {
        int events, timeout;
        bool peer_writes;
        int result, error; // error checked when not 0
        unsigned watched;
    } cases[] = {
        {POLLPRI, 0, false, -1, EINVAL, 0}, // nothing watched, no time-out: could never end
        {POLLPRI, 20, false, -1, 0, 0},     // a plain sleep
        {POLLIN | POLLPRI, 20, false, -1, 0, SEL_READ},
        {POLLIN, 0, true, 1, 0, SEL_READ}, // 0: no time-out at all
        {POLLIN, 1500, true, 1, 0, SEL_READ},
        {POLLOUT, 20, false, 1, 0, SEL_WRITE},
        {POLLIN | POLLOUT, 0, false, 1, 0, SEL_READ | SEL_WRITE},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(&c - cases);
        SocketPair pair; // fd[0]: writable, readable once the peer writes
        Outcome got;
        double timer_due_in = -1;
        unsigned watched = 0;
        auto waiter = [&] { got = OUTCOME(nb_poll(pair.fd[0], c.events, c.timeout)); };
        auto observer = [&] { // runs once the waiter waits
            watched = registered(pair.fd[0]);
            const SelContext *ctx = SelCurrentContext();
            for (int i = 1; i <= ctx->timerCount; ++i)
                if (const SelTimer *t = ctx->timerHeap[i]; t->callback == nb_poll_on_timeout)
                    timer_due_in = t->when.tv_sec + t->when.tv_nsec / 1e9 - seconds_now();
            if (!c.peer_writes) return; // else first a wakeup from elsewhere: the waiter waits on
            greenthread_wakeup(static_cast<NbWait *>(SelGetFDArg(pair.fd[0]))->thread);
            nb_poll(-1, 0, 30), (void)!write(pair.fd[1], "x", 1);
        };
        spawn(&waiter), spawn(&observer);
        ASSERT_TRUE(run_for(10));
        EXPECT_EQ(got.first, c.result);
        EXPECT_EQ(c.error ? got.second : 0, c.error);
        EXPECT_EQ(watched, c.watched);
        const double due = c.timeout > 0 && c.error == 0 ? c.timeout / 1e3 : -1; // -1: no timer
        EXPECT_NEAR(timer_due_in, due, 0.45);
        EXPECT_EQ(registered(pair.fd[0]), 0u);
        EXPECT_EQ(SelCurrentContext()->timerCount, 0);
    }
}

TEST_F(GreenThreads, ReadinessWinsOverTheTimeOutInEitherOrder) {
    NbWait ready_first = {current_greenthread(), 0}, timeout_first = ready_first;
    SelTimer timers[] = {{0, {}, nullptr, &ready_first}, {0, {}, nullptr, &timeout_first}};
    nb_poll_on_timeout(&timers[1]);
    for (SelTimer &timer : timers)
        nb_poll_on_ready(-1, SEL_READ, timer.arg, nullptr), nb_poll_on_timeout(&timer);
    EXPECT_EQ(ready_first.result, 1);
    EXPECT_EQ(timeout_first.result, 1);
}

int rescue_fd, alarms; // touched only by the signal handler

TEST_F(GreenThreads, CallsReturnEndOfFileShortCountsAndErrorsAtOnce) {
    SocketPair empty, full, ended, blocking(false);
    Listener listener, refusing(1, false), client(1, false); // bound, not listening: refused
    std::vector<char> buf(64 * 1024);
    while (write(full.fd[1], buf.data(), buf.size()) > 0) {}
    ASSERT_EQ(write(ended.fd[1], "0123456789", 10), 10);
    ended.close_end(1);
    // Registered by someone else: a call that would have to wait fails instead.
    const int busy[] = {empty.fd[0], full.fd[1], listener.fd, ended.fd[0]};
    auto ignore = [](int, unsigned, void *, SelFdEntry *) { return 0; };
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
        {[&] { return nb_connect(client.fd, refusing.address(), sizeof refusing.addr); },
         failure(ECONNREFUSED)},
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
    every = {}, setitimer(ITIMER_REAL, &every, nullptr);
    for (int fd : busy) EXPECT_EQ(registered(fd), SEL_EXCEPT), SelRemFD(fd);
}

TEST_F(GreenThreads, WriteAndReadallBeyondTheSocketBuffersWaitForEachOther) {
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
    EXPECT_EQ(SelCurrentContext()->timerCount, 0);
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
    std::vector<char> buf(kMaxMessage);
    set_nonblocking(fd), no_delay(fd);
    int n; // the last: 0 at the end of the stream, unless a call failed
    while ((n = nb_read(fd, buf.data(), kMaxMessage)) > 0 && nb_write(fd, buf.data(), size_t(n)) == n)
        continue;
    close(fd), ++load->closed, load->errors += n != 0;
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
        for (size_t i = 0; i < size; ++i) out[i] = static_cast<unsigned char>(next());
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
    // Connections accepted and closed by the server, and clients that got every message back; errors.
    EXPECT_EQ(std::tuple(state.accepted, state.closed, state.clients_ok, state.errors),
              std::tuple(connections, connections, connections, 0));
    EXPECT_EQ(registered(listener.fd), 0u);
}

TEST_F(GreenThreads, EchoLoadTwoHundredClientsFiftyMessagesEachInSelectMode) {
    run_echo_load(scaled(200, 100), scaled(50, 20));
}

TEST_F(GreenThreads, EchoLoadThreeThousandConnectionsInEpollMode) {
    const int connections = scaled(3000, 1100); // beyond select's 1024 either way
    SKIP_UNLESS_FD_LIMIT(2 * connections + 64);
    ASSERT_EQ(SelUseEpoll(), 0);
    run_echo_load(connections, 3);
    DeInitEpoll();
}

} // namespace
