// The chained-pipe benchmark: N pipes, A bytes circulating; each read
// callback reads one byte from its pipe and writes one into the next pipe.
// Cost per event (one callback with its read and write) for libqorbu's select
// and epoll loops against libevent and libev with their select and epoll
// backends and libuv (epoll), with the bare read+write system calls as floor.
#include <uv.h>

#include <fcntl.h>
#include <memory>
#include <sys/resource.h>
#include <unistd.h>

#include "loops.h"
#include "selector/sel.h"

using namespace bench;
using namespace dispatch;

namespace {

// --- floor: the same system calls without a loop -------------------------------
double run_floor(Chain &c, long events) {
    std::vector<int> pos;
    char b = 'x';
    for (int j = 0; j < c.active; ++j) {
        pos.push_back(j * c.n / c.active);
        if (write(c.wfd[size_t(pos.back())], &b, 1) != 1) abort();
    }
    double t0 = now_ns();
    for (long k = 0; k < events; ++k) {
        int &p = pos[size_t(k % c.active)];
        if (read(c.rfd[size_t(p)], &b, 1) != 1) abort();
        p = p + 1 == c.n ? 0 : p + 1;
        if (write(c.wfd[size_t(p)], &b, 1) != 1) abort();
    }
    return now_ns() - t0;
}

// --- libqorbu --------------------------------------------------------------------
int qorbu_cb(int, unsigned, void *arg, SelFdEntry *) {
    Node *nd = static_cast<Node *>(arg);
    nd->chain->on_readable(nd->index);
    return 0;
}

struct QorbuLoop : Loop {
    Chain &c;
    bool epoll;
    QorbuLoop(Chain &chain, bool use_epoll) : c(chain), epoll(use_epoll) {
        require(!epoll || SelUseEpoll() == 0, "SelUseEpoll");
        for (auto &nd : c.nodes)
            require(SelAddFD(c.rfd[size_t(nd.index)], SEL_READ, 0, qorbu_cb, &nd) == 0, "SelAddFD");
    }
    ~QorbuLoop() override {
        for (int fd : c.rfd) SelRemFD(fd);
        if (epoll) {
            int fd = GetEpollFd();
            DeInitEpoll();
            close(fd);
        }
    }
    void pass() override { epoll ? SelEpoll() : SelSelect(); }
};

// --- libuv ------------------------------------------------------------------------
void libuv_cb(uv_poll_t *h, int, int) {
    Node *nd = static_cast<Node *>(h->data);
    nd->chain->on_readable(nd->index);
}

struct LibuvLoop : Loop {
    uv_loop_t loop;
    std::unique_ptr<uv_poll_t[]> h;
    size_t count;
    explicit LibuvLoop(Chain &c) : count(c.nodes.size()) {
        uv_loop_init(&loop);
        h.reset(new uv_poll_t[count]);
        for (size_t i = 0; i < count; ++i) {
            uv_poll_init(&loop, &h[i], c.rfd[i]);
            h[i].data = &c.nodes[i];
            uv_poll_start(&h[i], UV_READABLE, libuv_cb);
        }
    }
    ~LibuvLoop() override {
        for (size_t i = 0; i < count; ++i) uv_close(reinterpret_cast<uv_handle_t *>(&h[i]), nullptr);
        uv_run(&loop, UV_RUN_DEFAULT);
        uv_loop_close(&loop);
    }
    void pass() override { uv_run(&loop, UV_RUN_ONCE); }
};

using MakeLoop = std::function<Loop *(Chain &)>;

// One sample: fresh pipes and loop, `events` callbacks timed, torn down.
double run_sample(int n, int a, const MakeLoop &make, long events) {
    Chain c(n, a);
    if (!make) return run_floor(c, events);
    std::unique_ptr<Loop> loop(make(c));
    c.start(events);
    double t0 = now_ns();
    while (c.count < c.target) loop->pass();
    return now_ns() - t0;
}

} // namespace

