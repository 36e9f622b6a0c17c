/* The descriptor registry's bookkeeping, argument checks and the reaper. */
#include "selector_fixture.h"

using namespace qorbu::test;

TEST_F(SelectorTest, InterestSetsAndNfdsFollowRegistrations) {
    struct Step {
        int fd;
        unsigned events;
        bool remove;
        int nfds;
    };
    const Step steps[] = {{3, SEL_READ, false, 4}, {9, SEL_WRITE | SEL_EXCEPT, false, 10},
                          {5, 0, false, 10},       {7, SEL_READ | SEL_WRITE | SEL_EXCEPT, false, 10},
                          {3, 0, true, 10},        {9, 0, true, 8},
                          {7, 0, true, 1},         {5, SEL_WRITE, false, 6},
                          {5, 0, true, 1}};
    unsigned registered[10] = {};
    for (const Step &s : steps) {
        SCOPED_TRACE(testing::Message() << "fd " << s.fd << (s.remove ? " removed" : " added"));
        ASSERT_EQ(s.remove ? SelRemFD(s.fd) : watch(s.fd, s.events, log_fd, &registered[s.fd]), 0);
        registered[s.fd] = s.remove ? 0 : s.events;
        EXPECT_EQ(ctx->nfds, s.nfds);
        EXPECT_EQ(SelGetFDArg(s.fd), s.fd < s.nfds ? &registered[s.fd] : nullptr)
            << "the last registration's";
        for (int fd = 0; fd < 10; ++fd) {
            EXPECT_EQ(FD_ISSET(fd, &ctx->readSet) != 0, (registered[fd] & SEL_READ) != 0) << fd;
            EXPECT_EQ(FD_ISSET(fd, &ctx->writeSet) != 0, (registered[fd] & SEL_WRITE) != 0) << fd;
            EXPECT_EQ(FD_ISSET(fd, &ctx->exceptSet) != 0, (registered[fd] & SEL_EXCEPT) != 0) << fd;
        }
    }
}

TEST_F(SelectorTest, BadArgumentsAreRefusedWithTheirErrno) {
    int arg = 0;
    ASSERT_EQ(watch(3, SEL_READ, log_fd, &arg), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    const std::pair<Outcome, Outcome> cases[] = {
        {OUTCOME(SelAddFD(5, SEL_IN_CALLBACK, 0, log_fd, nullptr)), failure(EINVAL)},
        {OUTCOME(SelAddFD(-1, SEL_READ, 0, log_fd, nullptr)), failure(EINVAL)},
        {OUTCOME(SelAddFD(3, SEL_WRITE, 0, log_fd, nullptr)), failure(EBUSY)},
        {OUTCOME(SelRemFD(4)), failure(EINVAL)},
        {OUTCOME(SelRemFD(-1)), failure(EINVAL)},
        {OUTCOME(SelGetFDArg(4) == nullptr), Outcome(1, EINVAL)},
        {OUTCOME(SelGetFDArg(3) == &arg), Outcome(1, 0)},
        {OUTCOME(SelAddSignal(0)), failure(EINVAL)},
        {OUTCOME(SelAddSignal(65)), failure(EINVAL)},
        {OUTCOME(SelAddSignal(SIGUSR1)), failure(EINVAL)},
        {OUTCOME(SelRemSignal(SIGUSR2)), failure(EINVAL)},
        {OUTCOME(SelRemSignal(SIGUSR1)), Outcome(0, 0)},
        {OUTCOME(SelRemSignal(SIGUSR1)), failure(EINVAL)},
    };
    for (size_t i = 0; i < std::size(cases); ++i) EXPECT_EQ(cases[i].first, cases[i].second) << "case " << i;
    EXPECT_FALSE(blocked(SIGUSR1));
}

TEST_F(SelectorTest, ReaperClosesTrackedReadDescriptorsIdleForMoreThan25Seconds) {
    timespec soon;
    SelMakeWhen(&soon, 29, 0);
    EXPECT_TRUE(fd_timer.heapIndex != 0 && soon.tv_sec <= fd_timer.when.tv_sec)
        << "armed 30 s ahead by SelInit";
    Pipe idle26, idle25, untracked, write_only;
    for (int fd : {idle26.r, idle25.r}) ASSERT_EQ(SelAddFD(fd, SEL_READ, 1, log_fd, nullptr), 0);
    ASSERT_EQ(SelAddFD(untracked.r, SEL_READ, 0, log_fd, nullptr), 0);
    ASSERT_EQ(SelAddFD(write_only.w, SEL_WRITE, 1, log_fd, nullptr), 0);
    for (auto [fd, idle] : {std::pair{idle26.r, 26}, {idle25.r, 25}, {untracked.r, 60}, {write_only.w, 60}})
        ctx->fdTable[fd].lastActivity.tv_sec -= idle;

    const timespec due = {0, 0};
    ASSERT_EQ(SelModifyTimer(&fd_timer, &due), 0);
    EXPECT_EQ(SelRunTimers(ctx), 1);
    EXPECT_EQ(OUTCOME(fcntl(idle26.r, F_GETFD)), failure(EBADF));
    EXPECT_FALSE(FD_ISSET(idle26.r, &ctx->readSet));
    idle26.r = -1;
    for (int fd : {idle25.r, untracked.r, write_only.w}) EXPECT_NE(fcntl(fd, F_GETFD), -1) << fd;
    EXPECT_TRUE(fd_timer.heapIndex != 0 && soon.tv_sec <= fd_timer.when.tv_sec) << "re-armed 30 s ahead";
    EXPECT_TRUE(host.log.empty());
}
