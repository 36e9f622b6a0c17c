/* SelSelect against the scripted host: the order of a pass, the choice of
 * the time-out, dispatch order, signals and the wait-failure paths. */
#include <arpa/inet.h>
#include <netinet/in.h>

#include <sys/resource.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <thread>

#include "dispatch_fixture.h"
#include "selector/dispatch_private.h"

using namespace dispatch_test;
using qorbu::sel::sel_einval_count;
using scripted::host;
using scripted::times;

namespace {

constexpr double kGenerousLimit = 8.0; /* seconds; far below the waits a fault would cause */

/* A POSIX extended regex that matches the text literally. */
std::string literal_regex(const std::string &text) {
    std::string out;
    for (char c : text) {
        if (std::string("\\^$.|?*+()[]{}").find(c) != std::string::npos) out += '\\';
        out += c;
    }
    return out;
}

int remove_descriptor_41(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    EXPECT_EQ(SelRemFD(41), 0);
    return 0;
}

int reregister_for_except(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    EXPECT_EQ(SelRemFD(fd), 0);
    EXPECT_EQ(SelAddFD(fd, SEL_EXCEPT, 0, log_callback, nullptr), 0);
    return 0;
}

/* Consumes the byte that made a non-blocking pipe readable. */
int consume_byte(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    log_callback(fd, event, arg, entry);
    char byte;
    EXPECT_EQ(read(fd, &byte, 1), 1) << "dispatched for readiness that is gone";
    return 0;
}

/* Runs the nested pass that arg names: SelSelect, or zarn_select on 42. */
int run_nested_pass(int fd, unsigned event, void *arg, SelFdEntry *entry) {
    consume_byte(fd, event, nullptr, entry);
    if (arg == nullptr) return SelSelect();
    fd_set r;
    FD_ZERO(&r);
    FD_SET(42, &r);
    struct timeval timeout = {10, 0};
    EXPECT_EQ(zarn_select(43, &r, nullptr, nullptr, &timeout), 1);
    return 0;
}

using SelectPass = DispatchTest;
using SelectDispatch = DispatchTest;
using SelectFailures = DispatchTest;

} // namespace

/* --- order of a pass and the choice of the time-out ------------------------ */

