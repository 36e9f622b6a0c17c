#include <cerrno>
#include <fcntl.h>
#include <sys/time.h>
#include <unistd.h>

#include <vector>

#include "selector_fixture.h"

using qorbu::test::noop_fd_callback;
using qorbu::test::SelectorTest;

namespace {

std::vector<int> open_null(int count) {
    std::vector<int> fds;
    for (int i = 0; i < count; ++i) {
        int fd = open("/dev/null", O_RDONLY | O_CLOEXEC);
        EXPECT_GE(fd, 0);
        fds.push_back(fd);
    }
    return fds;
}

bool is_open(int fd) { return fcntl(fd, F_GETFD) != -1; }

class ReaperTest : public SelectorTest {
  protected:
    // Bring the reaper's deadline to now instead of waiting 30 seconds.
    void run_reaper_now() {
        struct timespec now;
        SelGetTime(&now);
        ASSERT_EQ(SelModifyTimer(&fd_timer, &now), 0);
        ASSERT_GE(SelRunTimers(ctx), 1);
    }
    void age(int fd, long seconds) {
        struct timeval now;
        gettimeofday(&now, nullptr);
        ctx->fdTable[fd].lastActivity.tv_sec = now.tv_sec - seconds;
    }
};

} // namespace

TEST_F(ReaperTest, ClosesOnlyIdleTrackedReadDescriptors) {
    std::vector<int> fds = open_null(6);
    ASSERT_EQ(SelAddFD(fds[0], SEL_READ, 1, noop_fd_callback, nullptr), 0);  // 26 s idle
    ASSERT_EQ(SelAddFD(fds[1], SEL_READ, 1, noop_fd_callback, nullptr), 0);  // 25 s idle
    ASSERT_EQ(SelAddFD(fds[2], SEL_READ, 0, noop_fd_callback, nullptr), 0);  // untracked
    ASSERT_EQ(SelAddFD(fds[3], SEL_WRITE, 1, noop_fd_callback, nullptr), 0); // not a reader
    ASSERT_EQ(SelAddFD(fds[4], SEL_READ, 1, noop_fd_callback, nullptr), 0);  // clock set back
    ASSERT_EQ(SelAddFD(fds[5], SEL_READ, 2, noop_fd_callback, nullptr), 0);  // never stamped
    age(fds[0], 26);
    age(fds[1], 25);
    age(fds[2], 1000);
    age(fds[3], 1000);
    age(fds[4], -100);

    run_reaper_now();
    EXPECT_FALSE(is_open(fds[0]));
    EXPECT_EQ(ctx->fdTable[fds[0]].events, 0u);
    EXPECT_FALSE(is_open(fds[5]));
    for (int i : {1, 2, 3, 4}) {
        EXPECT_TRUE(is_open(fds[i])) << i;
        EXPECT_NE(ctx->fdTable[fds[i]].events, 0u) << i;
    }
    // Re-armed 30 seconds ahead.
    EXPECT_NE(fd_timer.heapIndex, 0u);
    struct timespec now;
    SelGetTime(&now);
    EXPECT_GE(fd_timer.when.tv_sec - now.tv_sec, 28);
}

TEST_F(ReaperTest, DispatchRestartsTheIdleTime) {
    std::vector<int> fds = open_null(1);
    ASSERT_EQ(SelAddFD(fds[0], SEL_READ, 1, noop_fd_callback, nullptr), 0);
    age(fds[0], 100);
    SelDispatchFD(ctx, fds[0], SEL_READ);
    run_reaper_now();
    EXPECT_TRUE(is_open(fds[0]));
}

TEST_F(ReaperTest, RemovedTimerNeverReaps) {
    std::vector<int> fds = open_null(1);
    ASSERT_EQ(SelAddFD(fds[0], SEL_READ, 1, noop_fd_callback, nullptr), 0);
    age(fds[0], 100);
    ASSERT_EQ(SelRemoveAllTimers(), 1);
    EXPECT_EQ(SelRunTimers(ctx), 0);
    EXPECT_TRUE(is_open(fds[0]));
}

TEST_F(ReaperTest, EightHundredClosuresAreSurvived) {
    std::vector<int> fds = open_null(800);
    for (int fd : fds) {
        ASSERT_EQ(SelAddFD(fd, SEL_READ, 1, noop_fd_callback, nullptr), 0);
        age(fd, 60);
    }
    run_reaper_now();
    for (int fd : fds) ASSERT_FALSE(is_open(fd));
    EXPECT_NE(fd_timer.heapIndex, 0u);
}

// Descriptors registered in select mode and then removed, or reaped, in
// epoll mode: no interest bit is left behind, so the reaper never closes the
// unrelated files that get their numbers next, and a select pass after the
// switch back finds nothing closed.
TEST_F(ReaperTest, RemovedOrReapedDescriptorLeavesNoTraceInEitherMode) {
    std::vector<int> fds = open_null(2);
    for (int fd : fds) ASSERT_EQ(SelAddFD(fd, SEL_READ, 1, noop_fd_callback, nullptr), 0);
    ASSERT_EQ(SelUseEpoll(), 0);
    EXPECT_EQ(SelRemFD(fds[0]), -1) << "never added to the epoll instance";
    close(fds[0]);
    age(fds[1], 60);
    run_reaper_now();
    ASSERT_FALSE(is_open(fds[1])) << "a select-mode registration is reaped in epoll mode too";
    for (int fd : fds) {
        EXPECT_FALSE(FD_ISSET(fd, &ctx->readSet)) << fd;
        // An unrelated file of the host takes the number, looking long idle.
        const int unrelated = open("/dev/null", O_RDONLY);
        if (unrelated != fd) {
            ASSERT_EQ(dup2(unrelated, fd), fd);
            close(unrelated);
        }
        age(fd, 60);
    }
    run_reaper_now();
    for (int fd : fds) EXPECT_TRUE(is_open(fd)) << fd;

    for (int fd : fds) close(fd);
    DeInitEpoll();
    SelTimer due{};
    due.callback = qorbu::test::noop_timer_callback;
    ASSERT_EQ(SelSleep(&due, 0), 0);
    EXPECT_EQ(SelSelect(), 0);
}

using ReaperDeathTest = ReaperTest;

TEST_F(ReaperDeathTest, MoreThanEightHundredClosuresEndTheProcess) {
    std::vector<int> fds = open_null(801);
    for (int fd : fds) {
        ASSERT_EQ(SelAddFD(fd, SEL_READ, 1, noop_fd_callback, nullptr), 0);
        age(fd, 60);
    }
    EXPECT_EXIT(
        {
            run_reaper_now();
            _exit(3);
        },
        testing::ExitedWithCode(0), "");
    // Only the child closed them.
    EXPECT_TRUE(is_open(fds[0]));
}
