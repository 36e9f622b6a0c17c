/* The timer heap against the reference heap, the registry's bookkeeping and
 * argument checks, and the reaper. */
#include <atomic>
#include <random>
#include <thread>
#include <tuple>

#include "heap_interpreter.h"
#include "selector_fixture.h"

using namespace qorbu::test;

TEST_F(SelectorTest, TimerHeapMatchesTheReferenceHeapAfterEveryOperation) {
    for (unsigned seed = 1; seed <= 4; ++seed) {
        std::mt19937 random(seed);
        std::vector<uint8_t> bytes(3 * scaled(20000, 3000));
        for (uint8_t &b : bytes) b = static_cast<uint8_t>(random());
        in_child(
            [&] { EXPECT_EQ(HeapInterpreter().run(bytes.data(), bytes.size()), "") << "seed " << seed; });
    }
}

TEST_F(SelectorTest, InterestSetsAndNfdsFollowRegistrations) {
    /* descriptor, mask (6: write and except, 7: all three), removed, nfds afterwards */
    const std::tuple<int, unsigned, bool, int> steps[] = {
        {3, 1, false, 4}, {9, 6, false, 10}, {5, 0, false, 10}, {7, 7, false, 10}, {3, 0, true, 10},
        {9, 0, true, 8},  {7, 0, true, 1},   {5, 2, false, 6},  {5, 0, true, 1}};
    unsigned registered[10] = {};
    for (auto [fd, events, remove, nfds] : steps) {
        SCOPED_TRACE(testing::Message() << "fd " << fd << (remove ? " removed" : " added"));
        ASSERT_EQ(remove ? SelRemFD(fd) : watch(fd, events, log_fd, &registered[fd]), 0);
        registered[fd] = remove ? 0 : events;
        EXPECT_EQ(ctx->nfds, nfds);
        EXPECT_EQ(SelGetFDArg(fd), fd < nfds ? &registered[fd] : nullptr) << "the last registration's";
        for (int d = 0; d < 10; ++d) {
            const bool r = FD_ISSET(d, &ctx->readSet), w = FD_ISSET(d, &ctx->writeSet),
                       x = FD_ISSET(d, &ctx->exceptSet);
            EXPECT_EQ(r * SEL_READ | w * SEL_WRITE | x * SEL_EXCEPT, registered[d]) << "interest of " << d;
        }
    }
}

