// nb_poll: waits, time-outs, the readiness-before-time-out rule, event bits,
// descriptors the selector refuses, and clean-up on every return.
#include <poll.h>

#include "gt_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

using NbPoll = GreenIo;

TEST_F(NbPoll, NeitherInNorOutSleepsOrFailsAndTimeoutsExpire) {
    SocketPair pair;
    Outcome slept, refused, timedOut;
    double sleptFor = 0, waitedFor = 0;
    unsigned eventsWhileAsleep = 1;
    auto waiter = [&] {
        double start = seconds_now();
        slept = with_errno(nb_poll(pair.fd[0], POLLPRI, 20));
        sleptFor = seconds_now() - start;
        refused = with_errno(nb_poll(pair.fd[0], POLLPRI, 0));
        start = seconds_now();
        timedOut = with_errno(nb_poll(pair.fd[0], POLLIN, 50));
        waitedFor = seconds_now() - start;
    };
    auto inspector = [&] { eventsWhileAsleep = registered_events(pair.fd[0]); };
    run_threads(waiter, inspector);
    EXPECT_EQ(slept.first, -1);
    EXPECT_GE(sleptFor, 0.020);
    EXPECT_EQ(eventsWhileAsleep, 0u);
    EXPECT_EQ(refused, failure(EINVAL));
    EXPECT_EQ(timedOut.first, -1);
    EXPECT_GE(waitedFor, 0.050);
    expect_nothing_left(pair.fd[0]);
}

SelTimer *find_wait_timer() {
    SelContext *ctx = SelCurrentContext();
    for (int i = 1; i <= ctx->timerCount; ++i)
        if (ctx->timerHeap[i]->callback == nb_poll_on_timeout) return ctx->timerHeap[i];
    return nullptr;
}

double seconds_of(const timespec &t) {
    return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) / 1e9;
}

TEST_F(NbPoll, WatchesInAndOutOnlyArmsAMonotonicTimeoutAndReadinessEndsTheWait) {
    const std::pair<int, unsigned> cases[] = {{POLLIN | POLLPRI, SEL_READ},
                                              {POLLIN | POLLOUT, SEL_READ | SEL_WRITE}};
    for (const auto &[pollEvents, watched] : cases) {
        SCOPED_TRACE(pollEvents);
        SocketPair pair; // writable at once, readable once the inspector writes
        double start = 0, deadline = 0;
        int result = 0;
        unsigned events = 0;
        Greenthread *waitingThread = nullptr;
        auto waiter = [&] {
            timespec now;
            SelGetTime(&now);
            start = seconds_of(now);
            result = nb_poll(pair.fd[0], pollEvents, 1500);
        };
        auto inspector = [&] { // runs once the waiter has blocked
            if (SelTimer *timer = find_wait_timer()) {
                deadline = seconds_of(timer->when);
                waitingThread = static_cast<NbWait *>(timer->arg)->thread;
            }
            events = registered_events(pair.fd[0]);
            (void)write(pair.fd[1], "x", 1);
        };
        Greenthread *waiterThread = spawn(&waiter);
        run_threads(inspector);
        ASSERT_NE(waitingThread, nullptr) << "no time-out timer was armed";
        EXPECT_EQ(waitingThread, waiterThread);
        EXPECT_GE(deadline - start, 1.5);
        EXPECT_LT(deadline - start, 2.5);
        EXPECT_EQ(events, watched) << "only POLLIN and POLLOUT are watched";
        EXPECT_EQ(result, 1);
        expect_nothing_left(pair.fd[0]);
    }
}

TEST_F(NbPoll, ReadinessWinsOverATimeoutDueInTheSamePass) {
    SocketPair pair;
    ASSERT_EQ(write(pair.fd[1], "x", 1), 1); // ready before the wait starts
    int result = 0;
    auto waiter = [&] { result = nb_poll(pair.fd[0], POLLIN, 1); };
    auto busy = [] { // keeps the selector away until the waiter's 1 ms time-out is due
        for (const double until = seconds_now() + 0.030; seconds_now() < until;) {}
    };
    run_threads(waiter, busy);
    EXPECT_EQ(result, 1);
    expect_nothing_left(pair.fd[0]);

    // The callbacks themselves, in either order.
    NbWait wait = {current_greenthread(), 0};
    SelTimer timer = {};
    timer.arg = &wait;
    nb_poll_on_timeout(&timer);
    EXPECT_EQ(wait.result, -1);
    nb_poll_on_ready(0, SEL_READ, &wait, nullptr);
    EXPECT_EQ(wait.result, 1) << "readiness reported after the time-out still wins";
    nb_poll_on_timeout(&timer);
    EXPECT_EQ(wait.result, 1) << "a later time-out changes nothing";
}

