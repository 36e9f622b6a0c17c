/* Time arithmetic shared by the timers, the two dispatch loops, zarn_select
 * and nb_poll: the unit constants, the monotonic clock and the conversions
 * between milliseconds, timespec and timeval. */
#ifndef QORBU_SELECTOR_TIME_PRIVATE_H
#define QORBU_SELECTOR_TIME_PRIVATE_H

#include <sys/time.h>

#include <ctime>

namespace qorbu::sel {

inline constexpr long kNsecPerSec = 1000000000L;
inline constexpr long kNsecPerMsec = 1000000L;
inline constexpr long kNsecPerUsec = 1000L;
inline constexpr long kUsecPerSec = 1000000L;
inline constexpr long kMsecPerSec = 1000L;

/* What SelGetTime does, for the library's own callers: no call through the
 * exported symbol, and the failure path out of line. */
[[noreturn, gnu::cold]] void clock_failed();
[[gnu::always_inline]] inline void read_clock(struct timespec *now) {
    if (__builtin_expect(clock_gettime(CLOCK_MONOTONIC, now) != 0, 0)) clock_failed();
}

/* later - earlier, borrowing a second when the nanoseconds come out negative. */
inline struct timespec timespec_sub(const struct timespec &later, const struct timespec &earlier) {
    long long sec = static_cast<long long>(later.tv_sec) - earlier.tv_sec;
    long nsec = later.tv_nsec - earlier.tv_nsec;
    if (nsec < 0) {
        sec -= 1;
        nsec += kNsecPerSec;
    }
    struct timespec span;
    span.tv_sec = static_cast<time_t>(sec);
    span.tv_nsec = nsec;
    return span;
}

/* Whole milliseconds of a span, the rest truncated: under 1 ms gives 0. */
inline long long timespec_to_ms(const struct timespec &span) {
    return static_cast<long long>(span.tv_sec) * kMsecPerSec + span.tv_nsec / kNsecPerMsec;
}

/* A span of milliseconds as seconds and nanoseconds. */
inline struct timespec ms_to_timespec(long long ms) {
    struct timespec span;
    span.tv_sec = static_cast<time_t>(ms / kMsecPerSec);
    span.tv_nsec = static_cast<long>(ms % kMsecPerSec * kNsecPerMsec);
    return span;
}

/* The microseconds become nanoseconds as they are; nothing is carried. */
inline struct timespec timeval_to_timespec(const struct timeval &tv) {
    struct timespec ts;
    ts.tv_sec = tv.tv_sec;
    ts.tv_nsec = static_cast<long>(static_cast<long long>(tv.tv_usec) * kNsecPerUsec);
    return ts;
}

} // namespace qorbu::sel

#endif
