/* SelSelect against the scripted host: the order of a pass, the choice of
 * the time-out, dispatch order, signals and the wait-failure paths. */
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <signal.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <string>
#include <thread>

#include "dispatch_fixture.h"
#include "selector/dispatch_private.h"
#include "support/test_support.h"

using namespace dispatch_test;
using Log = std::vector<std::string>;

namespace {

constexpr double kGenerousLimit = 8.0; /* seconds; far below the waits a fault would cause */

struct timeval host_time(long sec, long usec) { return {sec, usec}; }

std::string cb(int fd, const char *event) { return "cb:" + std::to_string(fd) + ":" + event; }

bool logged(const Log &log, const std::string &entry) {
    for (const auto &e : log)
        if (e == entry) return true;
    return false;
}

/* A POSIX extended regex that matches the text literally. */
std::string literal_regex(const std::string &text) {
    std::string out;
    for (char c : text) {
        if (std::string("\\^$.|?*+()[]{}").find(c) != std::string::npos) out += '\\';
        out += c;
    }
    return out;
}

std::string format_callback(SelFdCallback callback) {
    char buf[64];
    snprintf(buf, sizeof buf, "%p", reinterpret_cast<void *>(callback));
    return buf;
}

volatile sig_atomic_t g_handled = 0;
void count_signal(int) { g_handled = g_handled + 1; }

class SelectPass : public DispatchTest {};
class SelectDispatch : public DispatchTest {};
class SelectSignals : public DispatchTest {};
class SelectFailures : public DispatchTest {};

} // namespace

/* --- order of a pass ---------------------------------------------------- */

TEST_F(SelectPass, ReadyDescriptorIsDispatchedFromThePollBeforeTimersAndServicing) {
    use_host();
    scripted::set_timed(0, host_time(1010, 0)); /* would need the host clock if the pass waited */
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {5, 0};
    Pipe p(40);
    p.fill();
    ASSERT_EQ(SelAddFD(p.r, SEL_READ, 0, log_callback, nullptr), 0);
    SelTimer due{};
    due.callback = log_timer;
    due.arg = const_cast<char *>("due");
    ASSERT_EQ(SelSleep(&due, 0), 0);

    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(log(), (Log{"empty", "snmp_info", cb(40, "r"), "timer:due", "select_nb", "empty"}));
    EXPECT_TRUE(scripted::host().snmpInputsAsAgreed);
}

TEST_F(SelectPass, DueTimerEndsThePassWithoutWaitOrServicing) {
    use_host();
    scripted::set_timed(0, host_time(999, 0)); /* already due: would force a zero wait */
    scripted::host().snmp.giveTimeout = true;  /* would be serviced after a timed-out wait */
    SelTimer due{};
    due.callback = log_timer;
    due.arg = const_cast<char *>("due");
    ASSERT_EQ(SelSleep(&due, 0), 0);

    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(log(), (Log{"empty", "snmp_info", "timer:due"}));
    EXPECT_EQ(scripted::host().counts.selectNb, 0);
}

TEST_F(SelectPass, TimedOutPassDrainsHostQueueAtEachStepAndServicesSnmpLast) {
    use_host();
    SelRemoveAllTimers();
    scripted::queue_task(1);
    scripted::host().onSelectNb = [] { scripted::queue_task(2); };
    scripted::set_timed(0, host_time(1000, 500000));
    scripted::set_timed(2, host_time(1000, 50000)); /* earliest: 50 ms ahead of the host clock */
    scripted::set_timed(3, host_time(1000, 50000)); /* equal: the earlier list's stays */
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, 30000}; /* strictly before the host's 50 ms */

    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(log(), (Log{"call:1", "empty", "snmp_info", "empty", "tzcurrent", "snmp_info", "select_nb",
                          "call:2", "empty", "snmp_timeout", "run_alarms"}));
    ASSERT_EQ(scripted::host().subArgs.size(), 1u);
    EXPECT_EQ(scripted::host().subArgs[0].tv_usec, 50000);
    EXPECT_TRUE(scripted::host().callSawFetchedRecord);
    EXPECT_TRUE(scripted::host().snmpInputsAsAgreed);
}

TEST_F(SelectPass, EqualHostAndSnmpTimeoutsKeepTheHostOne) {
    use_host();
    SelRemoveAllTimers();
    scripted::set_timed(1, host_time(1000, 40000));
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, 40000};
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 0);
    EXPECT_EQ(scripted::host().counts.runAlarms, 0);

    scripted::host().snmp.timeout = {0, 39999}; /* one microsecond earlier wins */
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 1);
    EXPECT_EQ(scripted::host().counts.runAlarms, 1);
}

