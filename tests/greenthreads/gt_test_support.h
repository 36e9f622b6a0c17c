// The fixture of the green-thread and descriptor-call tests.
#ifndef QORBU_TESTS_GREENTHREADS_GT_TEST_SUPPORT_H
#define QORBU_TESTS_GREENTHREADS_GT_TEST_SUPPORT_H

#include "greenthreads/greenthread_private.h"
#include "nbio/nb_private.h"
#include "selector/sel_private.h"
#include "support/test_support.h"

namespace qorbu::test {
using namespace qorbu::gt;

template <typename Fn>
Greenthread *spawn(Fn *fn) {
    return greenthread_create([](void *arg) { (*static_cast<Fn *>(arg))(); }, fn);
}

/* greenthreads_run, ended by a ticking timer once `seconds` have passed:
 * false when some thread had not finished by then. */
inline bool run_for(double seconds) {
    static double deadline;
    static bool stopped;
    static SelTimer tick;
    deadline = seconds_now() + seconds, stopped = false;
    tick.callback = [](SelTimer *timer) {
        if (seconds_now() > deadline) stopped = true, live_threads = 0;
        SelMakeWhen(&timer->when, 0, 20'000'000);
        return SelAddTimer(timer);
    };
    tick.callback(&tick);
    greenthreads_run();
    SelRemTimer(&tick);
    return !stopped;
}
inline unsigned registered(int fd) {
    const SelContext *ctx = SelCurrentContext();
    return fd < 0 || fd >= ctx->fdTableSize ? 0 : ctx->fdTable[fd].events;
}
inline int armed_timers() { return SelCurrentContext()->timerCount; }

class GreenThreads : public ::testing::Test {
    void SetUp() override {
        ASSERT_EQ(SelInit(), 0);
        SelRemoveAllTimers(); // the idle reaper's
        greenthreads_init();
    }
};

} // namespace qorbu::test

#endif
