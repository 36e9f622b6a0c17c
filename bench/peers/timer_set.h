// Timer sets of the timer comparison: the same operations on every library.
// libevent and libev live in separate files: their headers clash.
#pragma once

#include <stdint.h>
#include <time.h>
#include <unistd.h>

#include "harness.h"

namespace timers {

using bench::Rng;

// Far deadlines lie 1000..2000 s ahead (never due during the run); near ones
// 0..kNearSpanUs ahead, and the fire sample sleeps until all are due, also on
// libevent's default clock, CLOCK_MONOTONIC_COARSE (a few ms per tick).
constexpr long kFarBaseUs = 1000L * 1000 * 1000;
constexpr long kFarSpanUs = 1000L * 1000 * 1000;
constexpr long kNearSpanUs = 1000;
extern long fired; // callbacks run since the last reset

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
            for (long i = n - 1; i > 0; --i) std::swap(order[size_t(i)], order[shuffle.next() % uint64_t(i + 1)]);
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
