// libev side of the dispatch comparison.
#include <ev.h>

#include <memory>

#include "chain.h"

namespace dispatch {

namespace {

// --- libev ------------------------------------------------------------------------
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

Loop *make_libev_loop(Chain &c, bool epoll) { return new LibevLoop(c, epoll ? EVBACKEND_EPOLL : EVBACKEND_SELECT); }

} // namespace dispatch
