// nb_poll: waits, time-outs, the readiness-before-time-out rule, event bits,
// descriptors the selector refuses, and clean-up on every return.
#include <poll.h>

#include "nb_test_support.h"

using namespace qorbu::gt;
using namespace qorbu::test;

namespace {

using NbPoll = GreenIo;

TEST_F(NbPoll, TimeoutExpiresAndLeavesNothingRegistered)
{
    SocketPair pair;
    int result = 0;
    double elapsed = 0;
    auto waiter = [&] {
        const double start = seconds_now();
        result = nb_poll(pair.fd[0], POLLIN, 50);
        elapsed = seconds_now() - start;
    };
    spawn(&waiter);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_GE(elapsed, 0.050);
    expect_nothing_left(pair.fd[0]);
}

SelTimer *find_wait_timer()
{
    SelContext *ctx = SelCurrentContext();
    for (int i = 1; i <= ctx->timerCount; ++i)
        if (ctx->timerHeap[i]->callback == nb_poll_on_timeout)
            return ctx->timerHeap[i];
    return nullptr;
}

TEST_F(NbPoll, TimeoutIsArmedOnTheMonotonicClockAndReadinessEndsTheWait)
{
    SocketPair pair;
    Greenthread *waiterThread = nullptr;
    double start = 0;
    int result = 0;
    auto waiter = [&] {
        struct timespec now;
        SelGetTime(&now);
        start = static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
        result = nb_poll(pair.fd[0], POLLIN | POLLPRI, 1500);
    };
    double deadline = 0;
    unsigned events = 0;
    Greenthread *waitingThread = nullptr;
    bool timerArmed = false;
    auto inspector = [&] {
        // Runs once the waiter has blocked.
        SelTimer *timer = find_wait_timer();
        if (timer != nullptr) {
            deadline = static_cast<double>(timer->when.tv_sec) + static_cast<double>(timer->when.tv_nsec) / 1e9;
            timerArmed = true;
            waitingThread = static_cast<NbWait *>(timer->arg)->thread;
        }
        events = registered_events(pair.fd[0]);
        (void)write(pair.fd[1], "x", 1);
    };
    waiterThread = spawn(&waiter);
    spawn(&inspector);
    greenthreads_run();
    ASSERT_TRUE(timerArmed) << "no time-out timer was armed";
    EXPECT_EQ(waitingThread, waiterThread);
    EXPECT_GE(deadline - start, 1.5);
    EXPECT_LT(deadline - start, 2.5);
    EXPECT_EQ(events, SEL_READ) << "POLLPRI is not watched";
    EXPECT_EQ(result, 1);
    expect_nothing_left(pair.fd[0]);
}

TEST_F(NbPoll, InAndOutRegistersBothAndEitherEndsTheWait)
{
    SocketPair pair; // writable at once, never readable
    unsigned events = 0;
    int result = 0;
    auto waiter = [&] { result = nb_poll(pair.fd[0], POLLIN | POLLOUT, 0); };
    auto inspector = [&] { events = registered_events(pair.fd[0]); };
    spawn(&waiter);
    spawn(&inspector);
    greenthreads_run();
    EXPECT_EQ(events, SEL_READ | SEL_WRITE);
    EXPECT_EQ(result, 1);
    expect_nothing_left(pair.fd[0]);
}

TEST_F(NbPoll, ReadinessWinsOverATimeoutDueInTheSamePass)
{
    SocketPair pair;
    ASSERT_EQ(write(pair.fd[1], "x", 1), 1); // ready before the wait starts
    int result = 0;
    auto waiter = [&] { result = nb_poll(pair.fd[0], POLLIN, 1); };
    // Keeps the selector away until the waiter's 1 ms time-out is due.
    auto busy = [] {
        const double until = seconds_now() + 0.030;
        while (seconds_now() < until) {
        }
    };
    spawn(&waiter);
    spawn(&busy);
    greenthreads_run();
    EXPECT_EQ(result, 1);
    expect_nothing_left(pair.fd[0]);
}

TEST_F(NbPoll, CallbacksGiveReadinessPrecedenceInEitherOrder)
{
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

TEST_F(NbPoll, WithoutTimeoutItWaitsWhileOtherThreadsRun)
{
    SocketPair pair;
    std::string order;
    int result = 0;
    auto waiter = [&] {
        result = nb_poll(pair.fd[0], POLLIN, 0);
        order += 'W';
    };
    auto other = [&] {
        for (int i = 0; i < 50; ++i) {
            order += 'o';
            greenthread_yield();
        }
        (void)write(pair.fd[1], "x", 1);
    };
    spawn(&waiter);
    spawn(&other);
    greenthreads_run();
    EXPECT_EQ(order, std::string(50, 'o') + "W");
    EXPECT_EQ(result, 1);
    expect_nothing_left(pair.fd[0]);
}

TEST_F(NbPoll, NeitherInNorOutIsASleepWithATimeoutAndAnErrorWithout)
{
    SocketPair pair;
    int slept = 0, refused = 0, refusedErrno = 0;
    double elapsed = 0;
    unsigned events = 1;
    auto inspector = [&] { events = registered_events(pair.fd[0]); };
    auto waiter = [&] {
        const double start = seconds_now();
        slept = nb_poll(pair.fd[0], POLLPRI, 20);
        elapsed = seconds_now() - start;
        refused = nb_poll(pair.fd[0], POLLPRI, 0);
        refusedErrno = errno;
    };
    spawn(&waiter);
    spawn(&inspector);
    greenthreads_run();
    EXPECT_EQ(slept, -1);
    EXPECT_GE(elapsed, 0.020);
    EXPECT_EQ(events, 0u);
    EXPECT_EQ(refused, -1);
    EXPECT_EQ(refusedErrno, EINVAL);
    expect_nothing_left(pair.fd[0]);
}

// ---------------------------------------------------------------------------
// Descriptors the selector refuses: the wait fails at once instead of
// blocking for ever.

TEST_F(NbPoll, InvalidDescriptorFailsAtOnce)
{
    int result = 0, error = 0;
    auto waiter = [&] {
        result = nb_poll(-1, POLLIN, 0);
        error = errno;
    };
    spawn(&waiter);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, EINVAL);
    EXPECT_EQ(armed_timers(), timersBefore);
}

int ignore_event(int, unsigned, void *, SelFdEntry *) { return 0; }

TEST_F(NbPoll, DescriptorRegisteredElsewhereFailsWithEbusyAndKeepsTheOtherRegistration)
{
    SocketPair pair;
    int marker = 0;
    ASSERT_EQ(SelAddFD(pair.fd[0], SEL_READ, 0, ignore_event, &marker), 0);
    int result = 0, error = 0;
    auto waiter = [&] {
        result = nb_poll(pair.fd[0], POLLIN, 100);
        error = errno;
    };
    spawn(&waiter);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, EBUSY);
    EXPECT_EQ(SelGetFDArg(pair.fd[0]), &marker);
    EXPECT_EQ(armed_timers(), timersBefore) << "no timer is armed for a refused descriptor";
    SelRemFD(pair.fd[0]);
}

