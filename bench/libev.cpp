// libev's side of the timer and dispatch comparisons.
#include <ev.h>

#include <memory>

#include "loops.h"

namespace timers {
namespace {

void libev_fire(struct ev_loop *, ev_timer *, int) { ++fired; }

struct LibevTimers : TimerSet {
    struct ev_loop *loop;
    std::unique_ptr<ev_timer[]> t;
    explicit LibevTimers(long count) {
        n = count;
        loop = ev_loop_new(EVFLAG_AUTO);
        t.reset(new ev_timer[size_t(n + 1)]);
        for (long i = 0; i <= n; ++i) ev_timer_init(&t[size_t(i)], libev_fire, 0., 0.);
    }
    ~LibevTimers() override { ev_loop_destroy(loop); }
    void arm(long i, long us) override {
        if (us < kNearSpanUs) ev_now_update(loop); // near deadlines count from now
        ev_timer_set(&t[size_t(i)], double(us) * 1e-6, 0.);
        ev_timer_start(loop, &t[size_t(i)]);
    }
    void cancel(long i) override { ev_timer_stop(loop, &t[size_t(i)]); }
    void rearm(long i, long us) override {
        t[size_t(i)].repeat = double(us) * 1e-6;
        ev_timer_again(loop, &t[size_t(i)]);
    }
    void one_pass() override { ev_run(loop, EVRUN_NOWAIT); }
};

} // namespace

TimerSet *make_libev_timers(long n) { return new LibevTimers(n); }

} // namespace timers

namespace dispatch {
namespace {

void libev_cb(struct ev_loop *, ev_io *w, int) {
    Node *nd = static_cast<Node *>(w->data);
    nd->chain->on_readable(nd->index);
}

struct LibevLoop : Loop {
    struct ev_loop *loop;
    std::unique_ptr<ev_io[]> io;
    size_t count;
    LibevLoop(Chain &c, unsigned backend) : count(c.nodes.size()) {
        loop = ev_loop_new(backend);
        if (!loop || ev_backend(loop) != backend) {
            fprintf(stderr, "libev: backend %u unavailable\n", backend);
            exit(1);
        }
        io.reset(new ev_io[count]);
        for (size_t i = 0; i < count; ++i) {
            ev_io_init(&io[i], libev_cb, c.rfd[i], EV_READ);
            io[i].data = &c.nodes[i];
            ev_io_start(loop, &io[i]);
        }
    }
    ~LibevLoop() override {
        for (size_t i = 0; i < count; ++i) ev_io_stop(loop, &io[i]);
        ev_loop_destroy(loop);
    }
    void pass() override { ev_run(loop, EVRUN_ONCE); }
};

} // namespace

Loop *make_libev_loop(Chain &c, bool epoll) {
    return new LibevLoop(c, epoll ? EVBACKEND_EPOLL : EVBACKEND_SELECT);
}

} // namespace dispatch