TEST_F(SelectPass, PollDispatchesBeforeTimersAndServicingAndADueTimerEndsThePass) {
    use_host();
    scripted::set_timed(0, {1010, 0}); /* would need the host clock if the pass waited */
    give_snmp_timeout(5, 0);
    Pipe p(40);
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    arm_guard_timer(0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(log(), (Log{"empty", "snmp_info", cb(40, "r"), "timer:guard", "select_nb", "empty"}));

    /* Nothing ready: the due timer ends the pass before any wait or servicing. */
    ASSERT_EQ(SelRemFD(p.r), 0);
    scripted::set_timed(0, {999, 0}); /* already due: would force a zero wait */
    arm_guard_timer(0);
    clear_log();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(log(), (Log{"empty", "snmp_info", "timer:guard"}));
    EXPECT_TRUE(host().snmpInputsAsAgreed);
}

TEST_F(SelectPass, TimedOutPassDrainsHostQueueAtEachStepAndServicesSnmpLast) {
    use_host();
    SelRemoveAllTimers();
    host().queue.push_back(1);
    host().onSelectNb = [] { host().queue.push_back(2); };
    scripted::set_timed(0, {1000, 500000});
    scripted::set_timed(2, {1000, 50000}); /* earliest: 50 ms ahead of the host clock */
    scripted::set_timed(3, {1000, 50000}); /* equal: the earlier list's stays */
    give_snmp_timeout(0, 30000);           /* strictly before the host's 50 ms */

    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(log(), (Log{"call:1", "empty", "snmp_info", "empty", "tzcurrent", "snmp_info", "select_nb",
                          "call:2", "empty", "snmp_timeout", "run_alarms"}));
    ASSERT_EQ(host().subArgs.size(), 1u);
    EXPECT_EQ(host().subArgs[0].tv_usec, 50000);
    EXPECT_TRUE(host().callSawFetchedRecord);
    EXPECT_TRUE(host().snmpInputsAsAgreed);
}

TEST_F(SelectPass, HostTimeoutWinsTiesAndADueHostTaskGivesAZeroWait) {
    use_host();
    arm_guard_timer(20000);
    scripted::set_timed(1, {1000, 40000});
    give_snmp_timeout(0, 40000);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(times("snmp_timeout"), 0);
    host().snmpTimeout = {0, 39999}; /* one microsecond earlier wins */
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(times("snmp_timeout"), 1);
    EXPECT_EQ(times("run_alarms"), 1);

    /* Due exactly at the host clock, then overdue: no subtraction, a zero wait
     * chosen over the timer and over an equal (zero) SNMP time-out. */
    host().snmpTimeout = {0, 0};
    const size_t subs = host().subArgs.size();
    const auto start = Clock::now();
    for (struct timeval when : {host().now, timeval{998, 999999}}) {
        scripted::set_timed(3, when);
        EXPECT_EQ(SelSelect(), 0);
    }
    EXPECT_LT(seconds_since(start), kGenerousLimit);
    EXPECT_EQ(host().subArgs.size(), subs);
    EXPECT_EQ(times("snmp_timeout"), 1);
    EXPECT_EQ(times("select_nb"), 4);
}

TEST_F(SelectPass, EarliestOfTimerAndSnmpTimeoutIsChosenAndANegativeOneIsZeroed) {
    arm_guard_timer(30);
    give_snmp_timeout(20, 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(times("timer:guard"), 1);
    EXPECT_EQ(times("snmp_timeout"), 0);

    arm_guard_timer(20000);
    for (struct timeval snmp : {timeval{0, 20000}, timeval{0, -5000}}) {
        SCOPED_TRACE(snmp.tv_usec);
        give_snmp_timeout(snmp.tv_sec, snmp.tv_usec);
        clear_log();
        testing::internal::CaptureStderr();
        const auto start = Clock::now();
        EXPECT_EQ(SelSelect(), 0);
        EXPECT_EQ(testing::internal::GetCapturedStderr(),
                  snmp.tv_usec < 0 ? "tmeval in pselect -ve 0:-5000000\n" : "");
        EXPECT_LT(seconds_since(start), kGenerousLimit);
        EXPECT_EQ(log(), (Log{"snmp_info", "snmp_info", "snmp_timeout", "run_alarms"}));
    }
}

TEST_F(SelectPass, WithoutAnyTimeoutSourceTheWaitLastsUntilADescriptorIsReady) {
    ASSERT_EQ(SelRemoveAllTimers(), 1); /* the reaper's */
    Pipe p(40);
    ASSERT_EQ(watch(p.r), 0);
    std::thread writer([&p] {
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        p.fill();
    });
    EXPECT_EQ(SelSelect(), 0);
    writer.join();
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")})) << "the wait ended before the descriptor was ready";
    EXPECT_EQ(times("snmp_timeout"), 0);
}

TEST_F(SelectPass, HostHooksStayOffWithoutHostContextOrScheduler) {
    SelHostContext noScheduler{nullptr};
    host().queue.push_back(1);
    scripted::set_timed(0, {999, 0});
    for (void *zg : {static_cast<void *>(&noScheduler), static_cast<void *>(nullptr)}) {
        SelSetZG(zg);
        Pipe p(40);
        p.fill();
        ASSERT_EQ(watch(p.r), 0);
        EXPECT_EQ(SelSelect(), 0);
        ASSERT_EQ(SelRemFD(p.r), 0);
    }
    /* The SNMP source is independent of the host context. */
    EXPECT_EQ(log(), (Log{"snmp_info", cb(40, "r"), "snmp_info", cb(40, "r")}));
    EXPECT_EQ(host().cmpCalls, 0);
    EXPECT_TRUE(host().subArgs.empty());
}

TEST_F(SelectPass, HostDescriptorsUpToMaxFdInclusiveAreWatched) {
    use_host();
    scripted::set_timed(0, {1010, 0});
    Pipe hostPipe(60);
    hostPipe.fill();
    FD_SET(60, &host().scheduler.readfd);
    host().scheduler.max_fd = 60;
    Pipe mine(40); /* registered but idle: nfds 41 is below the host descriptor */
    ASSERT_EQ(watch(mine.r), 0);
    sel_einval_count.store(3);

    EXPECT_EQ(SelSelect(), 0);
    /* Found by the poll: no time-out was computed, nothing was dispatched,
     * and the unspent ready pair reset the EINVAL counter. */
    EXPECT_EQ(log(), (Log{"empty", "snmp_info", "select_nb", "empty"}));
    EXPECT_EQ(sel_einval_count.load(), 0);

    host().scheduler.max_fd = 59; /* 60 is no longer examined */
    /* Long enough not to fall due before the poll even under emulation. */
    arm_guard_timer(2000);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(times("tzcurrent"), 1);
}

TEST_F(SelectPass, ReadableSnmpDescriptorGetsOneSnmpReadAndResetsTheEinvalCount) {
    Pipe snmpPipe(50), mine(40); /* 50 is ready but never dispatched: the pair stays unspent */
    host().snmpCount = 51;
    FD_SET(50, &host().snmpSet);
    snmpPipe.fill();
    sel_einval_count.store(2);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(sel_einval_count.load(), 0);
    EXPECT_EQ(times("snmp_read"), 1);
    EXPECT_EQ(host().lastSnmpReadArg, &ctx->readyRead);
    EXPECT_TRUE(FD_ISSET(50, &host().lastSnmpReadSet));

    char byte;
    ASSERT_EQ(read(snmpPipe.r, &byte, 1), 1);
    mine.fill();
    ASSERT_EQ(watch(mine.r), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(times("snmp_read"), 1);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")}));
}

TEST_F(SelectPass, RegisteredSignalIsDeliveredOnlyDuringTheBlockingWait) {
    use_host();
    register_counted_sigusr1();
    /* SIGUSR2 is the caller's own: blocked, unregistered, kept pending throughout. */
    struct sigaction sa {};
    sa.sa_handler = count_signal;
    ASSERT_EQ(sigaction(SIGUSR2, &sa, nullptr), 0);
    sigset_t usr2;
    sigemptyset(&usr2);
    sigaddset(&usr2, SIGUSR2);
    ASSERT_EQ(sigprocmask(SIG_BLOCK, &usr2, nullptr), 0);
    ASSERT_EQ(raise(SIGUSR2), 0);
    ASSERT_EQ(raise(SIGUSR1), 0); /* blocked: stays pending */
    Pipe p(40);
    p.fill();
    ASSERT_EQ(watch(p.r), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(g_handled, 0) << "delivered during the poll";

    ASSERT_EQ(SelRemFD(p.r), 0);
    arm_guard_timer(0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(g_handled, 0) << "delivered although a due timer ended the pass";

    arm_guard_timer(20000);
    const long servicedBefore = times("select_nb");
    errno = 0;
    EXPECT_EQ(SelSelect(), -1);
    EXPECT_EQ(errno, EINTR);
    sigset_t now;
    sigprocmask(SIG_BLOCK, nullptr, &now); /* ThreadSanitizer runs deferred handlers here */
    EXPECT_EQ(g_handled, 1) << "only the registered signal is unblocked for the wait";
    EXPECT_EQ(times("select_nb"), servicedBefore) << "no servicing after an interrupted wait";
    EXPECT_EQ(sigismember(&now, SIGUSR1), 1) << "blocked again after the wait";
    EXPECT_EQ(sigismember(&now, SIGUSR2), 1);
}

/* --- dispatch order ------------------------------------------------------ */

TEST_F(SelectDispatch, ReadScanIsRoundRobinAcrossPassesAndSpendingTheCountKeepsEinval) {
    Pipe a(40), b(42), c(44);
    for (Pipe *p : {&a, &b, &c}) {
        p->fill();
        ASSERT_EQ(watch(p->r), 0);
    }
    sel_einval_count.store(3);
    ASSERT_EQ(ctx->scanStart, 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r"), cb(42, "r"), cb(44, "r")}));
    EXPECT_EQ(ctx->scanStart, 41);
    EXPECT_EQ(sel_einval_count.load(), 3);

    clear_log();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(42, "r"), cb(44, "r"), cb(40, "r")}));
    EXPECT_EQ(ctx->scanStart, 43);
}

TEST_F(SelectDispatch, UrgentTcpDataFirstThenReadBeforeWrite) {
    const int listener = socket(AF_INET, SOCK_STREAM, 0), client = socket(AF_INET, SOCK_STREAM, 0),
              server = 45;
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof addr;
    auto *sa = reinterpret_cast<sockaddr *>(&addr);
    ASSERT_EQ(bind(listener, sa, len), 0);
    ASSERT_EQ(getsockname(listener, sa, &len), 0);
    ASSERT_EQ(listen(listener, 1), 0);
    ASSERT_EQ(connect(client, sa, len), 0);
    const int accepted = accept(listener, nullptr, nullptr);
    ASSERT_EQ(dup2(accepted, server), server);
    close(accepted);
    ASSERT_EQ(send(client, "a", 1, 0), 1);
    ASSERT_EQ(send(client, "!", 1, MSG_OOB), 1);
    fd_set oob;
    FD_ZERO(&oob);
    FD_SET(server, &oob);
    struct timeval wait = {10, 0};
    ASSERT_EQ(select(server + 1, nullptr, nullptr, &oob, &wait), 1) << "urgent data did not arrive";

    Pipe lower(40);
    lower.fill();
    ASSERT_EQ(watch(lower.r), 0);
    ASSERT_EQ(watch(server, SEL_READ | SEL_WRITE | SEL_EXCEPT), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(server, "x"), cb(40, "r"), cb(server, "r"), cb(server, "w")}));
    for (int fd : {server, client, listener}) close(fd);
}

TEST_F(SelectDispatch, CallbacksRemovingOrReRegisteringDescriptorsMidPass) {
    Pipe a(40), b(41);
    a.fill();
    b.fill();
    ASSERT_EQ(watch(a.r, SEL_READ, remove_descriptor_41), 0);
    ASSERT_EQ(watch(b.r), 0);
    sel_einval_count.store(3);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")})) << "41 was removed by the earlier callback";
    EXPECT_EQ(sel_einval_count.load(), 0) << "the unspent ready pair resets the counter";

    ASSERT_EQ(SelRemFD(a.r), 0);
    SocketPair s;
    ASSERT_EQ(watch(s.sv[0], SEL_READ | SEL_WRITE, reregister_for_except), 0);
    clear_log();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(s.sv[0], "r")})) << "the write interest was dropped mid-pass";
    EXPECT_TRUE(FD_ISSET(s.sv[0], &ctx->exceptSet));
    EXPECT_FALSE(FD_ISSET(s.sv[0], &ctx->readSet));
    EXPECT_FALSE(FD_ISSET(s.sv[0], &ctx->writeSet));
}

