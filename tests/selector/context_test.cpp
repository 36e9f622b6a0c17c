#include <cerrno>
#include <csignal>
#include <cstddef>
#include <pthread.h>

#include <atomic>
#include <thread>
#include <vector>

#include "selector_fixture.h"

using qorbu::test::SelectorTest;

namespace {

bool blocked_in_thread(int signo) {
    sigset_t mask;
    pthread_sigmask(SIG_BLOCK, nullptr, &mask);
    return sigismember(&mask, signo) == 1;
}

bool fd_set_empty(const fd_set &set) {
    for (int fd = 0; fd < FD_SETSIZE; ++fd)
        if (FD_ISSET(fd, &set)) return false;
    return true;
}

} // namespace

TEST(SelContextStart, FreshContextHoldsOnlyTheReaper) {
    ASSERT_EQ(SelInit(), 0);
    SelContext *ctx = SelCurrentContext();
    ASSERT_NE(ctx, nullptr);
    EXPECT_EQ(ctx->timerCount, 1);
    EXPECT_EQ(ctx->timerCapacity, 1);
    EXPECT_EQ(ctx->timerHeap[1], &fd_timer);
    EXPECT_EQ(fd_timer.heapIndex, 1u);
    EXPECT_EQ(fd_timer.callback, &SelReapIdleFDs);

    struct timespec now;
    SelGetTime(&now);
    long ahead = static_cast<long>(fd_timer.when.tv_sec - now.tv_sec);
    EXPECT_GE(ahead, 28);
    EXPECT_LE(ahead, 30);

    EXPECT_EQ(ctx->nfds, 0);
    EXPECT_EQ(ctx->scanStart, 0);
    EXPECT_EQ(ctx->fdTableSize, 0);
    EXPECT_EQ(ctx->fdTable, nullptr);
    EXPECT_EQ(ctx->zg, nullptr);
    EXPECT_TRUE(fd_set_empty(ctx->readSet) && fd_set_empty(ctx->writeSet) && fd_set_empty(ctx->exceptSet));
    EXPECT_NE(sel_tl_key, static_cast<pthread_key_t>(-1));
}

TEST(SelContextStart, SecondInitChangesNothing) {
    ASSERT_EQ(SelInit(), 0);
    SelContext *first = SelCurrentContext();
    struct timespec when = fd_timer.when;
    ASSERT_EQ(SelInit(), 0);
    EXPECT_EQ(SelCurrentContext(), first);
    EXPECT_EQ(first->timerCount, 1);
    EXPECT_EQ(fd_timer.when.tv_sec, when.tv_sec);
    EXPECT_EQ(fd_timer.when.tv_nsec, when.tv_nsec);
}

TEST_F(SelectorTest, SetZGStoresAndClearsTheHostContext) {
    int host = 0;
    SelSetZG(&host);
    EXPECT_EQ(ctx->zg, &host);
    SelSetZG(nullptr);
    EXPECT_EQ(ctx->zg, nullptr);
}

TEST_F(SelectorTest, SignalsAreBlockedWhileRegistered) {
    sigset_t only;
    sigemptyset(&only);
    sigaddset(&only, SIGUSR2);
    pthread_sigmask(SIG_BLOCK, &only, nullptr);
    ASSERT_FALSE(blocked_in_thread(SIGUSR1));
    EXPECT_EQ(SelAddSignal(SIGUSR1), 0);
    EXPECT_TRUE(blocked_in_thread(SIGUSR1));
    EXPECT_TRUE(blocked_in_thread(SIGUSR2)) << "the caller's own blocked signals stay blocked";
    pthread_sigmask(SIG_UNBLOCK, &only, nullptr);
    EXPECT_EQ(sigismember(&ctx->signals, SIGUSR1), 1);

    errno = 0;
    EXPECT_EQ(SelAddSignal(SIGUSR1), -1);
    EXPECT_EQ(errno, EINVAL);

    EXPECT_EQ(SelRemSignal(SIGUSR1), 0);
    EXPECT_FALSE(blocked_in_thread(SIGUSR1));
    EXPECT_EQ(sigismember(&ctx->signals, SIGUSR1), 0);
}

TEST_F(SelectorTest, RemovingAnUnregisteredSignalStillUnblocksIt) {
    sigset_t only;
    sigemptyset(&only);
    sigaddset(&only, SIGUSR2);
    pthread_sigmask(SIG_BLOCK, &only, nullptr);
    errno = 0;
    EXPECT_EQ(SelRemSignal(SIGUSR2), -1);
    EXPECT_EQ(errno, EINVAL);
    EXPECT_FALSE(blocked_in_thread(SIGUSR2));
}

TEST_F(SelectorTest, InvalidSignalNumbersAreRefused) {
    for (int signo : {0, 65, -1}) {
        errno = 0;
        EXPECT_EQ(SelAddSignal(signo), -1) << signo;
        EXPECT_EQ(errno, EINVAL) << signo;
        errno = 0;
        EXPECT_EQ(SelRemSignal(signo), -1) << signo;
        EXPECT_EQ(errno, EINVAL) << signo;
    }
    sigset_t empty;
    sigemptyset(&empty);
    for (int signo = 1; signo <= 64; ++signo) EXPECT_EQ(sigismember(&ctx->signals, signo), 0);
}

