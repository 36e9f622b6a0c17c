// What the timer and dispatch comparisons drive in every library: a set of
// timers, and a loop over a chain of pipes. libevent's and libev's sides live
// in libevent.cpp and libev.cpp: their headers clash.
#pragma once

#include <fcntl.h>
#include <stdint.h>
#include <sys/select.h>
#include <time.h>
#include <unistd.h>

#include "harness.h"

namespace dispatch {

// Write ends are moved up here so that the read ends, which the select
// backends watch, stay below FD_SETSIZE.
constexpr int kHighFd = 1100;

struct Chain;
struct Node {
    Chain *chain;
    int index;
};

struct Chain {
    int n, active;
    long target = 0, count = 0, writes_left = 0;
    std::vector<int> rfd, wfd;
    std::vector<Node> nodes;

    Chain(int pipes, int tokens) : n(pipes), active(tokens) {
        for (int i = 0; i < n; ++i) {
            int p[2];
            bench::require(pipe2(p, O_NONBLOCK) == 0, "pipe2");
            int w = fcntl(p[1], F_DUPFD_CLOEXEC, kHighFd);
            bench::require(w >= 0, "F_DUPFD");
            close(p[1]);
            rfd.push_back(p[0]);
            wfd.push_back(w);
            if (p[0] >= FD_SETSIZE) {
                fprintf(stderr, "read end %d above FD_SETSIZE\n", p[0]);
                exit(1);
            }
        }
        for (int i = 0; i < n; ++i) nodes.push_back({this, i});
    }
    ~Chain() {
        for (int i = 0; i < n; ++i) {
            close(rfd[size_t(i)]);
            close(wfd[size_t(i)]);
        }
    }
    // Arms one run of `events` callbacks: A bytes spread over the chain.
    void start(long events) {
        target = events;
        count = 0;
        writes_left = events - active;
        char b = 'x';
        for (int j = 0; j < active; ++j)
            if (write(wfd[size_t(j * n / active)], &b, 1) != 1) abort();
    }
    void on_readable(int i) {
        char b;
        if (read(rfd[size_t(i)], &b, 1) != 1) return;
        ++count;
        if (writes_left > 0) {
            --writes_left;
            int next = i + 1 == n ? 0 : i + 1;
            if (write(wfd[size_t(next)], &b, 1) != 1) abort();
        }
    }
};

// A contender owns its chain and loop for one sample: set up, time run(),
// tear down.
struct Loop {
    virtual ~Loop() = default;
    virtual void pass() = 0;
};

Loop *make_libevent_loop(Chain &c, const char *method);
Loop *make_libev_loop(Chain &c, bool epoll);

} // namespace dispatch

namespace timers {

using bench::Rng;

// Far deadlines lie 1000..2000 s ahead (never due during the run); near ones
// 0..kNearSpanUs ahead, and the fire sample sleeps until all are due, also on
// libevent's default clock, CLOCK_MONOTONIC_COARSE (a few ms per tick).
constexpr long kFarBaseUs = 1000L * 1000 * 1000;
constexpr long kFarSpanUs = 1000L * 1000 * 1000;
constexpr long kNearSpanUs = 5000;
inline long fired = 0; // callbacks run since the last reset

inline long far_us(Rng &r) { return kFarBaseUs + long(r.next() % kFarSpanUs); }
inline long near_us(Rng &r) { return long(r.next() % kNearSpanUs); }

inline void sleep_past_near() {
    struct timespec res;
    clock_getres(CLOCK_MONOTONIC_COARSE, &res);
    usleep(useconds_t(kNearSpanUs + 300 + 2 * res.tv_nsec / 1000));
}

// The same four operations on every library.
struct TimerSet {
    virtual ~TimerSet() = default;
    virtual void arm(long i, long us) = 0;
    virtual void cancel(long i) = 0;
    virtual void rearm(long i, long us) = 0;
    virtual void one_pass() = 0; // one non-blocking pass of the loop
    long n = 0;
    bool far_armed = false;

    std::vector<long> order;

    // Records are armed in a random order (the same for every library), so
    // that no library finds its timers in memory order when they fire; libuv
    // would otherwise (it breaks its millisecond ties by arming order).
    // Index n is the extra timer of arm+cancel.
    void arm_all(bool far, Rng &r) {
        if (order.empty()) {
            Rng shuffle{uint64_t(n)};
            for (long i = 0; i < n; ++i) order.push_back(i);
            for (long i = n - 1; i > 0; --i)
                std::swap(order[size_t(i)], order[shuffle.next() % uint64_t(i + 1)]);
        }
        for (long i : order) arm(i, far ? far_us(r) : near_us(r));
    }
    void cancel_all() {
        for (long i = 0; i < n; ++i) cancel(i);
        far_armed = false;
    }
    void ensure_far(Rng &r) {
        if (!far_armed) arm_all(true, r);
        far_armed = true;
    }
};

TimerSet *make_libevent_timers(long n);
TimerSet *make_libev_timers(long n);

} // namespace timers
