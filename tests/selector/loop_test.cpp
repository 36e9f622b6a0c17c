/* SelSelect, SelEpoll and zarn_select against the scripted host and real descriptors. */
#include <netinet/in.h>
#include <poll.h>

#include <tuple>
#include <utility>

#include "selector/dispatch_private.h"
#include "selector_fixture.h"

using namespace qorbu::test;

namespace {
enum Act { Keep, AddSelf, RemoveSelf, Reregister, RemoveOther, Nest };
int act(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    static int depth = 0;
    switch (*static_cast<Act *>(arg)) {
    case Keep: break;
    case AddSelf: EXPECT_EQ(OUTCOME(watch(fd)), failure(EBUSY)); break;
    case RemoveSelf: EXPECT_EQ(SelRemFD(fd), 0); break;
    case Reregister: EXPECT_TRUE(SelRemFD(fd) == 0 && watch(fd, SEL_WRITE) == 0); break;
    case RemoveOther: EXPECT_EQ(SelRemFD(42), 0); break;
    case Nest:
        EXPECT_TRUE(depth++ > 0 || SelSelect() == 0), --depth;
        break; /* from the outermost call only */
    }
    return log_fd(fd, event, arg, entry);
}
/* Logs "ok" for the event bit that arg names, the descriptor's event otherwise. */
int expect_event(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    return event == reinterpret_cast<uintptr_t>(arg) ? (host.log.push_back("ok"), 0)
                                                     : log_fd(fd, event, arg, entry);
}
/* arg: two ready descriptors and an idle one. The first served puts the idle
 * one under the other's number and registers that. */
int swap_partner(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    static bool done = false;
    const int *fds = static_cast<int *>(arg), partner = fds[fds[0] == fd ? 1 : 0];
    EXPECT_TRUE(std::exchange(done, true) || (SelRemFD(partner) == 0 && dup2(fds[2], partner) == partner &&
                                              watch(partner, SEL_READ, swap_partner, arg) == 0));
    return log_fd(fd, event, arg, entry);
}

} // namespace

