/* The epoll backend: the process-wide instance, event translation, the
 * two waits of a pass, signals and failures. */
#include <dirent.h>
#include <pthread.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <memory>
#include <thread>
#include <vector>

#include "dispatch_fixture.h"
#include "selector/dispatch_private.h"
#include "support/test_support.h"

using namespace dispatch_test;
using Log = std::vector<std::string>;

namespace {

std::string cb(int fd, const char *event) { return "cb:" + std::to_string(fd) + ":" + event; }

int epoll_instances_open() {
    int count = 0;
    DIR *dir = opendir("/proc/self/fd");
    if (!dir) return -1;
    while (dirent *e = readdir(dir)) {
        char path[300], target[64];
        snprintf(path, sizeof path, "/proc/self/fd/%s", e->d_name);
        const ssize_t n = readlink(path, target, sizeof target - 1);
        if (n <= 0) continue;
        target[n] = '\0';
        if (std::string(target) == "anon_inode:[eventpoll]") ++count;
    }
    closedir(dir);
    return count;
}

volatile sig_atomic_t g_handled = 0;
void count_signal(int) { g_handled = g_handled + 1; }

class Epoll : public DispatchTest {
protected:
    void SetUp() override {
        DispatchTest::SetUp();
        ASSERT_EQ(SelUseEpoll(), 0);
        ASSERT_NE(GetEpollFd(), 0);
    }
    /* One pass with only fd registered (for the given events); the log of its callbacks. */
    Log single_pass(int fd, unsigned events) {
        clear_log();
        EXPECT_EQ(SelAddFD(fd, events, 0, log_callback, nullptr), 0);
        EXPECT_EQ(SelEpoll(), 0);
        EXPECT_EQ(SelRemFD(fd), 0);
        return callbacks_logged();
    }
};

class EpollInstance : public DispatchTest {};

} // namespace

TEST_F(EpollInstance, OneCloseOnExecInstanceUntilDeInit) {
    EXPECT_EQ(GetEpollFd(), 0);
    ASSERT_EQ(SelUseEpoll(), 0);
    const int first = GetEpollFd();
    ASSERT_GT(first, 0);
    EXPECT_TRUE(fcntl(first, F_GETFD) & FD_CLOEXEC);
    EXPECT_EQ(SelUseEpoll(), 0);
    EXPECT_EQ(GetEpollFd(), first);
    EXPECT_EQ(epoll_instances_open(), 1);

    DeInitEpoll();
    EXPECT_EQ(GetEpollFd(), 0);
    EXPECT_GE(fcntl(first, F_GETFD), 0) << "DeInitEpoll does not close the instance";
    ASSERT_EQ(SelUseEpoll(), 0);
    EXPECT_NE(GetEpollFd(), first);
    EXPECT_EQ(epoll_instances_open(), 2);
}

TEST_F(EpollInstance, InstanceIsNeverStoredAsDescriptorZero) {
    close(0);
    ASSERT_EQ(SelUseEpoll(), 0);
    const int epfd = GetEpollFd();
    EXPECT_GT(epfd, 0);
    EXPECT_EQ(fcntl(0, F_GETFD), -1) << "descriptor 0 is left free again";
    EXPECT_TRUE(fcntl(epfd, F_GETFD) & FD_CLOEXEC);

    Pipe p;
    p.fill();
    ASSERT_EQ(SelAddFD(p.r, SEL_READ, 0, log_callback, nullptr), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(p.r, "r")}));
}

TEST_F(EpollInstance, ConcurrentSwitchesCreateOneInstance) {
    constexpr int kThreads = 6;
    std::atomic<int> ready{0};
    std::vector<int> seen(kThreads, -1);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([&, i] {
            ready.fetch_add(1);
            while (ready.load() < kThreads) {
            }
            EXPECT_EQ(SelUseEpoll(), 0);
            seen[i] = GetEpollFd();
        });
    for (auto &t : threads) t.join();
    for (int fd : seen) EXPECT_EQ(fd, GetEpollFd());
    EXPECT_EQ(epoll_instances_open(), 1);
}

TEST_F(Epoll, EventsTranslateToOneSelectorBit) {
    {
        Pipe p;
        p.fill();
        EXPECT_EQ(single_pass(p.r, SEL_READ), (Log{cb(p.r, "r")}));
        EXPECT_EQ(single_pass(p.w, SEL_WRITE), (Log{cb(p.w, "w")}));
    }
    {
        int sv[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, sv), 0);
        ASSERT_EQ(write(sv[1], "x", 1), 1);
        EXPECT_EQ(single_pass(sv[0], SEL_READ | SEL_WRITE), (Log{cb(sv[0], "r")}))
            << "readable and writable: one read callback per pass";
        close(sv[0]);
        close(sv[1]);
    }
    {
        Pipe hungUp;
        hungUp.close_writer();
        EXPECT_EQ(single_pass(hungUp.r, SEL_READ), (Log{cb(hungUp.r, "x")})) << "EPOLLHUP alone";
    }
    {
        Pipe dataThenHangUp;
        dataThenHangUp.fill();
        dataThenHangUp.close_writer();
        EXPECT_EQ(single_pass(dataThenHangUp.r, SEL_READ), (Log{cb(dataThenHangUp.r, "r")})) << "EPOLLIN|EPOLLHUP";
    }
    {
        Pipe broken;
        close(broken.r);
        broken.r = -1;
        EXPECT_EQ(single_pass(broken.w, SEL_READ), (Log{cb(broken.w, "x")})) << "EPOLLERR alone";
    }
}