TEST_F(SelectPass, TimerBeforeSnmpIsChosenAndSnmpBeforeTimerIsServiced) {
    arm_guard_timer(30);
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {20, 0};
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_TRUE(logged(log(), "timer:guard"));
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 0);

    arm_guard_timer(20000);
    scripted::host().snmp.timeout = {0, 20000};
    clear_log();
    const auto start = monotonic_now();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_LT(seconds_since(start), kGenerousLimit);
    EXPECT_EQ(log(), (Log{"snmp_info", "snmp_info", "snmp_timeout", "run_alarms"}));
}

TEST_F(SelectPass, HostTaskDueNowGivesZeroTimeoutOverTimerAndEqualSnmp) {
    use_host();
    arm_guard_timer(20000);
    scripted::set_timed(3, scripted::host().now); /* due exactly at the host clock */
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, 0}; /* equal to the zero time-out: not chosen */
    const auto start = monotonic_now();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_LT(seconds_since(start), kGenerousLimit);
    EXPECT_EQ(scripted::host().counts.sub, 0);
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 0);
    EXPECT_EQ(scripted::host().counts.selectNb, 1);

    scripted::set_timed(3, host_time(998, 999999)); /* overdue */
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_LT(seconds_since(start), kGenerousLimit);
    EXPECT_EQ(scripted::host().counts.selectNb, 2);
}

TEST_F(SelectPass, NegativeSnmpTimeoutIsReportedZeroedAndServiced) {
    arm_guard_timer(20000);
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, -5000};
    testing::internal::CaptureStderr();
    const auto start = monotonic_now();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "tmeval in pselect -ve 0:-5000000\n");
    EXPECT_LT(seconds_since(start), kGenerousLimit);
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 1);
    EXPECT_EQ(scripted::host().counts.runAlarms, 1);
}

TEST_F(SelectPass, WithoutAnyTimeoutSourceTheWaitLastsUntilADescriptorIsReady) {
    ASSERT_EQ(SelRemoveAllTimers(), 1); /* the reaper's */
    Pipe p(40);
    ASSERT_EQ(SelAddFD(p.r, SEL_READ, 0, log_callback, nullptr), 0);
    std::thread writer([&p] {
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        p.fill();
    });
    EXPECT_EQ(SelSelect(), 0);
    writer.join();
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")})) << "the wait ended before the descriptor was ready";
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 0);
}

TEST_F(SelectPass, HostHooksStayOffWithoutHostContextOrScheduler) {
    SelHostContext noScheduler{nullptr};
    scripted::queue_task(1);
    scripted::set_timed(0, host_time(999, 0));
    for (void *zg : {static_cast<void *>(&noScheduler), static_cast<void *>(nullptr)}) {
        SelSetZG(zg);
        Pipe p(40);
        p.fill();
        ASSERT_EQ(SelAddFD(p.r, SEL_READ, 0, log_callback, nullptr), 0);
        EXPECT_EQ(SelSelect(), 0);
        ASSERT_EQ(SelRemFD(p.r), 0);
    }
    const scripted::Counts &c = scripted::host().counts;
    EXPECT_EQ(c.fetch + c.call + c.selectNb + c.cmp + c.sub + c.tzcurrent, 0);
    EXPECT_EQ(c.snmpInfo, 2); /* the SNMP source is independent of the host context */
}

TEST_F(SelectPass, HostDescriptorsUpToMaxFdInclusiveAreWatched) {
    use_host();
    scripted::set_timed(0, host_time(1010, 0));
    Pipe hostPipe(60);
    hostPipe.fill();
    FD_SET(60, &scripted::host().scheduler.readfd);
    scripted::host().scheduler.max_fd = 60;
    Pipe mine(40); /* registered but idle: nfds 41 is below the host descriptor */
    ASSERT_EQ(SelAddFD(mine.r, SEL_READ, 0, log_callback, nullptr), 0);
    qorbu::sel::sel_einval_count.store(3);

    EXPECT_EQ(SelSelect(), 0);
    /* Found by the poll: no time-out was computed, nothing was dispatched,
     * and the unspent ready pair reset the EINVAL counter. */
    EXPECT_EQ(log(), (Log{"empty", "snmp_info", "select_nb", "empty"}));
    EXPECT_EQ(qorbu::sel::sel_einval_count.load(), 0);

    scripted::host().scheduler.max_fd = 59; /* 60 is no longer examined */
    arm_guard_timer(20);
    clear_log();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_TRUE(logged(log(), "tzcurrent"));
}

