// The demo host's task scheduler: the host side of the select loop's hooks.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "demo.h"
#include "selector/sel.h"

namespace {

std::vector<std::string> ran;

void record(void *arg) { ran.emplace_back(static_cast<const char *>(arg)); }

class HostSchedTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ran.clear();
        host_init(&host);
    }
    void TearDown() override { host_destroy(&host); }

    // What the select loop does at a drain: fetch and call until empty.
    int drain() {
        alignas(8) unsigned char task[SEL_HOST_TASK_SIZE];
        int count = 0;
        while (thread_fetch_queued(&host, task)) {
            thread_call(task);
            ++count;
        }
        return count;
    }

    HostContext host;
};

timeval tv(long sec, long usec) { return timeval{sec, usec}; }

TEST(HostClock, CompareSubtractAndAdd) {
    EXPECT_LT(timeval_cmp(tv(1, 999999), tv(2, 0)), 0);
    EXPECT_GT(timeval_cmp(tv(2, 1), tv(2, 0)), 0);
    EXPECT_EQ(timeval_cmp(tv(5, 5), tv(5, 5)), 0);
    EXPECT_LT(timeval_cmp(tv(-1, 0), tv(0, 0)), 0);

    timeval d = timeval_sub(tv(3, 100), tv(1, 200));
    EXPECT_EQ(d.tv_sec, 1);
    EXPECT_EQ(d.tv_usec, 999900);
    d = timeval_sub(tv(1, 0), tv(2, 500000)); // negative: seconds carry the sign
    EXPECT_EQ(d.tv_sec, -2);
    EXPECT_EQ(d.tv_usec, 500000);

    timeval t = host_timeval_add_ms(tv(1, 999000), 1500);
    EXPECT_EQ(t.tv_sec, 3);
    EXPECT_EQ(t.tv_usec, 499000);

    timeval before, after;
    pal_time_tzcurrent(&before, nullptr);
    pal_time_tzcurrent(&after, nullptr);
    EXPECT_LE(timeval_cmp(before, after), 0) << "the host clock must not go back";
}

TEST_F(HostSchedTest, QueueRunsTasksInOrderAndTasksMayPostMore) {
    alignas(8) unsigned char task[SEL_HOST_TASK_SIZE];
    EXPECT_EQ(thread_fetch_queued(&host, task), 0);
    host_post(&host, record, (void *)"a");
    host_post(
        &host,
        [](void *arg) {
            record((void *)"b");
            host_post(static_cast<HostContext *>(arg), record, (void *)"c");
        },
        &host);
    EXPECT_EQ(drain(), 3);
    EXPECT_EQ(ran, (std::vector<std::string>{"a", "b", "c"}));
    EXPECT_EQ(drain(), 0);
}

TEST_F(HostSchedTest, TimedListsKeepEarliestFirstAndEqualTimesInArrivalOrder) {
    host_after(&host, HOST_LIST_NORMAL, 60000, record, (void *)"late");
    host_after(&host, HOST_LIST_NORMAL, 30000, record, (void *)"early-1");
    host_after(&host, HOST_LIST_NORMAL, 30000, record, (void *)"early-2");
    SelHostTask *head = host.scheduler.timed[HOST_LIST_NORMAL];
    ASSERT_NE(head, nullptr);
    EXPECT_STREQ(static_cast<const char *>(reinterpret_cast<HostTimed *>(head)->arg), "early-1");
    ASSERT_NE(head->next, nullptr);
    EXPECT_STREQ(static_cast<const char *>(reinterpret_cast<HostTimed *>(head->next)->arg), "early-2");
    EXPECT_LE(timeval_cmp(head->when, head->next->when), 0);
    EXPECT_LT(timeval_cmp(head->next->when, head->next->next->when), 0);
    EXPECT_EQ(host.scheduler.timed[HOST_LIST_URGENT], nullptr);
    EXPECT_EQ(host_after(&host, HOST_LIST_COUNT, 0, record, nullptr), nullptr);
}

TEST_F(HostSchedTest, OnlyDueTasksAreQueuedListByList) {
    host_after(&host, HOST_LIST_IDLE, 0, record, (void *)"idle");
    host_after(&host, HOST_LIST_NORMAL, 60000, record, (void *)"not-yet");
    host_after(&host, HOST_LIST_URGENT, 0, record, (void *)"urgent");
    EXPECT_EQ(thread_select_nb(&host), 2);
    EXPECT_EQ(drain(), 2);
    EXPECT_EQ(ran, (std::vector<std::string>{"urgent", "idle"}));
    EXPECT_EQ(host.scheduler.timed[HOST_LIST_URGENT], nullptr);
    EXPECT_NE(host.scheduler.timed[HOST_LIST_NORMAL], nullptr);
}

