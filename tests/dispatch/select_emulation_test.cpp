/* zarn_select: select()'s results from one pass of the thread's selector. */
#include <cerrno>
#include <climits>
#include <initializer_list>

#include "dispatch_fixture.h"

using namespace dispatch_test;

namespace {

fd_set set_of(std::initializer_list<int> fds) {
    fd_set set;
    FD_ZERO(&set);
    for (int fd : fds) FD_SET(fd, &set);
    return set;
}

class ZarnSelect : public DispatchTest {
  protected:
    void SetUp() override {
        DispatchTest::SetUp();
        timersBefore = ctx->timerCount;
    }
    /* Nothing of the call is left behind: no registration, no timer. */
    void expect_registry_clean() {
        for (int fd = 0; fd < FD_SETSIZE; ++fd)
            ASSERT_FALSE(FD_ISSET(fd, &ctx->readSet) || FD_ISSET(fd, &ctx->writeSet) ||
                         FD_ISSET(fd, &ctx->exceptSet))
                << "descriptor " << fd << " is still registered";
        EXPECT_EQ(ctx->timerCount, timersBefore);
    }
    int timersBefore = 0;
};

} // namespace

TEST_F(ZarnSelect, RefusesDescriptorCountsOutsideTheSetSize) {
    fd_set r = set_of({3});
    struct timeval zero = {0, 0};
    for (int nfds : {-1, FD_SETSIZE + 1}) {
        errno = 0;
        EXPECT_EQ(zarn_select(nfds, &r, nullptr, nullptr, &zero), -1);
        EXPECT_EQ(errno, EINVAL);
        EXPECT_TRUE(FD_ISSET(3, &r)) << "a refused call leaves the sets alone";
    }
    EXPECT_EQ(zarn_select(FD_SETSIZE, nullptr, nullptr, nullptr, &zero), 0);
}

TEST_F(ZarnSelect, ReportsEachReadyConditionAndClearsEverythingElse) {
    Pipe ready(40), idle(41);
    ready.fill();
    fd_set r = set_of({40, 41, 900}); /* 900 is above nfds */
    struct timeval timeout = {20, 0};
    EXPECT_EQ(zarn_select(42, &r, nullptr, nullptr, &timeout), 1);
    EXPECT_TRUE(FD_ISSET(40, &r));
    EXPECT_FALSE(FD_ISSET(41, &r));
    EXPECT_FALSE(FD_ISSET(900, &r));
    expect_registry_clean();

    SocketPair s; /* readable and writable: counted twice */
    const int fd = s.sv[0];
    fd_set w = set_of({fd}), e = set_of({fd});
    r = set_of({fd});
    EXPECT_EQ(zarn_select(fd + 1, &r, &w, &e, nullptr), 2);
    EXPECT_TRUE(FD_ISSET(fd, &r));
    EXPECT_TRUE(FD_ISSET(fd, &w));
    EXPECT_FALSE(FD_ISSET(fd, &e));
    expect_registry_clean();
}

TEST_F(ZarnSelect, TimeoutsAreKeptAndAnotherTimerOfTheThreadEndsTheCallEarly) {
    Pipe idle(40);
    fd_set r = set_of({40});
    struct timeval timeout = {0, 0};
    auto start = Clock::now();
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &timeout), 0);
    EXPECT_LT(seconds_since(start), 8.0);
    EXPECT_FALSE(FD_ISSET(40, &r));
    expect_registry_clean();

    timeout = {0, 200000}; /* no sets: sleeps for the time-out */
    start = Clock::now();
    EXPECT_EQ(zarn_select(0, nullptr, nullptr, nullptr, &timeout), 0);
    EXPECT_GE(seconds_since(start), 0.199);
    EXPECT_LT(seconds_since(start), 10.0);
    expect_registry_clean();

    arm_guard_timer(100);
    r = set_of({40});
    timeout = {30, 0};
    start = Clock::now();
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &timeout), 0);
    EXPECT_LT(seconds_since(start), 15.0);
    EXPECT_EQ(scripted::times("timer:guard"), 1);
    EXPECT_EQ(ctx->timerCount, timersBefore) << "the guard fired and the call's own timer is disarmed";
}

/* As select() does, whole seconds in tv_usec are carried (or borrowed) and
 * the call waits the whole time-out; a far-off one waits for the thread's
 * next timer, without overflow. */
TEST_F(ZarnSelect, MicrosecondsCarryIntoSecondsAndFarTimeoutsSaturate) {
    const struct {
        struct timeval timeout;
        double atLeast;
    } waits[] = {{{0, 1200000}, 1.15}, {{2, -1500000}, 0.45}};
    for (const auto &w : waits) {
        struct timeval timeout = w.timeout;
        const auto start = Clock::now();
        EXPECT_EQ(zarn_select(0, nullptr, nullptr, nullptr, &timeout), 0) << w.timeout.tv_usec;
        EXPECT_GE(seconds_since(start), w.atLeast) << w.timeout.tv_usec;
        EXPECT_LT(seconds_since(start), w.atLeast + 10.0);
        expect_registry_clean();
    }
    for (struct timeval far :
         {timeval{LONG_MAX, 0}, timeval{LONG_MAX, 2500000}, timeval{LONG_MAX - 1, 999999}}) {
        arm_guard_timer(50);
        const long guardsBefore = scripted::times("timer:guard");
        EXPECT_EQ(zarn_select(0, nullptr, nullptr, nullptr, &far), 0) << far.tv_sec;
        EXPECT_EQ(scripted::times("timer:guard"), guardsBefore + 1) << far.tv_sec;
        expect_registry_clean();
    }
}

/* A set holding a descriptor that is not open: -1/EBADF like select(),
 * with nothing registered, armed or cleared, and the process goes on. */
TEST_F(ZarnSelect, ClosedDescriptorIsRefusedWithEbadf) {
    Pipe ready(40), closed(41);
    ready.fill();
    close(closed.r);
    closed.r = -1;
    struct timeval timeout = {20, 0};
    for (bool inExceptSet : {false, true}) {
        fd_set r = set_of({40}), e = set_of({});
        FD_SET(41, inExceptSet ? &e : &r);
        errno = 0;
        EXPECT_EQ(zarn_select(42, &r, nullptr, &e, &timeout), -1);
        EXPECT_EQ(errno, EBADF);
        EXPECT_TRUE(FD_ISSET(40, &r)) << "the sets are left as they were";
        expect_registry_clean();
    }
    fd_set r = set_of({40});
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &timeout), 1);
}

TEST_F(ZarnSelect, OwnersRegistrationIsServedAndKept) {
    Pipe owned(40), asked(41);
    owned.fill();
    asked.fill();
    ASSERT_EQ(watch(40, SEL_READ, log_callback, &owned), 0);
    fd_set r = set_of({40, 41});
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
    register_counted_sigusr1();
    ASSERT_EQ(raise(SIGUSR1), 0); /* pending until the blocking wait */
    Pipe idle(40);
    fd_set r = set_of({40});
    struct timeval timeout = {30, 0};
    errno = 0;
    EXPECT_EQ(zarn_select(41, &r, nullptr, nullptr, &timeout), -1);
    EXPECT_EQ(errno, EINTR);
    sigset_t mask;
    sigprocmask(SIG_BLOCK, nullptr, &mask); /* ThreadSanitizer runs deferred handlers here */
    EXPECT_EQ(g_handled, 1);
    expect_registry_clean();
}
