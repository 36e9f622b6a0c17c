/* The selector: the timer heap against the reference heap, the registry, the
 * reaper, and SelSelect, SelEpoll and zarn_select against real descriptors
 * and a scripted host, whose functions behave as `host` says and log the
 * calls that shape a pass. */
#include <poll.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <cstring>
#include <random>
#include <thread>
#include <tuple>
#include <vector>

#include "heap_interpreter.h"
#include "selector/dispatch_private.h"
#include "selector/host.h"
#include "support/test_support.h"

namespace qorbu::test {

struct ScriptedHost {
    SelHostScheduler scheduler{{}, {}, {}, -1, {}};
    SelHostContext context{&scheduler};
    SelHostTask tasks[4]{};
    timeval now{1000, 0}; /* the host's clock */
    int queued = 0, queued_by_select_nb = 0, snmp_count = 0;
    fd_set snmp_set{};
    bool snmp_blocks = true;
    timeval snmp_timeout{};
    std::vector<std::string> log;
    void due(int list, timeval when) { scheduler.timed[list] = &(tasks[list] = {nullptr, when}); }
};
ScriptedHost host;
/* Logs "<fd>:r", "<fd>:w" or "<fd>:x". */
inline int log_fd(int fd, unsigned event, void *, SelFdEntry *) {
    return host.log.push_back(std::to_string(fd) + ':' + "?rw?x???"[event & 7]), 0;
}
/* The log as one line. */
inline std::string logged() {
    std::string out;
    for (const std::string &entry : host.log) out += (out.empty() ? "" : " ") + entry;
    return out;
}
inline int watch(int fd, unsigned events = SEL_READ, SelFdCallback cb = log_fd, void *arg = nullptr) {
    return SelAddFD(fd, events, 0, cb, arg);
}
inline int log_timer(SelTimer *) { return host.log.push_back("timer"), 0; }
inline volatile sig_atomic_t handled[65];
inline bool blocked(int signo) {
    sigset_t mask;
    return sigprocmask(SIG_BLOCK, nullptr, &mask) == 0 && sigismember(&mask, signo) == 1;
}
/* Runs body in a child process, so that a call that ends the process or never
 * returns fails an assertion here; the child's own checks print as usual. */
template <typename Body>
void in_child(Body body, unsigned seconds = 20) {
    const auto child = [&] { return body(), fflush(stdout), ::testing::Test::HasFailure() ? 1 : 0; };
    EXPECT_EQ(run_in_child(child, seconds), 0);
}

class SelectorTest : public ::testing::Test {
  protected:
    void SetUp() override {
        host = ScriptedHost{};
        host.context.scheduler = &host.scheduler;
        ASSERT_EQ(SelInit(), 0);
        ASSERT_NE(ctx = SelCurrentContext(), nullptr);
    }
    /* Ends a wait that nothing else would end: the guard timer logs "timer". */
    void bound_wait(unsigned ms) {
        SelRemTimer(&guard);
        guard.callback = log_timer;
        ASSERT_EQ(SelSleep(&guard, ms), 0);
    }

    SelContext *ctx = nullptr;
    SelTimer guard{};
};

} // namespace qorbu::test

using namespace qorbu::test;

extern "C" {

int thread_fetch_queued(void *hostContext, void *task) {
    if (hostContext != &host.context) ADD_FAILURE() << "a foreign host context";
    if (host.queued == 0) return host.log.push_back("drained"), 0;
    memset(task, 0xa5, SEL_HOST_TASK_SIZE); /* the whole record is the host's */
    return --host.queued, 1;
}
int thread_call(void *) { return host.log.push_back("task"), 0; }
int thread_select_nb(void *) { return host.log.push_back("nb"), host.queued += host.queued_by_select_nb, 0; }
int timeval_cmp(timeval a, timeval b) { return timercmp(&a, &b, <) ? -1 : timercmp(&a, &b, >); }
struct timeval timeval_sub(struct timeval a, struct timeval b) {
    const long usec = a.tv_usec - b.tv_usec;
    return usec < 0 ? timeval{a.tv_sec - b.tv_sec - 1, usec + 1000000} : timeval{a.tv_sec - b.tv_sec, usec};
}
int pal_time_tzcurrent(timeval *now, void *) { return host.log.push_back("clock"), *now = host.now, 0; }
int snmp_select_info(int *count, fd_set *set, struct timeval *timeout, int *block) {
    host.log.push_back("info");
    for (int fd = 0; fd < std::min(host.snmp_count, FD_SETSIZE); ++fd)
        if (FD_ISSET(fd, &host.snmp_set)) FD_SET(fd, set);
    *count = std::max(*count, host.snmp_count);
    if (!host.snmp_blocks) *block = 0, *timeout = host.snmp_timeout;
    return 0;
}
void snmp_read(fd_set *) { host.log.push_back("snmp_read"); }
void snmp_timeout(void) { host.log.push_back("snmp_timeout"); }
void run_alarms(void) { host.log.push_back("alarms"); }

} // extern "C"

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
        ASSERT_TRUE(pass == SelSelect || SelUseEpoll() == 0);
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
                stage.fetch_add(1), await(4 + i); /* one pass at a time: the scripted host logs */
                SelTimer due{};
                due.callback = [](SelTimer *) { return 0; };
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
