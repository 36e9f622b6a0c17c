/* The epoll backend: the process-wide instance, event translation, the
 * two waits of a pass, signals and failures. */
#include <pthread.h>
#include <sys/epoll.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <filesystem>
#include <memory>
#include <thread>

#include "dispatch_fixture.h"
#include "selector/dispatch_private.h"

using namespace dispatch_test;

namespace {

int epoll_instances_open() {
    int count = 0;
    std::error_code ignored; /* the listing's own descriptor may be gone when read */
    for (const auto &e : std::filesystem::directory_iterator("/proc/self/fd"))
        count += std::filesystem::read_symlink(e.path(), ignored) == "anon_inode:[eventpoll]";
    return count;
}

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
        EXPECT_EQ(watch(fd, events), 0);
        EXPECT_EQ(SelEpoll(), 0);
        EXPECT_EQ(SelRemFD(fd), 0);
        return callbacks_logged();
    }
};

using EpollInstance = DispatchTest;

int remove_the_other(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    EXPECT_EQ(SelRemFD(*static_cast<int *>(arg)), 0);
    return 0;
}

/* The first of two ready descriptors to run closes the other and registers
 * a fresh, idle pipe under its number. */
struct Replacement {
    int *other;
    Pipe *fresh;
};
bool replaced = false;
int replace_the_other(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    if (replaced) return 0;
    replaced = true;
    auto *r = static_cast<Replacement *>(arg);
    EXPECT_EQ(SelRemFD(*r->other), 0);
    EXPECT_EQ(dup2(r->fresh->r, *r->other), *r->other);
    EXPECT_EQ(SelAddFD(*r->other, SEL_READ, 0, log_callback, nullptr), 0);
    return 0;
}

/* Consumes its byte, then (outside a nested pass) runs one nested pass. */
int nesting = 0;
int consume_then_nest(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    char byte;
    EXPECT_EQ(read(fd, &byte, 1), 1) << "dispatched for readiness that is gone";
    if (nesting == 0) {
        ++nesting;
        EXPECT_EQ(SelEpoll(), 0);
        --nesting;
    }
    return 0;
}

} // namespace

TEST_F(EpollInstance, OneCloseOnExecInstanceUntilDeInitNeverStoredAsDescriptorZero) {
    EXPECT_EQ(GetEpollFd(), 0);
    close(0);
    ASSERT_EQ(SelUseEpoll(), 0);
    const int first = GetEpollFd();
    ASSERT_GT(first, 0);
    EXPECT_EQ(fcntl(0, F_GETFD), -1) << "descriptor 0 is left free again";
    EXPECT_TRUE(fcntl(first, F_GETFD) & FD_CLOEXEC);
    EXPECT_EQ(SelUseEpoll(), 0);
    EXPECT_EQ(GetEpollFd(), first);
    EXPECT_EQ(epoll_instances_open(), 1);
    Pipe p;
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(p.r, "r")}));

    DeInitEpoll();
    EXPECT_EQ(GetEpollFd(), 0);
    EXPECT_GE(fcntl(first, F_GETFD), 0) << "DeInitEpoll does not close the instance";
    ASSERT_EQ(SelUseEpoll(), 0);
    EXPECT_GT(GetEpollFd(), 0);
    EXPECT_NE(GetEpollFd(), first);
    EXPECT_EQ(epoll_instances_open(), 2);
}

TEST_F(EpollInstance, ConcurrentSwitchesCreateOneInstance) {
    constexpr int kThreads = 6;
    std::atomic<int> ready{0};
    std::vector<int> seen(kThreads, -1);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([&, i] {
            ready.fetch_add(1);
            while (ready.load() < kThreads) {}
            EXPECT_EQ(SelUseEpoll(), 0);
            seen[i] = GetEpollFd();
        });
    for (auto &t : threads) t.join();
    for (int fd : seen) EXPECT_EQ(fd, GetEpollFd());
    EXPECT_EQ(epoll_instances_open(), 1);
}

TEST_F(Epoll, EventsTranslateToOneSelectorBit) {
    Pipe p, hungUp, dataThenHangUp, broken;
    p.fill();
    EXPECT_EQ(single_pass(p.r, SEL_READ), (Log{cb(p.r, "r")}));
    EXPECT_EQ(single_pass(p.w, SEL_WRITE), (Log{cb(p.w, "w")}));
    SocketPair s;
    EXPECT_EQ(single_pass(s.sv[0], SEL_READ | SEL_WRITE), (Log{cb(s.sv[0], "r")}))
        << "readable and writable: one read callback per pass";
    close(hungUp.w);
    hungUp.w = -1;
    EXPECT_EQ(single_pass(hungUp.r, SEL_READ), (Log{cb(hungUp.r, "x")})) << "EPOLLHUP alone";
    dataThenHangUp.fill();
    close(dataThenHangUp.w);
    dataThenHangUp.w = -1;
    EXPECT_EQ(single_pass(dataThenHangUp.r, SEL_READ), (Log{cb(dataThenHangUp.r, "r")}))
        << "EPOLLIN|EPOLLHUP";
    close(broken.r);
    broken.r = -1;
    EXPECT_EQ(single_pass(broken.w, SEL_READ), (Log{cb(broken.w, "x")})) << "EPOLLERR alone";
}

TEST_F(Epoll, FirstWaitTakesAtMostOneHundredEventsThenRunsTimers) {
    std::vector<std::unique_ptr<Pipe>> pipes;
    for (int i = 0; i < 150; ++i) {
        pipes.push_back(std::make_unique<Pipe>());
        pipes.back()->fill();
        ASSERT_EQ(watch(pipes.back()->r), 0);
    }
    arm_guard_timer(0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged().size(), 100u);
    ASSERT_EQ(log().size(), 101u);
    EXPECT_EQ(log().back(), "timer:guard") << "timers run after the dispatch";
}