/* A host replacing select() runs passes inside callbacks: what the nested
 * pass served is not dispatched again by the outer one. */
TEST_F(SelectDispatch, NestedPassInACallbackLeavesNothingStaleToTheOuterPass) {
    for (bool viaZarnSelect : {false, true}) {
        SCOPED_TRACE(viaZarnSelect ? "zarn_select" : "SelSelect");
        Pipe outer(40), served(41), asked(42);
        for (Pipe *p : {&outer, &served, &asked}) {
            fcntl(p->r, F_SETFL, O_NONBLOCK);
            p->fill();
        }
        ASSERT_EQ(watch(40, SEL_READ, run_nested_pass, viaZarnSelect ? &asked : nullptr), 0);
        ASSERT_EQ(watch(41, SEL_READ, consume_byte), 0);
        ctx->scanStart = 0;
        clear_log();
        EXPECT_EQ(SelSelect(), 0);
        EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r"), cb(41, "r")}));
        ASSERT_EQ(SelRemFD(40), 0);
        ASSERT_EQ(SelRemFD(41), 0);
    }
}

/* --- wait failures --------------------------------------------------------- */

TEST_F(SelectFailures, ClosedDescriptorIsNamedWithItsCallbackThenAborts) {
    Pipe registered(40), hostOnly(50), healthy(42);
    ASSERT_EQ(watch(registered.r), 0);
    ASSERT_EQ(watch(healthy.r), 0);
    use_host();
    FD_SET(50, &host().scheduler.readfd);
    host().scheduler.max_fd = 50;
    close(registered.r);
    close(hostOnly.r);
    registered.r = hostOnly.r = -1;
    char callback[64];
    snprintf(callback, sizeof callback, "%p", reinterpret_cast<void *>(log_callback));
    EXPECT_DEATH(SelSelect(),
                 literal_regex(std::string("SelSelect(): [p]select() failed: Bad file descriptor\n"
                                           "SelSelect(): fd 40 (callback ") +
                               callback +
                               ") is invalid (probably close()ed)\n"
                               "SelSelect(): fd 50 (callback (nil)) is invalid (probably close()ed)\n"));
}

