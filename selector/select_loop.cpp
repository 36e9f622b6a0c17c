/* SelSelect: one pass of the select-mode event loop. A pass polls first and
 * dispatches whatever is ready; only when nothing is ready and no timer is
 * due does it work out a time-out (timers, host scheduler, Net-SNMP) and
 * block in pselect with the registered signals unblocked. */
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "selector/dispatch_private.h"
#include "selector/time_private.h"

namespace qorbu::sel {

std::atomic<int> sel_einval_count{0};

namespace {

enum class TimeoutSource { None, Timer, Host, Snmp, Zero };

/* What the latest snmp_select_info call gave. */
struct SnmpInfo {
    int count; /* one past its highest descriptor */
    fd_set read_set;
    struct timeval timeout;
    int block; /* 0: timeout holds the time until its next time-out */
};

/* --- merging the host's and Net-SNMP's descriptors ------------------------- */

/* The wait never reaches past the working sets, whatever count the host or
 * Net-SNMP report: descriptors of theirs at 1024 or above are not waited on. */
int raised_width(int width, int count) {
    count = clamp_to_set_size(count);
    return count > width ? count : width;
}

/* Adds the host's descriptors 0..max_fd to the working sets; returns the
 * wait width raised to one past the highest of them. */
int merge_host_sets(SelContext *ctx, const SelHostScheduler *host, int width) {
    const int limit = host->max_fd >= kSelectSetSize ? kSelectSetSize : clamp_to_set_size(host->max_fd + 1);
    for (int i = 0; i * kFdWordBits < limit; ++i) {
        const FdWord mask = fd_word_mask_below(i, limit);
        const FdWord r = fd_word(&host->readfd, i) & mask;
        const FdWord w = fd_word(&host->writefd, i) & mask;
        const FdWord e = fd_word(&host->exceptfd, i) & mask;
        or_fd_word(&ctx->readyRead, i, r);
        or_fd_word(&ctx->readyWrite, i, w);
        or_fd_word(&ctx->readyExcept, i, e);
        if (r | w | e) width = raised_width(width, i * kFdWordBits + highest_bit(r | w | e) + 1);
    }
    return width;
}

/* Asks Net-SNMP for its descriptors and its time-out, adds its descriptors
 * to the working read set and returns the wait width raised to its count. */
int ask_snmp(SelContext *ctx, SnmpInfo *snmp, int width) {
    snmp->count = 0;
    FD_ZERO(&snmp->read_set);
    snmp->timeout = {0, 0};
    snmp->block = 1;
    if (snmp_present()) snmp_select_info(&snmp->count, &snmp->read_set, &snmp->timeout, &snmp->block);
    const int limit = clamp_to_set_size(snmp->count);
    for (int i = 0; i * kFdWordBits < limit; ++i)
        or_fd_word(&ctx->readyRead, i, fd_word(&snmp->read_set, i) & fd_word_mask_below(i, limit));
    return raised_width(width, snmp->count);
}

/* One of Net-SNMP's descriptors was reported readable. */
bool snmp_descriptor_reported(const SelContext *ctx, const SnmpInfo &snmp) {
    const int limit = clamp_to_set_size(snmp.count);
    for (int i = 0; i * kFdWordBits < limit; ++i)
        if (fd_word(&ctx->readyRead, i) & fd_word(&snmp.read_set, i) & fd_word_mask_below(i, limit))
            return true;
    return false;
}

/* The host's time-out: None when none of its timed lists holds a task, Zero
 * (and a zero timeout) when the earliest task is due by the host's clock,
 * else Host with the time until it is. The lists keep their earliest task
 * first; on equal due times the earlier list's task counts. */
TimeoutSource host_timeout(const SelHostScheduler *host, struct timespec *timeout) {
    struct timeval due;
    bool found = false;
    for (int i = 0; i < kHostTimedLists; ++i) {
        const SelHostTask *first = host->timed[i];
        if (!first) continue;
        if (!found || timeval_cmp(due, first->when) > 0) due = first->when;
        found = true;
    }
    if (!found) return TimeoutSource::None;
    struct timeval host_now = {0, 0};
    pal_time_tzcurrent(&host_now, nullptr);
    if (timeval_cmp(host_now, due) >= 0) {
        *timeout = {0, 0};
        return TimeoutSource::Zero;
    }
    *timeout = timeval_to_timespec(timeval_sub(due, host_now));
    return TimeoutSource::Host;
}

/* --- dispatching the ready sets -------------------------------------------- */

/* Lowest descriptor in [from, to) whose reported readiness is still
 * registered, or -1. Working and interest sets are read afresh on every
 * call, since callbacks change them. */
int next_read_write(const SelContext *ctx, int from, int to) {
    for (int i = from / kFdWordBits; i * kFdWordBits < to; ++i) {
        FdWord bits = (fd_word(&ctx->readyRead, i) & fd_word(&ctx->readSet, i)) |
                      (fd_word(&ctx->readyWrite, i) & fd_word(&ctx->writeSet, i));
        bits &= fd_word_mask_below(i, to) & ~fd_word_mask_below(i, from);
        if (bits) return i * kFdWordBits + lowest_bit(bits);
    }
    return -1;
}

int next_exceptional(const SelContext *ctx, int from, int to) {
    for (int i = from / kFdWordBits; i * kFdWordBits < to; ++i) {
        FdWord bits = fd_word(&ctx->readyExcept, i) & fd_word(&ctx->exceptSet, i);
        bits &= fd_word_mask_below(i, to) & ~fd_word_mask_below(i, from);
        if (bits) return i * kFdWordBits + lowest_bit(bits);
    }
    return -1;
}

bool any_exceptional_reported(const SelContext *ctx) {
    for (int i = 0; i < kFdWords; ++i)
        if (fd_word(&ctx->readyExcept, i)) return true;
    return false;
}

/* Calls back the descriptors the wait reported: exceptional conditions
 * first, in descriptor order; then reading and writing, round robin from
 * one past the first descriptor served by the previous scan. Stops as soon
 * as the ready count is spent, or once a callback has run a nested pass
 * (which reused the working sets and served what this pass had left).
 * Returns the ready pairs left over: those of the host and of Net-SNMP,
 * and those of descriptors removed meanwhile. */
int dispatch_ready(SelContext *ctx, int ready, uint32_t pass) {
    const int limit = clamp_to_set_size(ctx->nfds);
    auto spent = [&] { return ctx->pass_count != pass || --ready == 0; };

    if (any_exceptional_reported(ctx)) {
        for (int fd = next_exceptional(ctx, 0, limit); fd >= 0; fd = next_exceptional(ctx, fd + 1, limit)) {
            SelDispatchFD(ctx, fd, SEL_EXCEPT);
            if (spent()) return 0;
        }
    }

    bool first = true;
    auto dispatch_read_write = [&](int fd, unsigned int event) {
        SelDispatchFD(ctx, fd, event);
        if (first) ctx->scanStart = fd + 1;
        first = false;
        return spent();
    };
    /* One stretch of the round: true once nothing more is to be dispatched. */
    auto scan = [&](int from, int to) {
        for (int fd = next_read_write(ctx, from, to); fd >= 0; fd = next_read_write(ctx, fd + 1, to)) {
            if (FD_ISSET(fd, &ctx->readyRead) && FD_ISSET(fd, &ctx->readSet) &&
                dispatch_read_write(fd, SEL_READ))
                return true;
            if (FD_ISSET(fd, &ctx->readyWrite) && FD_ISSET(fd, &ctx->writeSet) &&
                dispatch_read_write(fd, SEL_WRITE))
                return true;
        }
        return false;
    };
    const int start = clamp_to_set_size(ctx->scanStart);
    if (scan(start, limit) || scan(0, start)) return 0;
    sel_einval_count.store(0, std::memory_order_relaxed);
    return ready;
}

/* --- a failed wait --------------------------------------------------------- */

constexpr const char *kWaitFailed = "SelSelect(): [p]select() failed";

unsigned long printed_word(const fd_set *set, int i) {
    const int bit = i * kPrintedWordBits;
    return (fd_word(set, bit / kFdWordBits) >> (bit % kFdWordBits)) & 0xffffffffUL;
}

void print_einval_diagnostic(const SelContext *ctx, int width, const SnmpInfo &snmp,
                             const struct timespec &timeout) {
    fprintf(stderr, "invalid params in select %d tl fd %d snmp fd %d fdsetsize %d ", width, ctx->nfds,
            snmp.count, kSelectSetSize);
    fprintf(stderr, "timeval %d:%d \n", static_cast<int>(timeout.tv_sec), static_cast<int>(timeout.tv_nsec));
    for (int i = 0; i < kSelectSetSize / kPrintedWordBits; ++i) {
        fprintf(stderr, "selreadset %d %lx\t", i, printed_word(&ctx->readyRead, i));
        fprintf(stderr, "selwriteset %lx\t", printed_word(&ctx->readyWrite, i));
        fprintf(stderr, "seloobset %lx\n", printed_word(&ctx->readyExcept, i));
        fprintf(stderr, "readset %d %lx\t", i, printed_word(&ctx->readSet, i));
        fprintf(stderr, "writeset %lx\t", printed_word(&ctx->writeSet, i));
        fprintf(stderr, "oobset %lx\n", printed_word(&ctx->exceptSet, i));
    }
}

void add_set(fd_set *to, const fd_set *from) {
    for (int i = 0; i < kFdWords; ++i) or_fd_word(to, i, fd_word(from, i));
}

/* Names every watched descriptor below the wait width that the kernel
 * refuses when probed alone. */
void print_ebadf_diagnostic(const SelContext *ctx, const SelHostScheduler *host, int width, SnmpInfo &snmp) {
    fd_set watched;
    FD_ZERO(&watched);
    if (snmp_present()) snmp_select_info(&snmp.count, &watched, &snmp.timeout, &snmp.block);
    add_set(&watched, &ctx->readSet);
    add_set(&watched, &ctx->writeSet);
    add_set(&watched, &ctx->exceptSet);
    if (host) {
        add_set(&watched, &host->readfd);
        add_set(&watched, &host->writefd);
        add_set(&watched, &host->exceptfd);
    }
    const int limit = clamp_to_set_size(width);
    for (int fd = 0; fd < limit; ++fd) {
        if (!FD_ISSET(fd, &watched)) continue;
        fd_set one;
        FD_ZERO(&one);
        FD_SET(fd, &one);
        struct timeval zero = {0, 0};
        if (select(fd + 1, &one, nullptr, nullptr, &zero) >= 0 || errno != EBADF) continue;
        const bool ours = fd < ctx->nfds && fd < ctx->fdTableSize;
        fprintf(stderr, "SelSelect(): fd %d (callback %p) is invalid (probably close()ed)\n", fd,
                ours ? reinterpret_cast<void *>(ctx->fdTable[fd].callback) : nullptr);
    }
}

/* An interruption returns -1 with errno kept; the first four EINVAL
 * failures (counted process-wide) return -1 after their diagnostic;
 * anything else ends the process. */
int handle_wait_failure(const SelContext *ctx, const SelHostScheduler *host, int width, SnmpInfo &snmp,
                        const struct timespec &timeout) {
    const int error = errno;
    if (error == EINTR || error == kErestart) return -1;
    perror(kWaitFailed);
    if (error == EINVAL) {
        const int failures = sel_einval_count.fetch_add(1, std::memory_order_relaxed) + 1;
        print_einval_diagnostic(ctx, width, snmp, timeout);
        if (failures > kEinvalFailuresTolerated) abort();
        errno = EINVAL;
        return -1;
    }
    if (error == EBADF) print_ebadf_diagnostic(ctx, host, width, snmp);
    abort();
}

} // namespace
} // namespace qorbu::sel

