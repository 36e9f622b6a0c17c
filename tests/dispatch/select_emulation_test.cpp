/* zarn_select: select()'s results from one pass of the thread's selector. */
#include <signal.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>

#include "dispatch_fixture.h"

using namespace dispatch_test;
using Log = std::vector<std::string>;

namespace {

class ZarnSelect : public DispatchTest {
protected:
    void SetUp() override {
        DispatchTest::SetUp();
        timersBefore = ctx->timerCount;
    }
    /* Nothing of the call is left behind: no registration, no timer. */
    void expect_registry_clean() {
        for (int fd = 0; fd < FD_SETSIZE; ++fd) {
            if (FD_ISSET(fd, &ctx->readSet) || FD_ISSET(fd, &ctx->writeSet) || FD_ISSET(fd, &ctx->exceptSet)) {
                ADD_FAILURE() << "descriptor " << fd << " is still registered";
                return;
            }
        }
        EXPECT_EQ(ctx->timerCount, timersBefore);
    }
    int timersBefore = 0;
};

std::string cb(int fd, const char *event) { return "cb:" + std::to_string(fd) + ":" + event; }

volatile sig_atomic_t g_handled = 0;
void count_signal(int) { g_handled = g_handled + 1; }

} // namespace

TEST_F(ZarnSelect, RefusesDescriptorCountsOutsideTheSetSize) {
    fd_set r;
    FD_ZERO(&r);
    FD_SET(3, &r);
    struct timeval zero = {0, 0};
    for (int nfds : {-1, FD_SETSIZE + 1}) {
        errno = 0;
        EXPECT_EQ(zarn_select(nfds, &r, nullptr, nullptr, &zero), -1);
        EXPECT_EQ(errno, EINVAL);
        EXPECT_TRUE(FD_ISSET(3, &r)) << "a refused call leaves the sets alone";
    }
    EXPECT_EQ(zarn_select(FD_SETSIZE, nullptr, nullptr, nullptr, &zero), 0);
}

TEST_F(ZarnSelect, ReportsReadyDescriptorsAndClearsEverythingElse) {
    Pipe ready(40), idle(41);
    ready.fill();
    fd_set r;
    FD_ZERO(&r);
    FD_SET(40, &r);
    FD_SET(41, &r);
    FD_SET(900, &r); /* above nfds */
    struct timeval timeout = {20, 0};
    EXPECT_EQ(zarn_select(42, &r, nullptr, nullptr, &timeout), 1);
    EXPECT_TRUE(FD_ISSET(40, &r));
    EXPECT_FALSE(FD_ISSET(41, &r));
    EXPECT_FALSE(FD_ISSET(900, &r));
    expect_registry_clean();
}

TEST_F(ZarnSelect, ReadableAndWritableDescriptorCountsTwice) {
    int sv[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, sv), 0);
    ASSERT_EQ(write(sv[1], "x", 1), 1);
    fd_set r, w, e;
    FD_ZERO(&r);
    FD_ZERO(&w);
    FD_ZERO(&e);
    FD_SET(sv[0], &r);
    FD_SET(sv[0], &w);
    FD_SET(sv[0], &e);
    EXPECT_EQ(zarn_select(sv[0] + 1, &r, &w, &e, nullptr), 2);
    EXPECT_TRUE(FD_ISSET(sv[0], &r));
    EXPECT_TRUE(FD_ISSET(sv[0], &w));
    EXPECT_FALSE(FD_ISSET(sv[0], &e));
    expect_registry_clean();
    close(sv[0]);
    close(sv[1]);
}

TEST_F(ZarnSelect, ZeroTimeoutReturnsZeroWhenNothingIsReady) {
    Pipe idle(40);
    fd_set r;
    FD_ZERO(&r);
    FD_SET(40, &r);
    struct timeval zero = {0, 0};
    const auto start = monotonic_now();
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &zero), 0);
    EXPECT_LT(seconds_since(start), 8.0);
    EXPECT_FALSE(FD_ISSET(40, &r));
    expect_registry_clean();
}

TEST_F(ZarnSelect, NoSetsSleepsForTheTimeout) {
    struct timeval timeout = {0, 200000};
    const auto start = monotonic_now();
    EXPECT_EQ(zarn_select(0, nullptr, nullptr, nullptr, &timeout), 0);
    const double slept = seconds_since(start);
    EXPECT_GE(slept, 0.199);
    EXPECT_LT(slept, 10.0);
    expect_registry_clean();
}

TEST_F(ZarnSelect, AnotherTimerOfTheThreadEndsTheCallEarly) {
    arm_guard_timer(100);
    Pipe idle(40);
    fd_set r;
    FD_ZERO(&r);
    FD_SET(40, &r);
    struct timeval timeout = {30, 0};
    const auto start = monotonic_now();
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &timeout), 0);
    EXPECT_LT(seconds_since(start), 15.0);
    EXPECT_EQ(std::count(log().begin(), log().end(), "timer:guard"), 1);
    EXPECT_EQ(ctx->timerCount, timersBefore) << "the guard fired and the call's own timer is disarmed";
}

TEST_F(ZarnSelect, OwnersRegistrationIsServedAndKept) {
    Pipe owned(40), asked(41);
    owned.fill();
    asked.fill();
    ASSERT_EQ(SelAddFD(40, SEL_READ, 0, log_callback, &owned), 0);
    fd_set r;
    FD_ZERO(&r);
    FD_SET(40, &r);
    FD_SET(41, &r);
    struct timeval timeout = {20, 0};
    EXPECT_EQ(zarn_select(42, &r, nullptr, nullptr, &timeout), 1);
    EXPECT_TRUE(FD_ISSET(41, &r));
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")})) << "the owner's callback ran as usual";
    EXPECT_TRUE(FD_ISSET(40, &ctx->readSet)) << "the owner's registration survives the clean-up";
    EXPECT_EQ(SelGetFDArg(40), &owned);
    EXPECT_FALSE(FD_ISSET(41, &ctx->readSet));
    EXPECT_EQ(ctx->nfds, 41);
}

TEST_F(ZarnSelect, InterruptedPassFailsWithItsErrnoAfterCleaningUp) {
    struct sigaction sa {};
    sa.sa_handler = count_signal;
    ASSERT_EQ(sigaction(SIGUSR1, &sa, nullptr), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    ASSERT_EQ(raise(SIGUSR1), 0); /* pending until the blocking wait */
    Pipe idle(40);
    fd_set r;
    FD_ZERO(&r);
    FD_SET(40, &r);
    struct timeval timeout = {30, 0};
    errno = 0;
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &timeout), -1);
    EXPECT_EQ(errno, EINTR);
    sigset_t mask;
    sigprocmask(SIG_BLOCK, nullptr, &mask); /* ThreadSanitizer runs deferred handlers here */
    EXPECT_EQ(g_handled, 1);
    expect_registry_clean();
}