/* The wait never reaches past the 1024-bit working sets, whatever count the
 * host or Net-SNMP report (Net-SNMP counts sockets it cannot put in a set).
 * An invalid time-out makes each wait fail before it looks at the sets, and
 * the diagnostic shows the width it was given. */
TEST_F(SelectFailures, WaitWidthNeverExceedsTheSets) {
    give_snmp_timeout(0, 1500000);
    use_host();
    Pipe idle(40), hostPipe(60);
    ASSERT_EQ(watch(idle.r), 0);
    const struct {
        int snmpCount, maxFd, width;
    } cases[] = {
        {2000, -1, 1024}, {FD_SETSIZE + 1, -1, 1024}, {0, INT_MAX, 61}, {0, 5000, 61}, {5000, INT_MAX, 1024}};
    for (const auto &c : cases) {
        host().snmpCount = c.snmpCount;
        host().scheduler.max_fd = c.maxFd;
        FD_ZERO(&host().scheduler.readfd);
        if (c.maxFd >= 0) FD_SET(60, &host().scheduler.readfd);
        sel_einval_count.store(0);
        testing::internal::CaptureStderr();
        EXPECT_EQ(SelSelect(), -1);
        const std::string err = testing::internal::GetCapturedStderr();
        EXPECT_NE(err.find("invalid params in select " + std::to_string(c.width) + " "), std::string::npos)
            << c.snmpCount << " " << c.maxFd << ": " << err.substr(0, 160);
    }

    /* A real wait with descriptors open up to 1999 (where the limit allows):
     * served as usual, nothing past the sets read or written. */
    struct rlimit limit;
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
    limit.rlim_cur = std::max<rlim_t>(limit.rlim_cur, 2048);
    if (limit.rlim_cur > limit.rlim_max || setrlimit(RLIMIT_NOFILE, &limit) != 0) return;
    ASSERT_EQ(dup2(idle.w, 1999), 1999);
    host().giveSnmpTimeout = false;
    host().snmpCount = 2000;
    host().scheduler.max_fd = INT_MAX;
    idle.fill();
    clear_log();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")}));
    close(1999);
}