TEST_F(NbPoll, DescriptorBeyondTheSelectRangeFailsInSelectMode)
{
    if (!raise_fd_limit(FD_SETSIZE + 16))
        GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below " << FD_SETSIZE + 16;
    SocketPair pair;
    const int high = dup2(pair.fd[0], FD_SETSIZE + 8);
    ASSERT_EQ(high, FD_SETSIZE + 8);
    int result = 0, error = 0;
    auto waiter = [&] {
        result = nb_poll(high, POLLIN, 0);
        error = errno;
    };
    spawn(&waiter);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, EINVAL);
    close(high);
}

TEST_F(NbPoll, InEpollModeADescriptorEpollRefusesFailsAndLeavesNoEntry)
{
    if (!raise_fd_limit(FD_SETSIZE + 16))
        GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below " << FD_SETSIZE + 16;
    ASSERT_EQ(SelUseEpoll(), 0);
    const int closed = FD_SETSIZE + 9; // not open
    ASSERT_EQ(fcntl(closed, F_GETFD), -1);
    int result = 0, error = 0;
    auto waiter = [&] {
        result = nb_poll(closed, POLLIN, 0);
        error = errno;
    };
    spawn(&waiter);
    greenthreads_run();
    EXPECT_EQ(result, -1);
    EXPECT_NE(error, 0);
    EXPECT_EQ(registered_events(closed), 0u) << "a refused wait left its entry behind";
    DeInitEpoll();
}

// ---------------------------------------------------------------------------
// The main context may not block: there nb_poll drives the run loop itself.

TEST_F(NbPoll, InTheMainContextItRunsTheLoopUntilReady)
{
    SocketPair pair;
    int turns = 0;
    auto writer = [&] {
        for (; turns < 5; ++turns)
            greenthread_yield();
        (void)write(pair.fd[1], "x", 1);
    };
    spawn(&writer);
    EXPECT_EQ(nb_poll(pair.fd[0], POLLIN, 0), 1);
    EXPECT_EQ(turns, 5);
    expect_nothing_left(pair.fd[0]);
    greenthreads_run();
}

TEST(NbPollWithoutScheduler, WaitsInTheSelectorAlone)
{
    ASSERT_EQ(SelInit(), 0);
    SocketPair pair;
    const double start = seconds_now();
    EXPECT_EQ(nb_poll(pair.fd[0], POLLIN, 30), -1);
    EXPECT_GE(seconds_now() - start, 0.030);
    ASSERT_EQ(write(pair.fd[1], "x", 1), 1);
    EXPECT_EQ(nb_poll(pair.fd[0], POLLIN, 0), 1);
    EXPECT_EQ(registered_events(pair.fd[0]), 0u);
}

// ---------------------------------------------------------------------------
// Epoll mode: the run loop waits with epoll, so descriptors beyond the
// select range work.

TEST_F(NbPoll, InEpollModeDescriptorsBeyondTheSelectRangeWork)
{
    if (!raise_fd_limit(FD_SETSIZE + 16))
        GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below " << FD_SETSIZE + 16;
    ASSERT_EQ(SelUseEpoll(), 0);
    SocketPair pair;
    const int high = dup2(pair.fd[0], FD_SETSIZE + 8);
    ASSERT_EQ(high, FD_SETSIZE + 8);
    int result = 0, timedOut = 0;
    auto waiter = [&] {
        timedOut = nb_poll(high, POLLIN, 20);
        result = nb_poll(high, POLLIN, 0);
    };
    auto writer = [&] {
        nb_poll(pair.fd[1], 0, 60); // nothing watched: a plain sleep
        (void)write(pair.fd[1], "x", 1);
    };
    spawn(&waiter);
    spawn(&writer);
    greenthreads_run();
    EXPECT_EQ(timedOut, -1);
    EXPECT_EQ(result, 1);
    EXPECT_EQ(registered_events(high), 0u);
    EXPECT_EQ(armed_timers(), timersBefore);
    close(high);
    DeInitEpoll();
}

} // namespace
