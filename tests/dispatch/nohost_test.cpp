/* A process that defines none of the host's functions: it links the shared
 * library, which refers to them weakly, and the loop skips both sources. */
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "selector/host.h"
#include "selector/sel.h"

namespace {

int g_calls = 0;
int count_callback(int, unsigned, void *, SelFdEntry *) { return ++g_calls, 0; }
int count_timer(SelTimer *) { return ++g_calls, 0; }

TEST(NoHost, LoopAndSelectEmulationWorkWithoutHostOrSnmp) {
    for (const char *name :
         {"thread_fetch_queued", "thread_call", "thread_select_nb", "timeval_cmp", "timeval_sub",
          "pal_time_tzcurrent", "snmp_select_info", "snmp_read", "snmp_timeout", "run_alarms"})
        ASSERT_EQ(dlsym(RTLD_DEFAULT, name), nullptr) << name << " is defined in this process";
    ASSERT_EQ(SelInit(), 0);
    int host[2], mine[2];
    ASSERT_EQ(pipe(host), 0);
    ASSERT_EQ(pipe(mine), 0);
    /* A long overdue host task and a host descriptor: were either used, the
     * waits below would end at once. */
    SelHostTask hostTask{nullptr, {0, 0}};
    SelHostScheduler scheduler{};
    FD_SET(host[0], &scheduler.readfd);
    scheduler.max_fd = host[0];
    scheduler.timed[0] = &hostTask;
    SelHostContext hostContext{&scheduler};
    SelSetZG(&hostContext);

    fd_set r;
    FD_ZERO(&r);
    FD_SET(host[0], &r);
    struct timeval timeout = {0, 20000};
    EXPECT_EQ(zarn_select(host[0] + 1, &r, nullptr, nullptr, &timeout), 0);

    ASSERT_EQ(write(host[1], "x", 1), 1); /* readable from now on, but not watched by the loop */
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

    FD_SET(host[0], &r);
    EXPECT_EQ(zarn_select(host[0] + 1, &r, nullptr, nullptr, &timeout), 1);
    EXPECT_TRUE(FD_ISSET(host[0], &r));
    SelSetZG(nullptr);
    for (int fd : {host[0], host[1], mine[0], mine[1]}) close(fd);
}

} // namespace
