// libevent's side of the timer and dispatch comparisons.
#include <event2/event.h>
#include <string.h>

#include <memory>

#include "loops.h"

namespace timers {
namespace {

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

namespace dispatch {
namespace {

void libevent_cb(evutil_socket_t, short, void *arg) {
    Node *nd = static_cast<Node *>(arg);
    nd->chain->on_readable(nd->index);
}

struct LibeventLoop : Loop {
    event_base *base;
    std::vector<event *> ev;
    LibeventLoop(Chain &c, const char *method) {
        event_config *cfg = event_config_new();
        event_config_set_flag(cfg, EVENT_BASE_FLAG_NOLOCK);
        for (const char *m : {"select", "poll", "epoll"})
            if (strcmp(m, method) != 0) event_config_avoid_method(cfg, m);
        base = event_base_new_with_config(cfg);
        event_config_free(cfg);
        if (!base || strcmp(event_base_get_method(base), method) != 0) {
            fprintf(stderr, "libevent: no %s backend\n", method);
            exit(1);
        }
        for (auto &nd : c.nodes) {
            ev.push_back(event_new(base, c.rfd[size_t(nd.index)], EV_READ | EV_PERSIST, libevent_cb, &nd));
            event_add(ev.back(), nullptr);
        }
    }
    ~LibeventLoop() override {
        for (auto *e : ev) event_free(e);
        event_base_free(base);
    }
    void pass() override { event_base_loop(base, EVLOOP_ONCE); }
};

} // namespace

Loop *make_libevent_loop(Chain &c, const char *method) { return new LibeventLoop(c, method); }

} // namespace dispatch