TEST_F(SelectorTest, BadArgumentsAreRefusedWithTheirErrno) {
    int arg = 0;
    ASSERT_EQ(watch(3, SEL_READ, log_fd, &arg), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    const std::pair<Outcome, Outcome> cases[] = {
        {OUTCOME(SelAddFD(5, SEL_IN_CALLBACK, 0, log_fd, nullptr)), failure(EINVAL)},
        {OUTCOME(SelAddFD(5, SEL_READ, 0, nullptr, nullptr)), failure(EINVAL)},
        {OUTCOME(SelAddFD(FD_SETSIZE, SEL_READ, 0, log_fd, nullptr)), failure(EINVAL)},
        {OUTCOME(SelRemFD(INT_MAX)), failure(EINVAL)},
        {OUTCOME(SelAddFD(-1, SEL_READ, 0, log_fd, nullptr)), failure(EINVAL)},
        {OUTCOME(SelAddFD(3, SEL_WRITE, 0, log_fd, nullptr)), failure(EBUSY)},
        {OUTCOME(SelRemFD(4)), failure(EINVAL)},
        {OUTCOME(SelRemFD(-1)), failure(EINVAL)},
        {OUTCOME(SelGetFDArg(4) == nullptr), {1, EINVAL}},
        {OUTCOME(SelGetFDArg(3) == &arg), {1, 0}},
        {OUTCOME(SelAddSignal(0)), failure(EINVAL)},
        {OUTCOME(SelAddSignal(65)), failure(EINVAL)},
        {OUTCOME(SelAddSignal(SIGUSR1)), failure(EINVAL)},
        {OUTCOME(SelRemSignal(SIGUSR2)), failure(EINVAL)},
        {OUTCOME(SelRemSignal(SIGUSR1)), {0, 0}},
        {OUTCOME(SelRemSignal(SIGUSR1)), failure(EINVAL)}};
    for (size_t i = 0; i < std::size(cases); ++i) EXPECT_EQ(cases[i].first, cases[i].second) << "case " << i;
    EXPECT_EQ(ctx->fdTableSize, 4) << "refused numbers grew the table";
    EXPECT_FALSE(blocked(SIGUSR1));
}

TEST_F(SelectorTest, ReaperClosesTrackedReadDescriptorsIdleForMoreThan25Seconds) {
    timespec soon;
    SelMakeWhen(&soon, 29, 0);
    EXPECT_TRUE(fd_timer.heapIndex != 0 && soon.tv_sec <= fd_timer.when.tv_sec) << "armed 30 s ahead";
    Pipe idle26, idle25, untracked, write_only;
    using Case = std::tuple<int, unsigned, int, int>; /* descriptor, mask, tracked, seconds idle */
    for (auto [fd, events, tracked, idle] :
         {Case{idle26.r, SEL_READ, 1, 26}, Case{idle25.r, SEL_READ, 1, 25},
          Case{untracked.r, SEL_READ, 0, 60}, Case{write_only.w, SEL_WRITE, 1, 60}}) {
        ASSERT_EQ(SelAddFD(fd, events, tracked, log_fd, nullptr), 0);
        ctx->fdTable[fd].lastActivity.tv_sec -= idle;
    }
    const timespec due = {0, 0};
    ASSERT_EQ(SelModifyTimer(&fd_timer, &due), 0);
    EXPECT_EQ(SelRunTimers(ctx), 1);
    EXPECT_EQ(OUTCOME(fcntl(idle26.r, F_GETFD)), failure(EBADF));
    EXPECT_FALSE(FD_ISSET(idle26.r, &ctx->readSet));
    idle26.r = -1;
    for (int fd : {idle25.r, untracked.r, write_only.w}) EXPECT_NE(fcntl(fd, F_GETFD), -1) << fd;
    EXPECT_TRUE(fd_timer.heapIndex != 0 && soon.tv_sec <= fd_timer.when.tv_sec) << "re-armed 30 s ahead";
}

/* The reaper's owner ends after two other selector threads started: the next
 * pass of one of them (select or epoll) takes the reaper over, and only one. */
TEST(SelectorThreads, ReaperPassesToAnotherThreadWhenItsOwnerEnds) {
    for (int (*pass)() : {SelSelect, SelEpoll}) {
        if (pass == SelEpoll) {
            ASSERT_EQ(SelUseEpoll(), 0);
        }
        std::atomic<int> stage{0};
        auto await = [&stage](int s) {
            while (stage.load() < s) std::this_thread::yield();
        };
        std::thread owner([&] {
            EXPECT_TRUE(SelInit() == 0 && SelDebugIsTimerActive(&fd_timer) == 1);
            stage = 1, await(3);
        });
        int holds[2] = {-1, -1};
        std::vector<std::thread> others;
        for (int i = 0; i < 2; ++i)
            others.emplace_back([&, i] {
                await(1);
                EXPECT_TRUE(SelInit() == 0 && SelDebugIsTimerActive(&fd_timer) == 0) << "one owner at a time";
                stage.fetch_add(1), await(4);
                SelTimer due{};
                due.callback = [](SelTimer *) { return 0; }; /* host.log is not for threads */
                EXPECT_TRUE(SelSleep(&due, 0) == 0 && pass() == 0);
                holds[i] = SelDebugIsTimerActive(&fd_timer);
                stage.fetch_add(1), await(6); /* both passes done before either thread ends */
            });
        owner.join();
        stage = 4;
        for (auto &t : others) t.join();
        EXPECT_EQ(holds[0] + holds[1], 1) << (pass == SelSelect ? "select" : "epoll");
    }
}