TEST_F(Epoll, FirstWaitTakesAtMostOneHundredEventsThenRunsTimers) {
    constexpr int kPipes = 150;
    std::vector<std::unique_ptr<Pipe>> pipes;
    for (int i = 0; i < kPipes; ++i) {
        pipes.push_back(std::make_unique<Pipe>());
        pipes.back()->fill();
        ASSERT_EQ(SelAddFD(pipes.back()->r, SEL_READ, 0, log_callback, nullptr), 0);
    }
    SelTimer due{};
    due.callback = log_timer;
    due.arg = const_cast<char *>("due");
    ASSERT_EQ(SelSleep(&due, 0), 0);

    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged().size(), 100u);
    ASSERT_EQ(log().size(), 101u);
    EXPECT_EQ(log().back(), "timer:due") << "timers run after the dispatch";
}

namespace {
int remove_the_other(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    EXPECT_EQ(SelRemFD(*static_cast<int *>(arg)), 0);
    return 0;
}
} // namespace

TEST_F(Epoll, DescriptorRemovedEarlierInTheBatchIsSkipped) {
    Pipe a, b;
    a.fill();
    b.fill();
    ASSERT_EQ(SelAddFD(a.r, SEL_READ, 0, remove_the_other, &b.r), 0);
    ASSERT_EQ(SelAddFD(b.r, SEL_READ, 0, remove_the_other, &a.r), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged().size(), 1u);
}

TEST_F(Epoll, EventOfUnregisteredDescriptorIsSkipped) {
    Pipe p;
    p.fill();
    struct epoll_event ev {};
    ev.events = EPOLLIN;
    ev.data.fd = p.r;
    ASSERT_EQ(epoll_ctl(GetEpollFd(), EPOLL_CTL_ADD, p.r, &ev), 0);
    SelRemoveAllTimers();
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_TRUE(log().empty());
}

TEST_F(Epoll, DueTimerEndsPassBeforeTheBlockingWaitAndItsSignals) {
    struct sigaction sa {};
    sa.sa_handler = count_signal;
    ASSERT_EQ(sigaction(SIGUSR1, &sa, nullptr), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    g_handled = 0;
    ASSERT_EQ(raise(SIGUSR1), 0);
    arm_guard_timer(0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(log(), (Log{"timer:guard"}));
    EXPECT_EQ(g_handled, 0) << "registered signals stay blocked outside the blocking wait";
}

TEST_F(Epoll, NothingReadyAndNoTimerReturnsAtOnce) {
    EXPECT_EQ(SelRemoveAllTimers(), 1);
    const auto start = monotonic_now();
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_LT(seconds_since(start), 8.0);
}

TEST_F(Epoll, RegisteredSignalDuringTheWaitInterruptsThePass) {
    if (dispatch_test::kNoCrossThreadSignals)
        GTEST_SKIP() << "qemu-i386 aborts on a signal sent to a thread waiting in epoll_wait";
    struct sigaction sa {};
    sa.sa_handler = count_signal;
    ASSERT_EQ(sigaction(SIGUSR1, &sa, nullptr), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    g_handled = 0;
    arm_guard_timer(60000);
    const pthread_t waiter = pthread_self();
    std::atomic<bool> done{false};
    /* Keeps signalling: one that lands just before the wait is handled
     * there, a later one interrupts the wait. */
    std::thread sender([&] {
        while (!done.load()) {
            pthread_kill(waiter, SIGUSR1);
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        }
    });
    errno = 0;
    const int result = SelEpoll();
    const int error = errno;
    done.store(true);
    sender.join();
    EXPECT_EQ(result, -1);
    EXPECT_EQ(error, EINTR);
    EXPECT_GE(g_handled, 1);
}

TEST_F(Epoll, BlockingWaitTimeoutIsTruncatedToMilliseconds) {
    SelRemoveAllTimers();
    const struct timespec now = {100, 0};
    EXPECT_EQ(qorbu::sel::epoll_timeout_ms(ctx, now), 0) << "no timer armed";
    SelTimer t{};
    t.callback = log_timer;
    t.when = {100, 2500000};
    ASSERT_EQ(SelAddTimer(&t), 0);
    EXPECT_EQ(qorbu::sel::epoll_timeout_ms(ctx, now), 2);
    EXPECT_EQ(qorbu::sel::epoll_timeout_ms(ctx, {99, 999000000}), 3) << "borrowing a second";
    EXPECT_EQ(qorbu::sel::epoll_timeout_ms(ctx, {100, 1600000}), 0) << "under a millisecond";
    EXPECT_EQ(qorbu::sel::epoll_timeout_ms(ctx, {98, 0}), 2002);
    SelRemTimer(&t);
    t.when = {2100000000, 0};
    ASSERT_EQ(SelAddTimer(&t), 0);
    EXPECT_EQ(qorbu::sel::epoll_timeout_ms(ctx, {0, 0}), INT_MAX) << "clamped, never negative";
    SelRemTimer(&t);
}

TEST_F(Epoll, ForeignDescriptorInPlaceOfTheInstanceAborts) {
    Pipe p;
    ASSERT_EQ(dup2(p.r, GetEpollFd()), GetEpollFd());
    EXPECT_DEATH(SelEpoll(), "Epoll failed: Invalid argument");
}