TEST_F(SelectFailures, EinvalCountIsSharedByThreadsAndTheFifthFailureAborts) {
    give_snmp_timeout(0, 1500000); /* 1.5e9 ns: the kernel refuses it */
    sel_einval_count.store(0);
    testing::internal::CaptureStderr();
    std::vector<std::thread> threads;
    for (int i = 0; i < 3; ++i)
        threads.emplace_back([] {
            ASSERT_EQ(SelInit(), 0);
            EXPECT_EQ(SelSelect(), -1);
        });
    for (auto &t : threads) t.join();
    testing::internal::GetCapturedStderr();
    EXPECT_EQ(sel_einval_count.load(), 3);

    sel_einval_count.store(0);
    Pipe idle(40);
    ASSERT_EQ(watch(idle.r), 0);
    for (int failure = 1; failure <= 4; ++failure) {
        testing::internal::CaptureStderr();
        errno = 0;
        EXPECT_EQ(SelSelect(), -1);
        EXPECT_EQ(errno, EINVAL);
        const std::string err = testing::internal::GetCapturedStderr();
        EXPECT_EQ(sel_einval_count.load(), failure);
        EXPECT_EQ(
            err.rfind("SelSelect(): [p]select() failed: Invalid argument\n"
                      "invalid params in select 41 tl fd 41 snmp fd 0 fdsetsize 1024 timeval 0:1500000000 \n"
                      "selreadset 0 0\tselwriteset 0\tseloobset 0\n"
                      "readset 0 0\twriteset 0\toobset 0\n"
                      "selreadset 1 100\tselwriteset 0\tseloobset 0\n"
                      "readset 1 100\twriteset 0\toobset 0\n",
                      0),
            0u)
            << err.substr(0, 300);
        EXPECT_EQ(std::count(err.begin(), err.end(), '\n'), 2 + 64);
    }
    EXPECT_EQ(times("snmp_timeout"), 0);
    EXPECT_DEATH(SelSelect(), literal_regex("SelSelect(): [p]select() failed: Invalid argument\n"));
}
