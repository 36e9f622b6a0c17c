/* A process that defines none of the host's functions: it links the shared
 * library, which refers to them weakly, and the loop skips both sources. */
#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "selector/host.h"
#include "selector/sel.h"

namespace {

int g_calls = 0;
int count_callback(int, unsigned, void *, SelFdEntry *) {
    ++g_calls;
    return 0;
}
int count_timer(SelTimer *) {
    ++g_calls;
    return 0;
}

class NoHost : public ::testing::Test {
protected:
    void SetUp() override {
        for (const char *name : {"thread_fetch_queued", "thread_call", "thread_select_nb", "timeval_cmp",
                                 "timeval_sub", "pal_time_tzcurrent", "snmp_select_info", "snmp_read",
                                 "snmp_timeout", "run_alarms"})
            ASSERT_EQ(dlsym(RTLD_DEFAULT, name), nullptr) << name << " is defined in this process";
        ASSERT_EQ(SelInit(), 0);
        ASSERT_EQ(pipe(fds), 0);
        FD_ZERO(&scheduler.readfd);
        FD_ZERO(&scheduler.writefd);
        FD_ZERO(&scheduler.exceptfd);
        hostTask.when = {0, 0}; /* long overdue on any host clock */
        scheduler.timed[0] = &hostTask;
        for (int i = 1; i < 4; ++i) scheduler.timed[i] = nullptr;
        /* A readable host descriptor: were the host sets merged, the pass would return from the poll. */
        FD_SET(fds[0], &scheduler.readfd);
        scheduler.max_fd = fds[0];
        hostContext.scheduler = &scheduler;
        SelSetZG(&hostContext);
    }
    void TearDown() override {
        close(fds[0]);
        close(fds[1]);
    }
    int fds[2];
    SelHostTask hostTask{};
    SelHostScheduler scheduler;
    SelHostContext hostContext;
};

} // namespace

TEST_F(NoHost, PassDispatchesAndTimesOutWithoutHostOrSnmp) {
    ASSERT_EQ(write(fds[1], "x", 1), 1);
    int mine[2];
    ASSERT_EQ(pipe(mine), 0);
    ASSERT_EQ(write(mine[1], "y", 1), 1);
    ASSERT_EQ(SelAddFD(mine[0], SEL_READ, 0, count_callback, nullptr), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(g_calls, 1);
    ASSERT_EQ(SelRemFD(mine[0]), 0);

    SelTimer t{};
    t.callback = count_timer;
    ASSERT_EQ(SelSleep(&t, 20), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(g_calls, 2) << "the timer ended the wait";
    close(mine[0]);
    close(mine[1]);
}

TEST_F(NoHost, SelectEmulationWorks) {
    fd_set r;
    FD_ZERO(&r);
    FD_SET(fds[0], &r);
    struct timeval timeout = {0, 20000};
    EXPECT_EQ(zarn_select(fds[0] + 1, &r, nullptr, nullptr, &timeout), 0);
    ASSERT_EQ(write(fds[1], "x", 1), 1);
    FD_SET(fds[0], &r);
    EXPECT_EQ(zarn_select(fds[0] + 1, &r, nullptr, nullptr, &timeout), 1);
    EXPECT_TRUE(FD_ISSET(fds[0], &r));
}
