/* SelEpoll against real descriptors. */
#include <algorithm>
#include <utility>

#include "selector_fixture.h"

using namespace qorbu::test;

namespace {

/* Two ready descriptors; whichever is served first puts an idle pipe under
 * the other's number and registers that. */
struct Swap {
    int fds[2];
    int idle;
    bool done;
};
int swap_partner(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_fd(fd, event, arg, entry);
    auto *swap = static_cast<Swap *>(arg);
    const int partner = swap->fds[swap->fds[0] == fd ? 1 : 0];
    if (std::exchange(swap->done, true)) return 0;
    EXPECT_EQ(SelRemFD(partner), 0);
    EXPECT_EQ(dup2(swap->idle, partner), partner);
    EXPECT_EQ(SelAddFD(partner, SEL_READ, 0, swap_partner, swap), 0);
    return 0;
}

} // namespace

TEST_F(SelectorTest, EpollGivesEachReadyDescriptorOneEventBitThenRunsTimers) {
    ASSERT_EQ(SelUseEpoll(), 0);
    SocketPair wants_write, wants_both; /* fd[0] of each: readable and writable */
    Pipe idle, data_hangup, hangup, broken;
    for (int fd : {wants_write.fd[1], wants_both.fd[1]}) ASSERT_EQ(write(fd, "x", 1), 1);
    data_hangup.fill();
    close(data_hangup.w), close(hangup.w), close(broken.r);
    data_hangup.w = hangup.w = broken.r = -1;
    const std::pair<int, unsigned> registrations[] = {{wants_write.fd[0], SEL_WRITE},
                                                      {wants_both.fd[0], SEL_READ | SEL_WRITE},
                                                      {idle.r, SEL_READ},
                                                      {data_hangup.r, SEL_READ},
                                                      {hangup.r, SEL_READ},
                                                      {broken.w, SEL_READ}};
    for (auto [fd, events] : registrations) ASSERT_EQ(watch(fd, events), 0);
    bound_wait(0);
    EXPECT_EQ(SelEpoll(), 0);
    ASSERT_FALSE(host.log.empty());
    EXPECT_EQ(host.log.back(), "timer") << "the expiry run follows the dispatch";
    Log calls = callbacks(),
        expected = {std::to_string(wants_write.fd[0]) + ":w", std::to_string(wants_both.fd[0]) + ":r",
                    std::to_string(data_hangup.r) + ":r", std::to_string(hangup.r) + ":x",
                    std::to_string(broken.w) + ":x"};
    std::sort(calls.begin(), calls.end()), std::sort(expected.begin(), expected.end());
    EXPECT_EQ(calls, expected);
}

TEST_F(SelectorTest, EpollDropsTheBatchEventsOfARemovedDescriptor) {
    ASSERT_EQ(SelUseEpoll(), 0);
    Pipe a, b, idle;
    a.fill(), b.fill();
    Swap swap = {{a.r, b.r}, idle.r, false};
    for (int fd : swap.fds) ASSERT_EQ(watch(fd, SEL_READ, swap_partner, &swap), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks().size(), 1u) << "an event of the removed registration reached the new one";
}

TEST_F(SelectorTest, EpollUnblocksRegisteredSignalsOnlyForTheBlockingWait) {
    ASSERT_EQ(SelUseEpoll(), 0);
    pend_two_signals();
    Pipe p;
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(handled[SIGUSR1], 0) << "delivered although the pass did not wait";
    ASSERT_EQ(SelRemFD(p.r), 0);
    bound_wait(scaled(300, 1500));
    const int result = SelEpoll();
    EXPECT_TRUE(result == 0 || errno == EINTR);
    EXPECT_EQ(handled[SIGUSR1], 1);
    EXPECT_EQ(handled[SIGUSR2], 0) << "the caller's own blocked signal was let through";
    EXPECT_TRUE(blocked(SIGUSR1) && blocked(SIGUSR2)) << "the mask was not restored";
}

TEST_F(SelectorTest, EpollWaitLastsUntilTheEarliestTimerAtMost) {
    ASSERT_EQ(SelUseEpoll(), 0);
    ASSERT_EQ(SelRemoveAllTimers(), 1);
    in_child(
        [&] { /* the green threads' loop, with one timer */
              bound_wait(50);
              while (host.log.empty()) ASSERT_EQ(qorbu::sel::epoll_pass(true), 0); /* the alarm bounds it */
              EXPECT_EQ(host.log, Log{"timer"});
        },
        5);
    in_child(
        [&] { /* a caller's deadline with negative nanoseconds, then none at all */
              timespec now;
              SelGetTime(&now);
              const timespec odd = {now.tv_sec + 1, -1500000000};
              guard.callback = log_timer;
              ASSERT_EQ(SelModifyTimer(&guard, &odd), 0);
              EXPECT_EQ(SelEpoll(), 0);
              SelRemTimer(&guard);
              EXPECT_EQ(SelEpoll(), 0);
        },
        5);
}
