/* SelSelect and zarn_select against the scripted host and real descriptors. */
#include <netinet/in.h>
#include <poll.h>

#include <algorithm>

#include "selector/dispatch_private.h"
#include "selector_fixture.h"

using namespace qorbu::test;
using qorbu::sel::sel_einval_count;

namespace {

enum class Act { Keep, AddSelf, RemoveSelf, Reregister, RemoveOther };

int act(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_fd(fd, event, arg, entry);
    switch (*static_cast<Act *>(arg)) {
    case Act::AddSelf: EXPECT_EQ(OUTCOME(SelAddFD(fd, SEL_READ, 0, log_fd, nullptr)), failure(EBUSY)); break;
    case Act::Reregister:
        EXPECT_EQ(SelRemFD(fd), 0);
        EXPECT_EQ(SelAddFD(fd, SEL_WRITE, 0, log_fd, nullptr), 0);
        break;
    case Act::RemoveSelf: EXPECT_EQ(SelRemFD(fd), 0); break;
    case Act::RemoveOther: EXPECT_EQ(SelRemFD(42), 0); break;
    case Act::Keep: break;
    }
    return 0;
}

/* Runs a nested pass from the outermost callback, then takes its byte. */
int nest(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    static int depth = 0;
    log_fd(fd, event, arg, entry);
    if (depth++ == 0) {
        EXPECT_EQ(SelSelect(), 0);
    }
    --depth;
    char byte;
    EXPECT_EQ(read(fd, &byte, 1), 1) << fd << " dispatched for readiness already consumed";
    return 0;
}

} // namespace