TEST_F(SelectPass, ReadableSnmpDescriptorGetsOneSnmpRead) {
    Pipe snmpPipe(50);
    scripted::host().snmp.count = 51;
    FD_SET(50, &scripted::host().snmp.readSet);
    snmpPipe.fill();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(scripted::host().counts.snmpRead, 1);
    EXPECT_EQ(scripted::host().lastSnmpReadArg, &ctx->readyRead);
    EXPECT_TRUE(FD_ISSET(50, &scripted::host().lastSnmpReadSet));

    snmpPipe.drain();
    Pipe mine(40);
    mine.fill();
    ASSERT_EQ(SelAddFD(mine.r, SEL_READ, 0, log_callback, nullptr), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(scripted::host().counts.snmpRead, 1);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")}));
}

/* --- dispatch order ------------------------------------------------------ */

TEST_F(SelectDispatch, ReadScanIsRoundRobinAcrossPasses) {
    Pipe a(40), b(42), c(44);
    for (Pipe *p : {&a, &b, &c}) {
        p->fill();
        ASSERT_EQ(SelAddFD(p->r, SEL_READ, 0, log_callback, nullptr), 0);
    }
    ASSERT_EQ(ctx->scanStart, 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r"), cb(42, "r"), cb(44, "r")}));
    EXPECT_EQ(ctx->scanStart, 41);

    clear_log();
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(42, "r"), cb(44, "r"), cb(40, "r")}));
    EXPECT_EQ(ctx->scanStart, 43);
}

TEST_F(SelectDispatch, ReadableAndWritableDescriptorGetsReadThenWrite) {
    int sv[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, sv), 0);
    ASSERT_EQ(write(sv[1], "x", 1), 1);
    ASSERT_EQ(SelAddFD(sv[0], SEL_READ | SEL_WRITE, 0, log_callback, nullptr), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(sv[0], "r"), cb(sv[0], "w")}));
    close(sv[0]);
    close(sv[1]);
}

TEST_F(SelectDispatch, UrgentTcpDataIsDispatchedBeforeAnyReadOrWrite) {
    const int listener = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr *>(&addr), sizeof addr), 0);
    socklen_t len = sizeof addr;
    ASSERT_EQ(getsockname(listener, reinterpret_cast<sockaddr *>(&addr), &len), 0);
    ASSERT_EQ(listen(listener, 1), 0);
    const int client = socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_EQ(connect(client, reinterpret_cast<sockaddr *>(&addr), sizeof addr), 0);
    const int accepted = accept(listener, nullptr, nullptr);
    ASSERT_GE(accepted, 0);
    const int server = 45;
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
    ASSERT_EQ(SelAddFD(lower.r, SEL_READ, 0, log_callback, nullptr), 0);
    ASSERT_EQ(SelAddFD(server, SEL_READ | SEL_EXCEPT, 0, log_callback, nullptr), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(server, "x"), cb(40, "r"), cb(server, "r")}));
    close(server);
    close(client);
    close(listener);
}

namespace {
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
} // namespace

TEST_F(SelectDispatch, DescriptorRemovedByAnEarlierCallbackIsNotDispatched) {
    Pipe a(40), b(41);
    a.fill();
    b.fill();
    ASSERT_EQ(SelAddFD(a.r, SEL_READ, 0, remove_descriptor_41, nullptr), 0);
    ASSERT_EQ(SelAddFD(b.r, SEL_READ, 0, log_callback, nullptr), 0);
    qorbu::sel::sel_einval_count.store(3);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(40, "r")}));
    EXPECT_EQ(qorbu::sel::sel_einval_count.load(), 0) << "the unspent ready pair resets the counter";
}

TEST_F(SelectDispatch, ScanThatSpendsTheReadyCountKeepsTheEinvalCounter) {
    Pipe a(40);
    a.fill();
    ASSERT_EQ(SelAddFD(a.r, SEL_READ, 0, log_callback, nullptr), 0);
    qorbu::sel::sel_einval_count.store(3);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(qorbu::sel::sel_einval_count.load(), 3);
}

TEST_F(SelectDispatch, CallbackReRegisteringWithAnotherMaskEndsTheOldInterest) {
    int sv[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, sv), 0);
    ASSERT_EQ(write(sv[1], "x", 1), 1);
    ASSERT_EQ(SelAddFD(sv[0], SEL_READ | SEL_WRITE, 0, reregister_for_except, nullptr), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(callbacks_logged(), (Log{cb(sv[0], "r")})) << "the write interest was dropped mid-pass";
    EXPECT_TRUE(FD_ISSET(sv[0], &ctx->exceptSet));
    EXPECT_FALSE(FD_ISSET(sv[0], &ctx->readSet));
    EXPECT_FALSE(FD_ISSET(sv[0], &ctx->writeSet));
    close(sv[0]);
    close(sv[1]);
}

/* --- signals ------------------------------------------------------------- */

