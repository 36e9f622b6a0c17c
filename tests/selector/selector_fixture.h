/* The selector's fixture: a selector context on the test's thread and a
 * scripted host. scripted_host.cpp defines the host functions that the select
 * loop calls; they behave as `host` says and log the calls that shape a pass. */
#ifndef QORBU_TESTS_SELECTOR_FIXTURE_H
#define QORBU_TESTS_SELECTOR_FIXTURE_H

#include <csignal>
#include <cstdio>
#include <string>
#include <vector>

#include "selector/host.h"
#include "selector/sel_private.h"
#include "support/test_support.h"

namespace qorbu::test {

using Log = std::vector<std::string>;

struct ScriptedHost {
    SelHostScheduler scheduler{{}, {}, {}, -1, {}};
    SelHostContext context{&scheduler};
    SelHostTask tasks[4]{};
    timeval now{1000, 0}; /* the host's clock */
    int queued = 0;       /* tasks in the host's queue */
    int queued_by_select_nb = 0;
    int snmp_count = 0;
    fd_set snmp_set{};
    bool snmp_blocks = true;
    timeval snmp_timeout{};
    Log log;
    void due(int list, timeval when) { scheduler.timed[list] = &(tasks[list] = {nullptr, when}); }
};
extern ScriptedHost host;

/* Logs "<fd>:r", "<fd>:w" or "<fd>:x". */
inline int log_fd(int fd, unsigned event, void *, SelFdEntry *) {
    host.log.push_back(std::to_string(fd) + (event == SEL_READ ? ":r" : event == SEL_WRITE ? ":w" : ":x"));
    return 0;
}
/* The descriptor callbacks logged so far, without the host's calls. */
inline Log callbacks() {
    Log out;
    for (const std::string &entry : host.log)
        if (entry.find(':') != std::string::npos) out.push_back(entry);
    return out;
}
inline int log_timer(SelTimer *) {
    host.log.push_back("timer");
    return 0;
}

inline volatile sig_atomic_t handled[65];
inline void count_signal(int signo) { handled[signo] = handled[signo] + 1; }
inline bool blocked(int signo) {
    sigset_t mask;
    sigprocmask(SIG_BLOCK, nullptr, &mask);
    return sigismember(&mask, signo) == 1;
}

/* Runs body in a child process, so that a call that ends the process or
 * never returns fails an assertion here; the child's checks print as usual. */
template <typename Body>
void in_child(Body body, unsigned seconds = 20) {
    EXPECT_EQ(run_in_child(
                  [&] {
                      const bool failed_before = ::testing::Test::HasFailure();
                      body();
                      fflush(stdout);
                      return ::testing::Test::HasFailure() && !failed_before ? 1 : 0;
                  },
                  seconds),
              0);
}

class SelectorTest : public ::testing::Test {
  protected:
    void SetUp() override {
        host = ScriptedHost{};
        host.context.scheduler = &host.scheduler;
        ASSERT_EQ(SelInit(), 0);
        ASSERT_NE(ctx = SelCurrentContext(), nullptr);
    }
    static int watch(int fd, unsigned events = SEL_READ, SelFdCallback callback = log_fd,
                     void *arg = nullptr) {
        return SelAddFD(fd, events, 0, callback, arg);
    }
    /* Ends a wait that nothing else would end: the guard timer logs "timer". */
    void bound_wait(unsigned ms) {
        SelRemTimer(&guard);
        guard.callback = log_timer;
        ASSERT_EQ(SelSleep(&guard, ms), 0);
    }
    /* SIGUSR1 registered with the selector and SIGUSR2 blocked by the caller,
     * both counted by their handler and both pending already. */
    static void pend_two_signals() {
        struct sigaction sa {};
        sa.sa_handler = count_signal;
        sigaction(SIGUSR1, &sa, nullptr), sigaction(SIGUSR2, &sa, nullptr);
        sigset_t usr2;
        sigemptyset(&usr2), sigaddset(&usr2, SIGUSR2);
        sigprocmask(SIG_BLOCK, &usr2, nullptr);
        ASSERT_EQ(SelAddSignal(SIGUSR1), 0);
        EXPECT_TRUE(blocked(SIGUSR1) && blocked(SIGUSR2)) << "SelAddSignal replaced the caller's mask";
        pthread_kill(pthread_self(), SIGUSR1), pthread_kill(pthread_self(), SIGUSR2);
    }

    SelContext *ctx = nullptr;
    SelTimer guard{};
};

} // namespace qorbu::test

#endif
