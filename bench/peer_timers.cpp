// Timers against libevent, libev and libuv: with n timers armed, the cost of
// arming and cancelling one more, of re-arming one of the n with a new
// deadline, and of firing (per fired timer, in the loop's own passes).
#include <uv.h>

#include <memory>
#include <unistd.h>

#include "loops.h"
#include "selector/sel.h"

using namespace bench;
using namespace timers;

namespace {

// --- libqorbu ------------------------------------------------------------
int qorbu_fire(SelTimer *) {
    ++fired;
    return 0;
}

struct QorbuTimers : TimerSet {
    std::unique_ptr<SelTimer[]> t;
    struct timespec base;
    explicit QorbuTimers(long count) {
        n = count;
        t.reset(new SelTimer[size_t(n + 1)]());
        for (long i = 0; i <= n; ++i) t[size_t(i)].callback = qorbu_fire;
        SelGetTime(&base);
    }
    struct timespec at(long us) { // one division, as a caller holding its times in ns would have it
        long long ns = base.tv_nsec + us * 1000LL;
        return {time_t(base.tv_sec + ns / 1000000000), long(ns % 1000000000)};
    }
    void arm(long i, long us) override {
        if (us < kNearSpanUs) SelGetTime(&base); // near deadlines count from now
        t[size_t(i)].when = at(us);
        SelAddTimer(&t[size_t(i)]);
    }
    void cancel(long i) override { SelRemTimer(&t[size_t(i)]); }
    void rearm(long i, long us) override {
        struct timespec w = at(us);
        SelModifyTimer(&t[size_t(i)], &w);
    }
    void one_pass() override { SelSelect(); }
};

// --- libuv -------------------------------------------------------------------
void libuv_fire(uv_timer_t *) { ++fired; }

struct LibuvTimers : TimerSet {
    uv_loop_t loop;
    std::unique_ptr<uv_timer_t[]> t;
    explicit LibuvTimers(long count) {
        n = count;
        uv_loop_init(&loop);
        t.reset(new uv_timer_t[size_t(n + 1)]);
        for (long i = 0; i <= n; ++i) uv_timer_init(&loop, &t[size_t(i)]);
    }
    ~LibuvTimers() override {
        for (long i = 0; i <= n; ++i) uv_close(reinterpret_cast<uv_handle_t *>(&t[size_t(i)]), nullptr);
        uv_run(&loop, UV_RUN_DEFAULT);
        uv_loop_close(&loop);
    }
    // libuv counts in milliseconds from its cached loop time
    void arm(long i, long us) override {
        if (us < kNearSpanUs) uv_update_time(&loop);
        uv_timer_start(&t[size_t(i)], libuv_fire, uint64_t(us / 1000), 0);
    }
    void cancel(long i) override { uv_timer_stop(&t[size_t(i)]); }
    void rearm(long i, long us) override { arm(i, us); }
    void one_pass() override { uv_run(&loop, UV_RUN_NOWAIT); }
};

// --- the three workloads -----------------------------------------------------
void arm_cancel(TimerSet &s, Rng &r, long ops) {
    s.ensure_far(r);
    for (long k = 0; k < ops; ++k) {
        s.arm(s.n, far_us(r));
        s.cancel(s.n);
    }
}

void rearm(TimerSet &s, Rng &r, long ops) {
    s.ensure_far(r);
    for (long k = 0; k < ops; ++k) s.rearm(long(r.next() % uint64_t(s.n)), far_us(r));
}

// Arms all n timers with random deadlines due within the next 5 ms, sleeps
// until they are due and times the loop's passes until every one has fired;
// repeated until at least min_fired timers fired. Returns ns per fired timer.
double fire(TimerSet &s, Rng &r, long min_fired) {
    if (s.far_armed) s.cancel_all();
    double spent = 0;
    long total = 0;
    while (total < min_fired) {
        s.arm_all(false, r);
        sleep_past_near();
        fired = 0;
        double t0 = now_ns();
        while (fired < s.n) s.one_pass();
        spent += now_ns() - t0;
        total += fired;
    }
    return spent / double(total);
}

} // namespace

int main(int argc, char **argv) {
    Options o = Options::parse(argc, argv);
    SelInit();

    const std::vector<std::string> names = {"libqorbu", "libevent", "libev", "libuv"};
    auto columns = [&] {
        std::vector<Column> c;
        for (auto &nm : names) c.push_back({nm, nm == "libqorbu" ? Role::Ours : Role::Peer});
        return c;
    };
    Section ac("timers_arm_cancel", "armed timers n", "armed timers n", true, columns());
    Section re("timers_rearm", "armed timers n", "armed timers n", true, columns());
    Section fi("timers_fire", "armed timers n", "armed timers n", true, columns());

    for (long n : {100L, 10000L, 1000000L}) {
        long count = std::max(100L, long(double(n) * std::min(1.0, o.scale)));
        std::vector<std::unique_ptr<TimerSet>> sets;
        sets.emplace_back(new QorbuTimers(count));
        sets.emplace_back(make_libevent_timers(count));
        sets.emplace_back(make_libev_timers(count));
        sets.emplace_back(new LibuvTimers(count));
        Rng rng{uint64_t(n)};
        std::vector<Contender> c_ac, c_re, c_fi;
        long min_fired = std::max(count, long(5000 * o.scale));
        for (size_t i = 0; i < sets.size(); ++i) {
            TimerSet *s = sets[i].get();
            c_ac.push_back({names[i], timed(o, [s, &rng](long ops) { arm_cancel(*s, rng, ops); })});
            c_re.push_back({names[i], timed(o, [s, &rng](long ops) { rearm(*s, rng, ops); })});
            c_fi.push_back({names[i], [s, &rng, min_fired] { return fire(*s, rng, min_fired); }});
        }
        std::string label =
            count != n ? std::to_string(count) : "10^" + std::to_string(std::lround(std::log10(n)));
        ac.add(label, double(count), "", interleave(o, c_ac));
        re.add(label, double(count), "", interleave(o, c_re));
        fi.add(label, double(count), "", interleave(o, c_fi));
        fprintf(stderr, "timers: n=%ld done\n", count);
    }

    auto peer = [](const Section &s, const char *nm) { return [&s, nm](size_t r) { return s.at(r, nm); }; };
    ac.verdicts.push_back(
        check(ac, "arm+cancel at most libev's at every size", "libqorbu", peer(ac, "libev"), 1.0));
    re.verdicts.push_back(
        check(re, "re-arm at most libev's at every size", "libqorbu", peer(re, "libev"), 1.0));
    fi.verdicts.push_back(
        check(fi, "firing at most libevent's at every size", "libqorbu", peer(fi, "libevent"), 1.0));
    fi.verdicts.push_back(
        check(fi, "firing at most libuv's at every size", "libqorbu", peer(fi, "libuv"), 1.0));
    for (Section *s : {&ac, &re, &fi}) write(o, *s);
    return 0;
}