TEST_F(SelectorTest, ReadyDescriptorIsServedAfterThePollThenTimersThenTheHost) {
    SelSetZG(&host.context);
    host.queued = host.queued_by_select_nb = 1;
    host.due(0, {999, 0}); /* overdue: a wait would read the host's clock */
    Pipe p(40);
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    bound_wait(0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(logged(), "task drained info 40:r timer nb task drained");
    ASSERT_EQ(SelRemFD(p.r), 0);
    bound_wait(0), host.log.clear();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(logged(), "drained info timer") << "a due timer ends the pass";
    SelHostContext no_scheduler{nullptr};
    SelSetZG(&no_scheduler), bound_wait(0), host.log.clear();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(logged(), "info timer") << "host hooks stay off without a host scheduler";
}

TEST_F(SelectorTest, WaitEndsAtTheEarliestTimeoutAndOnlyAnSnmpOneServicesSnmp) {
    SelSetZG(&host.context);
    const std::string waited = "drained info drained clock info nb drained",
                      no_host = "drained info drained info ";
    /* host task due, SNMP time-out, timer; a tie keeps the host's, an overdue task waits for nothing */
    using Case = std::tuple<timeval, timeval, unsigned, std::string>;
    for (auto [due, snmp, timer_ms, log] :
         {Case{{1000, 40000}, {0, 40000}, 0, waited},
          Case{{1000, 40000}, {0, 39999}, 0, waited + " snmp_timeout alarms"},
          Case{{999, 0}, {2, 0}, 0, waited},
          Case{{}, {0, -5000}, 0, no_host + "nb drained snmp_timeout alarms"},
          Case{{}, {20, 0}, 30, no_host + "timer nb drained"}}) {
        SCOPED_TRACE(log);
        SelRemoveAllTimers();
        if (timer_ms != 0) bound_wait(timer_ms);
        host.scheduler.timed[1] = host.scheduler.timed[2] = nullptr;
        if (due.tv_sec != 0) host.due(1, {1000, 900000}), host.due(2, due);
        host.snmp_blocks = false, host.snmp_timeout = snmp, host.log.clear();
        testing::internal::CaptureStderr();
        EXPECT_EQ(SelSelect(), 0);
        EXPECT_EQ(testing::internal::GetCapturedStderr(),
                  snmp.tv_usec < 0 ? "tmeval in pselect -ve 0:-5000000\n" : "");
        EXPECT_EQ(logged(), log);
    }
}

TEST_F(SelectorTest, ExceptionalConditionFirstThenReadBeforeWriteThenRoundRobin) {
    Listener listener;
    const int client = socket(AF_INET, SOCK_STREAM, 0), server = 45; /* 45 gets urgent data */
    ASSERT_EQ(connect(client, listener.address(), sizeof listener.addr), 0);
    const int accepted = accept(listener.fd, nullptr, nullptr);
    ASSERT_TRUE(dup2(accepted, server) == server && close(accepted) == 0);
    ASSERT_TRUE(send(client, "ab", 2, 0) == 2 && send(client, "u", 1, MSG_OOB) == 1);
    pollfd urgent = {server, POLLPRI, 0};
    ASSERT_EQ(poll(&urgent, 1, 5000), 1);
    Pipe a(50), b(52);
    a.fill(), b.fill();
    for (auto [fd, events] : {std::pair{server, 7u}, {50, SEL_READ}, {52, SEL_READ}})
        ASSERT_EQ(watch(fd, events), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(ctx->scanStart, 46);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(ctx->scanStart, 51);
    EXPECT_EQ(logged(), "info 45:x 45:r 45:w 50:r 52:r info 45:x 50:r 52:r 45:r 45:w");
    close(server), close(client);
}

TEST_F(SelectorTest, CallbacksChangeRegistrationsDuringThePass) {
    /* what 40's callback does (Nest: 40 is skipped, the outer pass stops), the callbacks, 40's interest */
    using Case = std::tuple<Act, const char *, bool, bool>;
    for (auto [what, log, reads, writes] :
         {Case{Keep, "40:r 42:r", true, false}, Case{AddSelf, "40:r 42:r", true, false},
          Case{RemoveSelf, "40:r 42:r", false, false}, Case{Reregister, "40:r 42:r", false, true},
          Case{RemoveOther, "40:r", true, false}, Case{Nest, "info 42:r 40:r", true, false}}) {
        SCOPED_TRACE(what);
        Pipe a(40), b(42);
        a.fill(), b.fill();
        ASSERT_TRUE(watch(a.r, SEL_READ, act, &what) == 0 && watch(b.r) == 0);
        host.log.clear(), ctx->scanStart = 0;
        EXPECT_EQ(SelSelect(), 0);
        EXPECT_EQ(logged(), std::string("info ") + log);
        EXPECT_EQ(FD_ISSET(40, &ctx->readSet) != 0, reads);
        EXPECT_EQ(FD_ISSET(40, &ctx->writeSet) != 0, writes);
        SelRemFD(42), SelRemFD(40);
    }
}

TEST_F(SelectorTest, RegisteredSignalsAreUnblockedOnlyWhileALoopWaits) {
    struct sigaction counted {}; /* SIGUSR1 registered, SIGUSR2 blocked by the caller */
    counted.sa_handler = [](int signo) { handled[signo] = handled[signo] + 1; };
    sigset_t usr2;
    sigemptyset(&usr2), sigaddset(&usr2, SIGUSR2), sigprocmask(SIG_BLOCK, &usr2, nullptr);
    sigaction(SIGUSR1, &counted, nullptr), sigaction(SIGUSR2, &counted, nullptr);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    for (int (*pass)() : {SelSelect, SelEpoll}) {
        in_child([&] {
            Pipe p;
            p.fill();
            ASSERT_TRUE((pass == SelSelect || SelUseEpoll() == 0) && watch(p.r) == 0);
            pthread_kill(pthread_self(), SIGUSR1), pthread_kill(pthread_self(), SIGUSR2);
            EXPECT_EQ(pass(), 0);
            EXPECT_EQ(handled[SIGUSR1], 0) << "delivered although the pass did not wait";
            ASSERT_EQ(SelRemFD(p.r), 0);
            bound_wait(scaled(300, 1500));
            const Outcome waited = OUTCOME(pass()); /* epoll unblocks before its wait: 0 */
            EXPECT_TRUE(waited == failure(EINTR) || (pass == SelEpoll && waited.first == 0));
            EXPECT_EQ(handled[SIGUSR1], 1);
            EXPECT_EQ(handled[SIGUSR2], 0) << "the caller's own blocked signal was let through";
            EXPECT_TRUE(blocked(SIGUSR1) && blocked(SIGUSR2)) << "the mask was not restored";
        });
    }
}

TEST_F(SelectorTest, HostAndSnmpDescriptorsWidenTheWait) {
    SelSetZG(&host.context);
    Pipe mine(40), theirs(60);
    ASSERT_EQ(watch(mine.r), 0);
    theirs.fill();
    FD_SET(60, &host.scheduler.readfd);
    host.scheduler.max_fd = 60;
    bound_wait(1000); /* ends the wait should 60 be missed */
    qorbu::sel::sel_einval_count = 3;
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(qorbu::sel::sel_einval_count, 0) << "the ready pair of the host's 60 was not left over";
    host.scheduler.max_fd = 59, host.snmp_count = 61, host.log.clear();
    FD_SET(60, &host.snmp_set);
    bound_wait(1000);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(logged(), "drained info nb drained snmp_read");
}

/* A closed descriptor ends the process, and so does the fifth refused wait.
 * The four before report the wait's width: hosts and Net-SNMP may report
 * descriptors past FD_SETSIZE, but the wait never gets wider than the sets. */
TEST_F(SelectorTest, FailedWaitsAbortAtAClosedDescriptorOrTheFifthEinval) {
    Pipe p(40), hosts(41);
    ASSERT_EQ(watch(p.r), 0);
    close(40);
    EXPECT_DEATH(SelSelect(), "SelSelect\\(\\): fd 40 \\(callback 0x[0-9a-f]+\\) is invalid");
    ASSERT_EQ(SelRemFD(40), 0);
    SelRemoveAllTimers();
    SelSetZG(&host.context);
    host.snmp_blocks = false, host.snmp_timeout = {0, 1500000}; /* the kernel refuses 1.5e9 ns */
    using Case = std::tuple<int, int, int>;                     /* Net-SNMP's count, host's max_fd, width */
    for (auto [count, max_fd, width] : {Case{2000, -1, 1024}, Case{FD_SETSIZE + 1, -1, 1024},
                                        Case{0, INT_MAX, 42}, Case{5000, INT_MAX, 1024}}) {
        host.snmp_count = count, host.scheduler.max_fd = max_fd;
        if (max_fd >= 0) FD_SET(41, &host.scheduler.readfd);
        testing::internal::CaptureStderr();
        EXPECT_EQ(OUTCOME(SelSelect()), failure(EINVAL));
        EXPECT_NE(testing::internal::GetCapturedStderr().find("select " + std::to_string(width) + " tl"),
                  std::string::npos)
            << count << " " << max_fd;
    }
    host.snmp_count = 0, host.scheduler.max_fd = -1;
    FD_ZERO(&host.scheduler.readfd);
    EXPECT_DEATH(SelSelect(),
                 "invalid params in select 1 tl fd 1 snmp fd 0 fdsetsize 1024 timeval 0:1500000000");
}

TEST_F(SelectorTest, ZarnSelectRefusesClosedDescriptorsAndTakesAnyTimeout) {
    Pipe ready;
    ready.fill();
    const int closed = dup(ready.w), timers = ctx->timerCount;
    close(closed);
    fd_set r{};
    FD_SET(ready.r, &r), FD_SET(closed, &r);
    timeval none{0, 0};
    EXPECT_EQ(OUTCOME(zarn_select(std::max(ready.r, closed) + 1, &r, nullptr, nullptr, &none)),
              failure(EBADF));
    EXPECT_TRUE(ctx->nfds <= 1 && ctx->timerCount == timers) << "a registration or the timer stayed";
    for (timeval timeout : {timeval{0, 2500000}, timeval{LONG_MAX, 0}, timeval{LONG_MAX, 999999}}) {
        FD_ZERO(&r);
        FD_SET(ready.r, &r);
        EXPECT_EQ(zarn_select(ready.r + 1, &r, nullptr, nullptr, &timeout), 1) << timeout.tv_sec;
    }
    timespec now, when;
    SelGetTime(&now);
    for (auto [sec, nsec] :
         {std::pair{0L, 1999999999L}, std::pair{LONG_MAX, 0L}, std::pair{LONG_MAX, LONG_MAX}})
        EXPECT_TRUE(SelMakeWhen(&when, sec, nsec) == 0 && when.tv_nsec >= 0 && when.tv_nsec < 1000000000 &&
                    when.tv_sec >= now.tv_sec + 1)
            << sec;
}

TEST_F(SelectorTest, ZarnSelectReportsLikeSelectAndLeavesNoTrace) {
    SocketPair both; /* fd[0] readable and writable */
    Pipe idle;
    ASSERT_EQ(write(both.fd[1], "x", 1), 1);
    const int timers = ctx->timerCount;
    using Case = std::tuple<int, bool, bool, timeval, int>; /* descriptor, read?, write?, time-out, result */
    for (auto [fd, read, write, timeout, result] :
         {Case{both.fd[0], true, true, {5, 0}, 2}, Case{both.fd[0], false, true, {5, 0}, 1},
          Case{idle.r, true, false, {}, 0}}) {
        fd_set r{}, w{};
        FD_SET(1000, &r); /* above nfds: cleared as well */
        if (read) FD_SET(fd, &r);
        if (write) FD_SET(fd, &w);
        EXPECT_EQ(zarn_select(fd + 1, &r, &w, nullptr, &timeout), result);
        EXPECT_TRUE(FD_ISSET(fd, &r) == (read && result) && FD_ISSET(fd, &w) == (write && result) &&
                    !FD_ISSET(1000, &r));
        EXPECT_TRUE(ctx->nfds <= 1 && ctx->timerCount == timers) << "a registration or the timer stayed";
    }
}

TEST_F(SelectorTest, EpollGivesEachReadyDescriptorOneEventBitThenRunsTimers) {
    ASSERT_EQ(SelUseEpoll(), 0);
    SocketPair wants_write, wants_both; /* fd[0] of each: readable and writable */
    Pipe idle, data_hangup, hangup, broken;
    for (int fd : {wants_write.fd[1], wants_both.fd[1], data_hangup.w}) ASSERT_EQ(write(fd, "x", 1), 1);
    close(data_hangup.w), close(hangup.w), close(broken.r), data_hangup.w = hangup.w = broken.r = -1;
    using Case = std::tuple<int, unsigned, uintptr_t>; /* descriptor, registered mask, reported bit */
    for (auto [fd, events, bit] :
         {Case{wants_write.fd[0], SEL_WRITE, SEL_WRITE}, Case{wants_both.fd[0], 3, SEL_READ},
          Case{idle.r, SEL_READ, 0}, Case{data_hangup.r, SEL_READ, SEL_READ},
          Case{hangup.r, SEL_READ, SEL_EXCEPT}, Case{broken.w, SEL_READ, SEL_EXCEPT}})
        ASSERT_EQ(watch(fd, events, expect_event, reinterpret_cast<void *>(bit)), 0);
    bound_wait(0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(logged(), "ok ok ok ok ok timer") << "one callback each, then the expiry run";
    const int table = ctx->fdTableSize; /* numbers that cannot be open descriptors grow nothing */
    EXPECT_EQ(OUTCOME(SelAddFD(INT_MAX - 1, SEL_READ, 0, log_fd, nullptr)), failure(EBUSY));
    EXPECT_TRUE(SelRemFD(INT_MAX - 1) == -1 && SelGetFDArg(INT_MAX - 1) == nullptr &&
                ctx->fdTableSize == table);
}

TEST_F(SelectorTest, EpollDropsTheBatchEventsOfARemovedDescriptor) {
    ASSERT_EQ(SelUseEpoll(), 0);
    Pipe a, b, idle;
    a.fill(), b.fill();
    int fds[] = {a.r, b.r, idle.r};
    for (int fd : {a.r, b.r}) ASSERT_EQ(watch(fd, SEL_READ, swap_partner, fds), 0);
    EXPECT_EQ(SelEpoll(), 0);
    EXPECT_EQ(host.log.size(), 1u) << "an event of the removed registration reached the new one";
}

TEST_F(SelectorTest, EpollWaitLastsUntilTheEarliestTimerAtMost) {
    ASSERT_EQ(SelUseEpoll(), 0);
    ASSERT_EQ(SelRemoveAllTimers(), 1);
    in_child([&] { /* the green threads' loop with one timer; the alarm bounds it */
                   bound_wait(50);
                   while (host.log.empty()) ASSERT_EQ(qorbu::sel::epoll_pass(true), 0);
    });
    timespec odd; /* a caller's deadline with negative nanoseconds, then none at all */
    SelGetTime(&odd);
    odd = {odd.tv_sec + 1, -1500000000}, guard.callback = log_timer;
    ASSERT_EQ(SelModifyTimer(&guard, &odd), 0);
    in_child([&] { EXPECT_EQ(SelEpoll(), 0); });
    SelRemTimer(&guard);
    in_child([&] { EXPECT_EQ(SelEpoll(), 0); });
}
