/* Set-up shared by the dispatch-loop tests. The scripted host: the ten host
 * functions the select loop calls are defined (strongly) in scripted_host.cpp
 * and behave as the state below says; the calls that shape a pass are
 * appended to a log, so tests can check the exact order. The fixture: a
 * selector context, descriptors at chosen numbers, callbacks that log. */
#ifndef QORBU_TESTS_DISPATCH_FIXTURE_H
#define QORBU_TESTS_DISPATCH_FIXTURE_H

#include <csignal>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <deque>
#include <functional>
#include <string>
#include <vector>

#include "selector/host.h"
#include "selector/sel_private.h"

namespace scripted {

struct Host {
    SelHostScheduler scheduler{{}, {}, {}, -1, {}};
    SelHostContext context{&scheduler};
    SelHostTask timedTasks[4];        /* storage for the first task of each timed list */
    struct timeval now = {1000, 0};   /* the host clock, as pal_time_tzcurrent reports it */
    std::deque<int> queue;            /* ids of the queued tasks */
    std::function<void()> onSelectNb; /* run by thread_select_nb */
    int snmpCount = 0;                /* what snmp_select_info reports as the count */
    fd_set snmpSet{};                 /* descriptors it adds to the caller's set */
    bool giveSnmpTimeout = false;
    struct timeval snmpTimeout = {0, 0};
    std::vector<std::string> log;
    /* Checks of the loop's side of the contract. */
    int cmpCalls = 0;
    std::vector<struct timeval> subArgs; /* first argument of each timeval_sub */
    const void *lastFetchRecord = nullptr;
    bool callSawFetchedRecord = true;
    bool snmpInputsAsAgreed = true; /* count 0, block 1 and an empty set (outside the EBADF probe) */
    fd_set *lastSnmpReadArg = nullptr;
    fd_set lastSnmpReadSet{};
};

Host &host();
void reset();
/* The first task of timed list i, due at the given host time. */
void set_timed(int list, struct timeval when);
void log(const std::string &entry);
inline long times(const std::string &entry) {
    return std::count(host().log.begin(), host().log.end(), entry);
}

} // namespace scripted

namespace dispatch_test {

using Log = std::vector<std::string>;

inline std::string cb(int fd, const char *event) { return "cb:" + std::to_string(fd) + ":" + event; }

/* Logs "cb:<fd>:<r|w|x>" to the scripted host's log. */
inline int log_callback(int fd, unsigned event, void *, SelFdEntry *) {
    scripted::log(cb(fd, event == SEL_READ     ? "r"
                         : event == SEL_WRITE  ? "w"
                         : event == SEL_EXCEPT ? "x"
                                               : "?"));
    return 0;
}

inline int log_timer(SelTimer *t) {
    scripted::log(std::string("timer:") + static_cast<const char *>(t->arg));
    return 0;
}

using Clock = std::chrono::steady_clock;
inline double seconds_since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

inline volatile sig_atomic_t g_handled = 0;
inline void count_signal(int) { g_handled = g_handled + 1; }

/* SIGUSR1 handled by count_signal and registered with the selector. */
inline void register_counted_sigusr1() {
    struct sigaction sa {};
    sa.sa_handler = count_signal;
    ASSERT_EQ(sigaction(SIGUSR1, &sa, nullptr), 0);
    ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
    g_handled = 0;
}

/* A pipe whose read end sits at a chosen descriptor number (when given). */
struct Pipe {
    explicit Pipe(int readAt = -1) {
        int fds[2];
        EXPECT_EQ(pipe(fds), 0);
        r = fds[0], w = fds[1];
        if (readAt >= 0 && readAt != r) {
            EXPECT_EQ(dup2(r, readAt), readAt);
            close(r);
            r = readAt;
        }
    }
    ~Pipe() {
        for (int fd : {r, w})
            if (fd >= 0) close(fd);
    }
    Pipe(const Pipe &) = delete;
    void fill() { EXPECT_EQ(write(w, "x", 1), 1); }
    int r = -1, w = -1;
};

/* A connected pair whose first end is both readable (one byte) and writable. */
struct SocketPair {
    SocketPair() {
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, sv), 0);
        EXPECT_EQ(write(sv[1], "x", 1), 1);
    }
    ~SocketPair() { close(sv[0]), close(sv[1]); }
    int sv[2] = {-1, -1};
};

class DispatchTest : public ::testing::Test {
  protected:
    void SetUp() override {
        scripted::reset();
        ASSERT_EQ(SelInit(), 0);
        ASSERT_NE(ctx = SelCurrentContext(), nullptr);
    }
    void TearDown() override { SelSetZG(nullptr); }

    /* Host hooks on, with the scripted host's context. */
    static void use_host() { SelSetZG(&scripted::host().context); }
    static int watch(int fd, unsigned events = SEL_READ, SelFdCallback callback = log_callback,
                     void *arg = nullptr) {
        return SelAddFD(fd, events, 0, callback, arg);
    }
    static void give_snmp_timeout(long sec, long usec) {
        scripted::host().giveSnmpTimeout = true;
        scripted::host().snmpTimeout = {sec, usec};
    }
    static const Log &log() { return scripted::host().log; }
    static void clear_log() { scripted::host().log.clear(); }
    static Log callbacks_logged() {
        Log out;
        std::copy_if(log().begin(), log().end(), std::back_inserter(out),
                     [](auto &e) { return e.rfind("cb:", 0) == 0; });
        return out;
    }
    /* The pass would wait for the reaper's timer otherwise; a short timer
     * bounds every wait that a fault could make unexpectedly long. */
    void arm_guard_timer(unsigned ms) {
        SelRemTimer(&guard);
        guard.callback = log_timer;
        guard.arg = const_cast<char *>("guard");
        ASSERT_EQ(SelSleep(&guard, ms), 0);
    }

    SelContext *ctx = nullptr;
    SelTimer guard{};
};

} // namespace dispatch_test

#endif
