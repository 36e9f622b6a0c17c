// libevent side of the timer comparison.
#include <event2/event.h>

#include <memory>

#include "timer_set.h"

namespace timers {

namespace {

// --- libevent --------------------------------------------------------------
void libevent_fire(evutil_socket_t, short, void *) { ++fired; }

struct LibeventTimers : TimerSet {
    event_base *loop;
    std::vector<event *> ev;
    explicit LibeventTimers(long count) {
        n = count;
        event_config *cfg = event_config_new();
        event_config_set_flag(cfg, EVENT_BASE_FLAG_NOLOCK);
        loop = event_base_new_with_config(cfg);
        event_config_free(cfg);
        for (long i = 0; i <= n; ++i) ev.push_back(evtimer_new(loop, libevent_fire, nullptr));
    }
    ~LibeventTimers() override {
        for (auto *e : ev) event_free(e);
        event_base_free(loop);
    }
    static timeval tv(long us) { return {us / 1000000, us % 1000000}; }
    void arm(long i, long us) override {
        timeval t = tv(us);
        evtimer_add(ev[size_t(i)], &t);
    }
    void cancel(long i) override { evtimer_del(ev[size_t(i)]); }
    void rearm(long i, long us) override { arm(i, us); }
    void one_pass() override { event_base_loop(loop, EVLOOP_NONBLOCK); }
};

} // namespace

TimerSet *make_libevent_timers(long n) { return new LibeventTimers(n); }

} // namespace timers