int main(int argc, char **argv) {
    Options o = Options::parse(argc, argv);
    struct rlimit rl;
    getrlimit(RLIMIT_NOFILE, &rl);
    rl.rlim_cur = std::min<rlim_t>(rl.rlim_max, 8192);
    setrlimit(RLIMIT_NOFILE, &rl);
    if (rl.rlim_cur < 4096) {
        fprintf(stderr, "need 4096 descriptors, have %lu\n", (unsigned long)rl.rlim_cur);
        return 1;
    }
    SelInit();

    struct Entry {
        const char *name;
        int section; // 0 select, 1 epoll, 2 both (floor)
        Role role;
        MakeLoop make;
    };
    std::vector<Entry> entries = {
        {"libqorbu", 0, Role::Ours, [](Chain &c) { return new QorbuLoop(c, false); }},
        {"libevent", 0, Role::Peer, [](Chain &c) { return make_libevent_loop(c, "select"); }},
        {"libev", 0, Role::Peer, [](Chain &c) { return make_libev_loop(c, false); }},
        {"libqorbu", 1, Role::Ours, [](Chain &c) { return new QorbuLoop(c, true); }},
        {"libevent", 1, Role::Peer, [](Chain &c) { return make_libevent_loop(c, "epoll"); }},
        {"libev", 1, Role::Peer, [](Chain &c) { return make_libev_loop(c, true); }},
        {"libuv", 1, Role::Peer, [](Chain &c) { return new LibuvLoop(c); }},
        {"read+write", 2, Role::Floor, nullptr},
    };

    Section sel("dispatch_select", "pipes N, active A", "pipes N", true);
    Section ep("dispatch_epoll", "pipes N, active A", "pipes N", true);
    for (auto &e : entries) {
        if (e.section != 1) sel.columns.push_back({e.name, e.role});
        if (e.section != 0) ep.columns.push_back({e.name, e.role});
    }

    for (int a : {1, 100})
        for (int n : {100, 1000}) {
            std::vector<Contender> cs;
            std::string label = "N=" + std::to_string(n) + ", A=" + std::to_string(a);
            for (auto &e : entries) {
                // e.g. "libqorbu/select N=100, A=1", for --only
                const char *mode = e.section == 0 ? "/select " : e.section == 1 ? "/epoll " : " ";
                auto sample = [n, a, make = e.make](long events) { return run_sample(n, a, make, events); };
                cs.push_back({e.name + std::string(mode) + label, Calibrated(o, sample, 1000)});
            }
            std::vector<double> med = interleave(o, cs);
            std::vector<double> ms, me;
            for (size_t i = 0; i < entries.size(); ++i) {
                if (entries[i].section != 1) ms.push_back(med[i]);
                if (entries[i].section != 0) me.push_back(med[i]);
            }
            std::string series = "A=" + std::to_string(a);
            sel.add(label, n, series, ms);
            ep.add(label, n, series, me);
            fprintf(stderr, "dispatch: %s done\n", label.c_str());
        }

    auto best = [](const Section &s) { return [&s](size_t r) { return s.best_peer(r); }; };
    auto floor = [](const Section &s) { return [&s](size_t r) { return s.at(r, "read+write"); }; };
    auto a100 = [](const Section &s) { return [&s](size_t r) { return s.rows[r].series == "A=100"; }; };
    sel.verdicts.push_back(check(sel, "select mode at most the best select backend at every N and A",
                                 "libqorbu", best(sel), 1.0));
    sel.verdicts.push_back(
        check(sel, "A=100 within 2x of the read+write floor", "libqorbu", floor(sel), 2.0, a100(sel)));
    ep.verdicts.push_back(
        check(ep, "epoll mode within 1.1x of the best epoll peer", "libqorbu", best(ep), 1.1));
    ep.verdicts.push_back(
        check(ep, "A=100 within 2x of the read+write floor", "libqorbu", floor(ep), 2.0, a100(ep)));
    write(o, sel);
    write(o, ep);
    return 0;
}
