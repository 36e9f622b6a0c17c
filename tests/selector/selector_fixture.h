/* The selector's fixture: a context on the test's thread and a scripted host, whose functions
 * (scripted_host.cpp) behave as `host` says and log the calls that shape a pass. */
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
extern ScriptedHost host;
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

#endif