TEST_F(SelectorTest, ReadyDescriptorIsServedAfterThePollThenTimersThenTheHost) {
    SelSetZG(&host.context);
    host.queued = host.queued_by_select_nb = 1;
    host.due(0, {999, 0}); /* overdue: a wait would consult the host clock */
    Pipe p(40);
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    bound_wait(0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(host.log,
              (Log{"task", "drained", "snmp info", "40:r", "timer", "select_nb", "task", "drained"}));

    ASSERT_EQ(SelRemFD(p.r), 0);
    bound_wait(0);
    host.log.clear();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(host.log, (Log{"drained", "snmp info", "timer"})) << "a due timer ends the pass";
}

TEST_F(SelectorTest, WaitEndsAtTheEarliestTimeoutAndOnlyAnSnmpOneServicesSnmp) {
    SelSetZG(&host.context);
    const Log host_first = {"drained",   "snmp info", "drained", "host clock",
                            "snmp info", "select_nb", "drained"};
    Log snmp_first = host_first;
    snmp_first.insert(snmp_first.end(), {"snmp timeout", "alarms"});
    struct Case {
        timeval host_due, snmp;
        unsigned timer_ms;
        Log log;
        const char *stderr_text;
    };
    const Case cases[] = {
        {{1000, 40000}, {0, 40000}, 0, host_first, ""}, /* tie: the host's stays chosen */
        {{1000, 40000}, {0, 39999}, 0, snmp_first, ""},
        {{999, 0}, {2, 0}, 0, host_first, ""}, /* an overdue host task: no wait */
        {{},
         {0, -5000},
         0,
         {"drained", "snmp info", "drained", "snmp info", "select_nb", "drained", "snmp timeout", "alarms"},
         "tmeval in pselect -ve 0:-5000000\n"},
        {{},
         {20, 0},
         30,
         {"drained", "snmp info", "drained", "snmp info", "timer", "select_nb", "drained"},
         ""},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(testing::Message() << "host " << c.host_due.tv_usec << " snmp " << c.snmp.tv_usec);
        SelRemoveAllTimers();
        if (c.timer_ms != 0) bound_wait(c.timer_ms);
        host.scheduler.timed[1] = host.scheduler.timed[2] = nullptr;
        if (c.host_due.tv_sec != 0) host.due(1, {1000, 900000}), host.due(2, c.host_due);
        host.snmp_blocks = false, host.snmp_timeout = c.snmp;
        host.log.clear();
        testing::internal::CaptureStderr();
        EXPECT_EQ(SelSelect(), 0);
        EXPECT_EQ(testing::internal::GetCapturedStderr(), c.stderr_text);
        EXPECT_EQ(host.log, c.log);
    }
}

TEST_F(SelectorTest, ExceptionalConditionFirstThenReadBeforeWriteThenRoundRobin) {
    Listener listener;
    const int client = socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_EQ(connect(client, listener.address(), sizeof listener.addr), 0);
    pollfd pending = {listener.fd, POLLIN, 0};
    ASSERT_EQ(poll(&pending, 1, 5000), 1);
    const int server = accept(listener.fd, nullptr, nullptr);
    ASSERT_EQ(send(client, "ab", 2, 0), 2);
    ASSERT_EQ(send(client, "u", 1, MSG_OOB), 1);
    pollfd urgent = {server, POLLPRI, 0};
    ASSERT_EQ(poll(&urgent, 1, 5000), 1);
    Pipe a(50), b(52);
    a.fill(), b.fill();
    ASSERT_EQ(watch(server, SEL_READ | SEL_WRITE | SEL_EXCEPT), 0);
    ASSERT_EQ(watch(a.r), 0);
    ASSERT_EQ(watch(b.r), 0);
    ctx->scanStart = 0;
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(ctx->scanStart, server + 1);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(ctx->scanStart, 51);
    const std::string s = std::to_string(server);
    EXPECT_EQ(callbacks(), (Log{s + ":x", s + ":r", s + ":w", "50:r", "52:r", s + ":x", "50:r", "52:r",
                                s + ":r", s + ":w"}));
    close(server), close(client);
}

TEST_F(SelectorTest, CallbacksChangeRegistrationsDuringThePass) {
    struct Case {
        Act act;
        Log calls;
        bool reads, writes; /* descriptor 40's interest afterwards */
    } cases[] = {
        {Act::Keep, {"40:r", "42:r"}, true, false},        {Act::AddSelf, {"40:r", "42:r"}, true, false},
        {Act::RemoveSelf, {"40:r", "42:r"}, false, false}, {Act::Reregister, {"40:r", "42:r"}, false, true},
        {Act::RemoveOther, {"40:r"}, true, false},
    };
    for (Case &c : cases) {
        SCOPED_TRACE(static_cast<int>(c.act));
        Pipe a(40), b(42);
        a.fill(), b.fill();
        ASSERT_EQ(watch(a.r, SEL_READ, act, &c.act), 0);
        ASSERT_EQ(watch(b.r), 0);
        host.log.clear(), ctx->scanStart = 0;
        EXPECT_EQ(SelSelect(), 0);
        EXPECT_EQ(callbacks(), c.calls);
        EXPECT_EQ(FD_ISSET(40, &ctx->readSet) != 0, c.reads);
        EXPECT_EQ(FD_ISSET(40, &ctx->writeSet) != 0, c.writes);
        SelRemFD(42), SelRemFD(40);
    }
}

TEST_F(SelectorTest, NestedPassSkipsTheRunningDescriptorAndLeavesTheOuterPassNothingStale) {
    Pipe a(40), b(42);
    for (Pipe *p : {&a, &b}) {
        set_nonblocking(p->r);
        p->fill();
        ASSERT_EQ(watch(p->r, SEL_READ, nest), 0);
    }
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks(), (Log{"40:r", "42:r"}));
}

TEST_F(SelectorTest, RegisteredSignalsAreUnblockedOnlyWhileTheSelectLoopWaits) {
    pend_two_signals();
    Pipe p;
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(handled[SIGUSR1], 0) << "delivered although the pass did not wait";
    ASSERT_EQ(SelRemFD(p.r), 0);
    in_child([&] {
        pthread_kill(pthread_self(), SIGUSR1),
            pthread_kill(pthread_self(), SIGUSR2); /* a child starts with none */
        bound_wait(scaled(1000, 3000));
        EXPECT_EQ(OUTCOME(SelSelect()), failure(EINTR));
        EXPECT_EQ(handled[SIGUSR1], 1);
        EXPECT_EQ(handled[SIGUSR2], 0) << "the caller's own blocked signal was let through";
        EXPECT_TRUE(blocked(SIGUSR1) && blocked(SIGUSR2));
    });
}