TEST_F(SelectSignals, RegisteredSignalIsDeliveredOnlyDuringTheBlockingWait) {
    use_host();
    struct sigaction sa {};
    sa.sa_handler = count_signal;
    ASSERT_EQ(sigaction(SIGUSR1, &sa, nullptr), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    g_handled = 0;
    ASSERT_EQ(raise(SIGUSR1), 0); /* blocked: stays pending */

    Pipe p(40);
    p.fill();
    ASSERT_EQ(SelAddFD(p.r, SEL_READ, 0, log_callback, nullptr), 0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(g_handled, 0) << "delivered during the poll";

    ASSERT_EQ(SelRemFD(p.r), 0);
    arm_guard_timer(0);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(g_handled, 0) << "delivered although a due timer ended the pass";

    arm_guard_timer(20000);
    const int servicedBefore = scripted::host().counts.selectNb;
    errno = 0;
    EXPECT_EQ(SelSelect(), -1);
    EXPECT_EQ(errno, EINTR);
    sigset_t now;
    sigprocmask(SIG_BLOCK, nullptr, &now); /* ThreadSanitizer runs deferred handlers here */
    EXPECT_EQ(g_handled, 1);
    EXPECT_EQ(scripted::host().counts.selectNb, servicedBefore) << "no servicing after an interrupted wait";
    EXPECT_EQ(sigismember(&now, SIGUSR1), 1) << "blocked again after the wait";
}

/* --- wait failures --------------------------------------------------------- */

TEST_F(SelectFailures, ClosedDescriptorIsNamedWithItsCallbackThenAborts) {
    Pipe registered(40), hostOnly(50), healthy(42);
    ASSERT_EQ(SelAddFD(registered.r, SEL_READ, 0, log_callback, nullptr), 0);
    ASSERT_EQ(SelAddFD(healthy.r, SEL_READ, 0, log_callback, nullptr), 0);
    use_host();
    FD_SET(50, &scripted::host().scheduler.readfd);
    scripted::host().scheduler.max_fd = 50;
    close(registered.r);
    close(hostOnly.r);
    registered.r = hostOnly.r = -1;
    const std::string expected = "SelSelect(): [p]select() failed: Bad file descriptor\n"
                                 "SelSelect(): fd 40 (callback " +
                                 format_callback(log_callback) +
                                 ") is invalid (probably close()ed)\n"
                                 "SelSelect(): fd 50 (callback (nil)) is invalid (probably close()ed)\n";
    EXPECT_DEATH(SelSelect(), literal_regex(expected));
}

TEST_F(SelectFailures, EinvalWaitsReturnWithDiagnosticUntilTheFifthAborts) {
    Pipe idle(40);
    ASSERT_EQ(SelAddFD(idle.r, SEL_READ, 0, log_callback, nullptr), 0);
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, 1500000}; /* 1.5e9 ns: the kernel refuses it */
    qorbu::sel::sel_einval_count.store(0);

    for (int failure = 1; failure <= 4; ++failure) {
        testing::internal::CaptureStderr();
        errno = 0;
        EXPECT_EQ(SelSelect(), -1);
        EXPECT_EQ(errno, EINVAL);
        const std::string err = testing::internal::GetCapturedStderr();
        EXPECT_EQ(qorbu::sel::sel_einval_count.load(), failure);
        EXPECT_EQ(err.rfind("SelSelect(): [p]select() failed: Invalid argument\n"
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
    EXPECT_EQ(scripted::host().counts.snmpTimeout, 0);
    EXPECT_DEATH(SelSelect(), literal_regex("SelSelect(): [p]select() failed: Invalid argument\n"));
}

TEST_F(SelectFailures, EinvalCountIsSharedByAllThreads) {
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, 1500000};
    qorbu::sel::sel_einval_count.store(0);
    constexpr int kThreads = 3, kFailuresEach = 1;
    testing::internal::CaptureStderr();
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([] {
            ASSERT_EQ(SelInit(), 0);
            for (int f = 0; f < kFailuresEach; ++f) EXPECT_EQ(SelSelect(), -1);
        });
    for (auto &t : threads) t.join();
    testing::internal::GetCapturedStderr();
    EXPECT_EQ(qorbu::sel::sel_einval_count.load(), kThreads * kFailuresEach);
}

TEST_F(SelectFailures, ScanWithReadyPairsLeftResetsTheEinvalCount) {
    scripted::host().snmp.giveTimeout = true;
    scripted::host().snmp.timeout = {0, 1500000};
    testing::internal::CaptureStderr();
    EXPECT_EQ(SelSelect(), -1);
    EXPECT_EQ(SelSelect(), -1);
    testing::internal::GetCapturedStderr();
    EXPECT_EQ(qorbu::sel::sel_einval_count.load(), 2);

    Pipe snmpPipe(50); /* ready but never dispatched: the pair stays unspent */
    snmpPipe.fill();
    scripted::host().snmp.count = 51;
    FD_SET(50, &scripted::host().snmp.readSet);
    EXPECT_EQ(SelSelect(), 0);
    EXPECT_EQ(qorbu::sel::sel_einval_count.load(), 0);
}
