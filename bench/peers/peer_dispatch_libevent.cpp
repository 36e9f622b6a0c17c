// libevent side of the dispatch comparison.
#include <event2/event.h>
#include <string.h>

#include <memory>

#include "chain.h"

namespace dispatch {

namespace {

// --- libevent ---------------------------------------------------------------------
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