TEST_F(SelectorTest, HostAndSnmpDescriptorsWidenTheWait) {
    SelSetZG(&host.context);
    Pipe mine(40), theirs(60);
    ASSERT_EQ(watch(mine.r), 0);
    theirs.fill();
    FD_SET(60, &host.scheduler.readfd);
    host.scheduler.max_fd = 60;
    bound_wait(1000); /* ends the wait should 60 be missed */
    sel_einval_count = 3;
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(sel_einval_count, 0) << "the ready pair of the host's 60 was not left over";

    host.scheduler.max_fd = 59, host.snmp_count = 61;
    FD_SET(60, &host.snmp_set);
    bound_wait(1000);
    host.log.clear();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(std::count(host.log.begin(), host.log.end(), "snmp read"), 1);
    EXPECT_EQ(std::count(host.log.begin(), host.log.end(), "host clock"), 0);
}

TEST_F(SelectorTest, ClosedRegisteredDescriptorIsNamedThenTheProcessAborts) {
    Pipe p(40);
    ASSERT_EQ(watch(p.r), 0);
    close(40);
    EXPECT_DEATH(SelSelect(), "SelSelect\\(\\): fd 40 \\(callback 0x[0-9a-f]+\\) is invalid");
}

TEST_F(SelectorTest, FifthWaitFailingWithEinvalAborts) {
    SelRemoveAllTimers();
    host.snmp_blocks = false, host.snmp_timeout = {0, 1500000}; /* the kernel refuses 1.5e9 ns */
    for (int i = 0; i < 4; ++i) EXPECT_EQ(OUTCOME(SelSelect()), failure(EINVAL));
    EXPECT_DEATH(SelSelect(),
                 "invalid params in select 0 tl fd 0 snmp fd 0 fdsetsize 1024 timeval 0:1500000000");
}

TEST_F(SelectorTest, ZarnSelectReportsLikeSelectAndLeavesNoTrace) {
    SocketPair both; /* fd[0] readable and writable */
    ASSERT_EQ(write(both.fd[1], "x", 1), 1);
    Pipe idle;
    const int timers = ctx->timerCount;
    struct Case {
        int fd;
        bool read, write;
        timeval timeout;
        int result;
    } cases[] = {{both.fd[0], true, true, {5, 0}, 2},
                 {both.fd[0], false, true, {5, 0}, 1},
                 {idle.r, true, false, {0, 0}, 0}};
    for (Case &c : cases) {
        SCOPED_TRACE(c.result);
        fd_set r, w;
        FD_ZERO(&r);
        FD_ZERO(&w);
        FD_SET(1000, &r); /* above nfds: cleared as well */
        if (c.read) FD_SET(c.fd, &r);
        if (c.write) FD_SET(c.fd, &w);
        EXPECT_EQ(zarn_select(c.fd + 1, &r, &w, nullptr, &c.timeout), c.result);
        EXPECT_EQ(FD_ISSET(c.fd, &r) != 0, c.read && c.result > 0);
        EXPECT_EQ(FD_ISSET(c.fd, &w) != 0, c.write && c.result > 0);
        EXPECT_FALSE(FD_ISSET(1000, &r));
        EXPECT_LE(ctx->nfds, 1) << "a temporary registration stayed";
        EXPECT_EQ(ctx->timerCount, timers) << "the time-out timer stayed armed";
    }
    timeval one_ms = {0, 1000};
    EXPECT_EQ(zarn_select(0, nullptr, nullptr, nullptr, &one_ms), 0);
}