namespace {

struct ThreadResult {
    int init = -1;
    bool gotReaper = false;
};

void *init_in_thread(void *arg) {
    auto *result = static_cast<ThreadResult *>(arg);
    result->init = SelInit();
    SelContext *ctx = SelCurrentContext();
    result->gotReaper = ctx != nullptr && ctx->timerCount == 1 && ctx->timerHeap[1] == &fd_timer;
    return nullptr;
}

ThreadResult run_init_thread() {
    ThreadResult result;
    pthread_t thread;
    EXPECT_EQ(pthread_create(&thread, nullptr, init_in_thread, &result), 0);
    EXPECT_EQ(pthread_join(thread, nullptr), 0);
    return result;
}

} // namespace

TEST(SelContextThreads, ReaperStaysWithTheFirstLiveThread) {
    ASSERT_EQ(SelInit(), 0);
    ASSERT_EQ(fd_timer.heapIndex, 1u);
    ThreadResult other = run_init_thread();
    EXPECT_EQ(other.init, 0);
    EXPECT_FALSE(other.gotReaper);
    // The main thread's heap still holds it, intact.
    EXPECT_EQ(SelCurrentContext()->timerHeap[1], &fd_timer);
    EXPECT_EQ(fd_timer.heapIndex, 1u);
    SelRemTimer(&fd_timer); // must not abort: the record is consistent
    EXPECT_EQ(SelCurrentContext()->timerCount, 0);
}

TEST(SelContextThreads, ReaperPassesOnWhenItsThreadEnds) {
    ThreadResult first = run_init_thread();
    EXPECT_EQ(first.init, 0);
    EXPECT_TRUE(first.gotReaper);
    // The ended thread's destructor disarmed it, so the next context gets it.
    EXPECT_EQ(fd_timer.heapIndex, 0u);
    ASSERT_EQ(SelInit(), 0);
    EXPECT_EQ(SelCurrentContext()->timerHeap[1], &fd_timer);
    EXPECT_EQ(fd_timer.heapIndex, 1u);
}

// The reaper's owner ended after other selector threads had started: the
// next pass of one of them (select or epoll) takes the reaper over, and only
// one of them does.
TEST(SelContextThreads, ReaperPassesToAnEarlierThreadAtItsNextPass) {
    for (int (*pass)() : {SelSelect, SelEpoll}) {
        SCOPED_TRACE(pass == SelSelect ? "select" : "epoll");
        if (pass == SelEpoll) {
            ASSERT_EQ(SelUseEpoll(), 0);
        }
        std::atomic<int> stage{0};
        auto await = [&stage](int s) {
            while (stage.load() < s) std::this_thread::yield();
        };
        std::thread owner([&] {
            EXPECT_EQ(SelInit(), 0);
            EXPECT_EQ(SelDebugIsTimerActive(&fd_timer), 1);
            stage = 1;
            await(3);
        });
        int holds[2] = {-1, -1};
        std::vector<std::thread> others;
        for (int i = 0; i < 2; ++i)
            others.emplace_back([&, i] {
                await(1);
                EXPECT_EQ(SelInit(), 0);
                EXPECT_EQ(SelDebugIsTimerActive(&fd_timer), 0) << "one owner at a time";
                stage.fetch_add(1);
                await(4);
                SelTimer due{};
                due.callback = qorbu::test::noop_timer_callback;
                EXPECT_EQ(SelSleep(&due, 0), 0); // ends the pass at once
                EXPECT_EQ(pass(), 0);
                holds[i] = SelDebugIsTimerActive(&fd_timer);
                stage.fetch_add(1);
                await(6); // both passes done before either thread ends
            });
        owner.join();
        stage = 4;
        for (auto &t : others) t.join();
        EXPECT_EQ(holds[0] + holds[1], 1) << "the reaper was taken over by exactly one thread";
    }
    DeInitEpoll();
}

namespace {

int seen_callbacks = 0;
int count_fd_callback(int, unsigned, void *, SelFdEntry *) { return ++seen_callbacks; }

void *register_and_exit(void *) {
    EXPECT_EQ(SelInit(), 0);
    // Give the context a grown table and heap so the destructor has them to free.
    static SelTimer timers[16];
    for (SelTimer &t : timers) {
        t = SelTimer{};
        t.callback = qorbu::test::noop_timer_callback;
        SelMakeWhen(&t.when, 60, 0);
        EXPECT_EQ(SelAddTimer(&t), 0);
    }
    EXPECT_EQ(SelAddFD(200, SEL_READ, 0, count_fd_callback, nullptr), 0);
    return nullptr;
}

} // namespace

TEST(SelContextThreads, ThreadExitReleasesItsContext) {
    // Under the address sanitizer a leak of the table or heap fails this test.
    for (int i = 0; i < 4; ++i) {
        pthread_t thread;
        ASSERT_EQ(pthread_create(&thread, nullptr, register_and_exit, nullptr), 0);
        ASSERT_EQ(pthread_join(thread, nullptr), 0);
    }
    ASSERT_EQ(SelInit(), 0);
    EXPECT_EQ(SelCurrentContext()->fdTableSize, 0);
    EXPECT_EQ(seen_callbacks, 0);
}