TEST_F(NbPoll, WithoutTimeoutItWaitsWhileOtherThreadsRunOrRunsTheLoopInTheMainContext) {
    SocketPair pair;
    std::string order;
    int result = 0, turns = 0;
    auto waiter = [&] {
        result = nb_poll(pair.fd[0], POLLIN, 0);
        order += 'W';
    };
    auto other = [&] {
        for (; turns < 50; ++turns) {
            order += 'o';
            greenthread_yield();
        }
        (void)write(pair.fd[1], "x", 1);
    };
    run_threads(waiter, other);
    EXPECT_EQ(order, std::string(50, 'o') + "W");
    EXPECT_EQ(result, 1);
    expect_nothing_left(pair.fd[0]);

    // The main context may not block: there nb_poll drives the run loop.
    char byte;
    ASSERT_EQ(read(pair.fd[0], &byte, 1), 1);
    turns = 45;
    spawn(&other);
    EXPECT_EQ(nb_poll(pair.fd[0], POLLIN, 0), 1);
    EXPECT_EQ(turns, 50);
    expect_nothing_left(pair.fd[0]);
    greenthreads_run();
}

TEST(NbPollWithoutScheduler, WaitsInTheSelectorAlone) {
    ASSERT_EQ(SelInit(), 0);
    SocketPair pair;
    const double start = seconds_now();
    EXPECT_EQ(nb_poll(pair.fd[0], POLLIN, 30), -1);
    EXPECT_GE(seconds_now() - start, 0.030);
    ASSERT_EQ(write(pair.fd[1], "x", 1), 1);
    EXPECT_EQ(nb_poll(pair.fd[0], POLLIN, 0), 1);
    EXPECT_EQ(registered_events(pair.fd[0]), 0u);
}

// Descriptors the selector refuses: the wait fails at once with the
// registration's errno instead of blocking for ever.

int ignore_event(int, unsigned, void *, SelFdEntry *) { return 0; }

TEST_F(NbPoll, InvalidOrBusyDescriptorFailsAtOnceAndKeepsTheOtherRegistration) {
    SocketPair pair;
    int marker = 0;
    ASSERT_EQ(SelAddFD(pair.fd[0], SEL_READ, 0, ignore_event, &marker), 0);
    Outcome invalid, busy;
    auto waiter = [&] {
        invalid = with_errno(nb_poll(-1, POLLIN, 0));
        busy = with_errno(nb_poll(pair.fd[0], POLLIN, 100));
    };
    run_threads(waiter);
    EXPECT_EQ(invalid, failure(EINVAL));
    EXPECT_EQ(busy, failure(EBUSY));
    EXPECT_EQ(SelGetFDArg(pair.fd[0]), &marker);
    EXPECT_EQ(armed_timers(), timersBefore) << "no timer is armed for a refused descriptor";
    SelRemFD(pair.fd[0]);
}

TEST_F(NbPoll, DescriptorBeyondTheSelectRangeFailsInSelectMode) {
    SKIP_UNLESS_FD_LIMIT(FD_SETSIZE + 16);
    SocketPair pair;
    const int high = dup2(pair.fd[0], FD_SETSIZE + 8);
    ASSERT_EQ(high, FD_SETSIZE + 8);
    Outcome result;
    auto waiter = [&] { result = with_errno(nb_poll(high, POLLIN, 0)); };
    run_threads(waiter);
    EXPECT_EQ(result, failure(EINVAL));
    close(high);
}

// In epoll mode the run loop waits with epoll: descriptors beyond the select
// range work, and one that epoll refuses fails without leaving an entry.
TEST_F(NbPoll, InEpollModeDescriptorsBeyondTheSelectRangeWorkAndRefusedOnesFail) {
    SKIP_UNLESS_FD_LIMIT(FD_SETSIZE + 16);
    ASSERT_EQ(SelUseEpoll(), 0);
    SocketPair pair;
    const int high = dup2(pair.fd[0], FD_SETSIZE + 8), closed = FD_SETSIZE + 9;
    ASSERT_EQ(high, FD_SETSIZE + 8);
    ASSERT_EQ(fcntl(closed, F_GETFD), -1);
    int result = 0, timedOut = 0;
    Outcome refused;
    auto waiter = [&] {
        refused = with_errno(nb_poll(closed, POLLIN, 0));
        timedOut = nb_poll(high, POLLIN, 20);
        result = nb_poll(high, POLLIN, 0);
    };
    auto writer = [&] {
        nb_poll(pair.fd[1], 0, 60); // nothing watched: a plain sleep
        (void)write(pair.fd[1], "x", 1);
    };
    run_threads(waiter, writer);
    EXPECT_EQ(refused.first, -1);
    EXPECT_NE(refused.second, 0);
    EXPECT_EQ(registered_events(closed), 0u) << "a refused wait left its entry behind";
    EXPECT_EQ(timedOut, -1);
    EXPECT_EQ(result, 1);
    expect_nothing_left(high);
    close(high);
    DeInitEpoll();
}

} // namespace