TEST_F(Epoll, EventsOfUnregisteredOrRemovedDescriptorsAreSkipped) {
    Pipe foreign, a, b;
    foreign.fill();
    struct epoll_event ev {};
    ev.events = EPOLLIN;
    ev.data.fd = foreign.r;
    ASSERT_EQ(epoll_ctl(GetEpollFd(), EPOLL_CTL_ADD, foreign.r, &ev), 0);
    SelRemoveAllTimers();
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_TRUE(log().empty());

    a.fill();
    b.fill();
    ASSERT_EQ(watch(a.r, SEL_READ, remove_the_other, &b.r), 0);
    ASSERT_EQ(watch(b.r, SEL_READ, remove_the_other, &a.r), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged().size(), 1u) << "removed earlier in the batch";
}

TEST_F(Epoll, EventsOfARemovedDescriptorOrServedByANestedPassAreDropped) {
    Pipe a, b, freshA, freshB;
    a.fill();
    b.fill();
    Replacement forA{&b.r, &freshB}, forB{&a.r, &freshA};
    ASSERT_EQ(watch(a.r, SEL_READ, replace_the_other, &forA), 0);
    ASSERT_EQ(watch(b.r, SEL_READ, replace_the_other, &forB), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged().size(), 1u) << "the stale event reached the new registration";
    SelRemFD(a.r);
    SelRemFD(b.r);

    Pipe c, d;
    for (Pipe *p : {&c, &d}) {
        fcntl(p->r, F_SETFL, O_NONBLOCK);
        p->fill();
        ASSERT_EQ(watch(p->r, SEL_READ, consume_then_nest), 0);
    }
    arm_guard_timer(0); /* ends a nested pass that finds nothing */
    clear_log();
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(callbacks_logged().size(), 2u) << "each readable once";
}

TEST_F(Epoll, NumbersThatCannotBeOpenDescriptorsGrowNothing) {
    Pipe p;
    ASSERT_EQ(watch(p.r), 0);
    const int tableSize = ctx->fdTableSize;
    errno = 0;
    EXPECT_EQ(watch(20000000), -1);
    EXPECT_EQ(errno, EBUSY);
    EXPECT_EQ(SelGetFDArg(20000000), nullptr);
    EXPECT_EQ(SelRemFD(20000000), -1);
    EXPECT_EQ(errno, EINVAL);
    /* An event of a descriptor that no thread registered, far up the table. */
    Pipe foreign;
    foreign.fill();
    ASSERT_EQ(dup2(foreign.r, 1000), 1000);
    struct epoll_event ev {};
    ev.events = EPOLLIN;
    ev.data.fd = 1000;
    ASSERT_EQ(epoll_ctl(GetEpollFd(), EPOLL_CTL_ADD, 1000, &ev), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(ctx->fdTableSize, tableSize);
    close(1000);
}

TEST_F(Epoll, NoTimerMeansNoWaitAndADueTimerEndsThePassBeforeTheWaitAndItsSignals) {
    ASSERT_EQ(SelRemoveAllTimers(), 1); /* the reaper's */
    const auto start = Clock::now();
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_LT(seconds_since(start), 8.0);

    register_counted_sigusr1();
    ASSERT_EQ(raise(SIGUSR1), 0);
    arm_guard_timer(0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(log(), (Log{"timer:guard"}));
    EXPECT_EQ(g_handled, 0) << "registered signals stay blocked outside the blocking wait";
}

TEST_F(Epoll, RegisteredSignalDuringTheWaitInterruptsThePass) {
#if defined(QORBU_TESTS_EMULATED) && defined(__i386__) /* qemu-i386 (7.2) aborts the process there */
    GTEST_SKIP() << "qemu-i386 aborts on a signal sent to a thread waiting in epoll_wait";
#endif
    register_counted_sigusr1();
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
    sigset_t now;
    pthread_sigmask(SIG_BLOCK, nullptr, &now);
    EXPECT_EQ(sigismember(&now, SIGUSR1), 1) << "blocked again after the wait";
}

TEST_F(Epoll, BlockingWaitTimeoutIsTruncatedToMilliseconds) {
    using qorbu::sel::epoll_timeout_ms;
    SelRemoveAllTimers();
    EXPECT_EQ(epoll_timeout_ms(ctx, {100, 0}), 0) << "no timer armed";
    SelTimer t{};
    t.callback = log_timer;
    t.when = {100, 2500000};
    ASSERT_EQ(SelAddTimer(&t), 0);
    /* Plain, borrowing a second, under a millisecond, whole seconds, overdue (no wait). */
    const std::pair<timespec, int> cases[] = {
        {{100, 0}, 2}, {{99, 999000000}, 3}, {{100, 1600000}, 0}, {{98, 0}, 2002}, {{101, 0}, 0}};
    for (auto [now, ms] : cases)
        EXPECT_EQ(epoll_timeout_ms(ctx, now), ms) << now.tv_sec << "s " << now.tv_nsec << "ns";
    SelRemTimer(&t);
    t.when = {2100000000, 0};
    ASSERT_EQ(SelAddTimer(&t), 0);
    EXPECT_EQ(epoll_timeout_ms(ctx, {0, 0}), INT_MAX) << "clamped, never negative";
    SelRemTimer(&t);
}

TEST_F(Epoll, ForeignDescriptorInPlaceOfTheInstanceAborts) {
    Pipe p;
    ASSERT_EQ(dup2(p.r, GetEpollFd()), GetEpollFd());
    EXPECT_DEATH(SelEpoll(), "Epoll failed: Invalid argument");
}