using namespace qorbu::sel;

extern "C" QORBU_API int SelSelect(void) {
    /* 1. The thread's context; the pass is counted, so that a nested pass run
     *    by a callback ends the dispatch below. The host hooks are on or off
     *    for the whole pass. */
    SelContext *ctx = SelCurrentContext();
    const uint32_t pass = begin_pass(ctx);
    SelHostScheduler *host =
        ctx->zg && host_functions_present() ? static_cast<SelHostContext *>(ctx->zg)->scheduler : nullptr;
    SnmpInfo snmp;
    TimeoutSource chosen = TimeoutSource::None;
    struct timespec timeout = {0, 0};

    /* 2. The working sets start as copies of the interest sets. */
    ctx->readyRead = ctx->readSet;
    ctx->readyWrite = ctx->writeSet;
    ctx->readyExcept = ctx->exceptSet;
    int width = ctx->nfds;

    /* 3. Run the host's queued tasks and add its descriptors. */
    if (host) {
        SelDrainHostQueue(ctx->zg);
        width = merge_host_sets(ctx, host, width);
    }

    /* 4. Add Net-SNMP's descriptors. */
    width = ask_snmp(ctx, &snmp, width);

    /* 5. Poll: whatever is ready is dispatched at once, without a time-out
     *    and with the signal mask as it is. */
    struct timeval zero = {0, 0};
    int ready = select(width, &ctx->readyRead, &ctx->readyWrite, &ctx->readyExcept, &zero);

    if (ready == 0) {
        /* 6. Nothing ready: fire the due timers; a pass that fired any ends here. */
        struct timespec now;
        read_clock(&now);
        if (SelRunTimers(ctx) > 0) return 0;

        /* 7. Run the host's queue again and take fresh working sets. */
        if (host) SelDrainHostQueue(ctx->zg);
        ctx->readyRead = ctx->readSet;
        ctx->readyWrite = ctx->writeSet;
        ctx->readyExcept = ctx->exceptSet;
        width = ctx->nfds;
        if (host) width = merge_host_sets(ctx, host, width);

        /* 8. The time-out: the earliest of the timer's, the host's and
         *    Net-SNMP's; on a tie the earlier of these sources stays chosen,
         *    and a host task already due gives a zero time-out. */
        auto offer = [&](TimeoutSource source, const struct timespec &candidate) {
            if (source == TimeoutSource::Zero || chosen == TimeoutSource::None ||
                deadline_before(candidate, timeout)) {
                chosen = source;
                timeout = candidate;
            }
        };
        if (ctx->timerCount > 0 && ctx->timerHeap[1])
            offer(TimeoutSource::Timer, timespec_sub(ctx->timerHeap[1]->when, now));
        struct timespec candidate = {0, 0};
        if (host) {
            const TimeoutSource source = host_timeout(host, &candidate);
            if (source != TimeoutSource::None) offer(source, candidate);
        }
        width = ask_snmp(ctx, &snmp, width);
        if (snmp.block == 0) offer(TimeoutSource::Snmp, timeval_to_timespec(snmp.timeout));

        /* 9. A negative time-out is reported and waits for nothing. */
        if (chosen != TimeoutSource::None && (timeout.tv_sec < 0 || timeout.tv_nsec < 0)) {
            fprintf(stderr, "tmeval in pselect -ve %d:%d\n", static_cast<int>(timeout.tv_sec),
                    static_cast<int>(timeout.tv_nsec));
            timeout = {0, 0};
        }

        /* 10. Wait, with the thread's mask as it is now minus the registered
         *     signals; without a time-out until a descriptor or a signal. */
        sigset_t mask, none;
        sigemptyset(&none);
        sigprocmask(SIG_BLOCK, &none, &mask);
        for (int signo = 1; signo <= kMaxSignal; ++signo)
            if (sigismember(&ctx->signals, signo) == 1) sigdelset(&mask, signo);
        ready = pselect(width, &ctx->readyRead, &ctx->readyWrite, &ctx->readyExcept,
                        chosen == TimeoutSource::None ? nullptr : &timeout, &mask);
    }
    if (ready < 0) return handle_wait_failure(ctx, host, width, snmp, timeout);

    /* 11. Dispatch what the poll or the wait reported. */
    const int reported = ready;
    if (reported > 0) ready = dispatch_ready(ctx, reported, pass);

    /* 12. End of pass: due timers, the host's servicing and its queue, then
     *     Net-SNMP's time-out when the wait ended on it, or its reading when
     *     one of its descriptors was reported. */
    SelRunTimers(ctx);
    if (host) {
        thread_select_nb(ctx->zg);
        SelDrainHostQueue(ctx->zg);
    }
    if (reported == 0 && chosen == TimeoutSource::Snmp) {
        if (snmp_timeout) snmp_timeout();
        if (run_alarms) run_alarms();
    }
    if (reported > 0 && ready > 0 && snmp_read && snmp_descriptor_reported(ctx, snmp))
        snmp_read(&ctx->readyRead);
    return 0;
}