TEST_F(HostSchedTest, CancelRemovesOnlyWaitingTasks) {
    HostTimed *keep = host_after(&host, HOST_LIST_LOW, 60000, record, (void *)"keep");
    HostTimed *drop = host_after(&host, HOST_LIST_LOW, 30000, record, (void *)"drop");
    EXPECT_EQ(host_cancel(&host, drop), 1);
    EXPECT_EQ(host.scheduler.timed[HOST_LIST_LOW], &keep->link);
    EXPECT_EQ(keep->link.next, nullptr);
    HostTimed stranger{};
    EXPECT_EQ(host_cancel(&host, &stranger), 0);
}

TEST_F(HostSchedTest, WatchedDescriptorQueuesItsTaskWhileReadable) {
    int fds[2];
    ASSERT_EQ(pipe2(fds, O_NONBLOCK), 0);
    EXPECT_EQ(host.scheduler.max_fd, -1);
    ASSERT_EQ(host_watch_fd(&host, fds[0], record, (void *)"readable"), 0);
    EXPECT_EQ(host.scheduler.max_fd, fds[0]);
    EXPECT_TRUE(FD_ISSET(fds[0], &host.scheduler.readfd));
    EXPECT_EQ(thread_select_nb(&host), 0) << "an empty pipe is not readable";
    ASSERT_EQ(write(fds[1], "x", 1), 1);
    EXPECT_EQ(thread_select_nb(&host), 1);
    EXPECT_EQ(drain(), 1);
    EXPECT_EQ(ran, std::vector<std::string>{"readable"});
    EXPECT_EQ(host_watch_fd(&host, -1, record, nullptr), -1);
    EXPECT_EQ(host_watch_fd(&host, FD_SETSIZE, record, nullptr), -1);
    close(fds[0]);
    close(fds[1]);
}

// The scheduler handed to the selector: one SelSelect pass runs what the
// host queued, and a due timed task or a readable host descriptor ends the
// pass's wait.
class HostSchedLoopTest : public HostSchedTest {
  protected:
    void SetUp() override {
        HostSchedTest::SetUp();
        ASSERT_EQ(SelInit(), 0);
        SelSetZG(&host);
    }
    void TearDown() override {
        SelSetZG(nullptr);
        HostSchedTest::TearDown();
    }
};

TEST_F(HostSchedLoopTest, PassRunsQueuedTasksBeforeItPolls) {
    // A due timer keeps the pass from waiting: the queue must have been
    // drained at its start, before the timers ended it.
    SelTimer due{};
    due.callback = [](SelTimer *) { return 0; };
    SelMakeWhen(&due.when, 0, 0);
    ASSERT_EQ(SelAddTimer(&due), 0);
    host_post(&host, record, (void *)"queued");
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(ran, std::vector<std::string>{"queued"});
    EXPECT_EQ(SelDebugIsTimerActive(&due), 0);
}

TEST_F(HostSchedLoopTest, TimedTaskEndsTheWaitWhenDue) {
    host_after(&host, HOST_LIST_LOW, 50, record, (void *)"timed");
    timespec start, now;
    SelGetTime(&start);
    // The reaper's timer is 30 s away: only the host's due time can end
    // these waits early.
    for (int pass = 0; pass < 100 && ran.empty(); ++pass) SelSelect();
    SelGetTime(&now);
    EXPECT_EQ(ran, std::vector<std::string>{"timed"});
    EXPECT_LT(now.tv_sec - start.tv_sec, 20) << "the pass waited for the reaper, not the host task";
}

TEST_F(HostSchedLoopTest, ReadableHostDescriptorIsServicedAtTheEndOfThePass) {
    int fds[2];
    ASSERT_EQ(pipe2(fds, O_NONBLOCK), 0);
    host_watch_fd(&host, fds[0], record, (void *)"pipe");
    ASSERT_EQ(write(fds[1], "x", 1), 1);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(ran, std::vector<std::string>{"pipe"});
    close(fds[0]);
    close(fds[1]);
}

} // namespace
