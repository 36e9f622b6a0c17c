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

struct SnmpInfo {
    int count;
    fd_set readSet;
    struct timeval timeout;
    int block;
};

/* Everything one pass computes. */
struct Pass {
    SelContext *ctx;
    SelHostScheduler *host; /* null: host hooks off for this pass */
    int width;              /* first argument of select/pselect */
    SnmpInfo snmp;
    struct timespec now;
    TimeoutSource chosen;
    struct timespec timeout;
    int waitResult;
    int ready; /* reported (descriptor, kind) pairs not dispatched yet */
    bool scanDispatched;
    uint32_t number; /* the context's passCount when this pass began */
};

constexpr const char *kWaitFailed = "SelSelect(): [p]select() failed";

SelHostScheduler *host_scheduler_of(void *zg) {
    if (!zg || !host_functions_present()) return nullptr;
    return static_cast<SelHostContext *>(zg)->scheduler;
}

void copy_interest_sets(Pass &p) {
    SelContext *ctx = p.ctx;
    ctx->readyRead = ctx->readSet;
    ctx->readyWrite = ctx->writeSet;
    ctx->readyExcept = ctx->exceptSet;
    p.width = ctx->nfds;
}

/* The wait never reaches past the working sets, whatever count the host or
 * Net-SNMP report: descriptors of theirs at 1024 or above are not waited on. */
void raise_width(Pass &p, int width) {
    width = clamp_to_set_size(width);
    if (width > p.width) p.width = width;
}

/* Adds the host's descriptors 0..max_fd to the working sets and widens the
 * wait to the highest of them. */
void merge_host_sets(Pass &p) {
    const SelHostScheduler *host = p.host;
    SelContext *ctx = p.ctx;
    const int limit = host->max_fd >= kSelectSetSize ? kSelectSetSize : clamp_to_set_size(host->max_fd + 1);
    for (int i = 0; i * kFdWordBits < limit; ++i) {
        const FdWord mask = fd_word_mask_below(i, limit);
        const FdWord r = fd_word(&host->readfd, i) & mask;
        const FdWord w = fd_word(&host->writefd, i) & mask;
        const FdWord e = fd_word(&host->exceptfd, i) & mask;
        or_fd_word(&ctx->readyRead, i, r);
        or_fd_word(&ctx->readyWrite, i, w);
        or_fd_word(&ctx->readyExcept, i, e);
        if (r | w | e) raise_width(p, i * kFdWordBits + highest_bit(r | w | e) + 1);
    }
}

void query_snmp(Pass &p) {
    p.snmp.count = 0;
    FD_ZERO(&p.snmp.readSet);
    p.snmp.timeout = {0, 0};
    p.snmp.block = 1;
    if (snmp_present()) snmp_select_info(&p.snmp.count, &p.snmp.readSet, &p.snmp.timeout, &p.snmp.block);
}

void merge_snmp_reads(Pass &p) {
    const int limit = clamp_to_set_size(p.snmp.count);
    for (int i = 0; i * kFdWordBits < limit; ++i)
        or_fd_word(&p.ctx->readyRead, i, fd_word(&p.snmp.readSet, i) & fd_word_mask_below(i, limit));
}

/* --- the time-out ---------------------------------------------------------- */

/* Candidates are offered in the order timer, host, SNMP: an equal later
 * candidate does not replace an earlier one. */
void offer_timeout(Pass &p, TimeoutSource source, const struct timespec &candidate) {
    if (p.chosen == TimeoutSource::None || SelTimerBefore(&candidate, &p.timeout)) {
        p.chosen = source;
        p.timeout = candidate;
    }
}

void choose_timer_timeout(Pass &p) {
    const SelContext *ctx = p.ctx;
    if (ctx->timerCount <= 0 || !ctx->timerHeap[1]) return;
    p.chosen = TimeoutSource::Timer;
    p.timeout = timespec_sub(ctx->timerHeap[1]->when, p.now);
}

bool earliest_host_due_time(const SelHostScheduler *host, struct timeval *earliest) {
    bool found = false;
    for (int i = 0; i < kHostTimedLists; ++i) {
        const SelHostTask *first = host->timed[i];
        if (!first) continue;
        if (!found || timeval_cmp(*earliest, first->when) > 0) *earliest = first->when;
        found = true;
    }
    return found;
}

void choose_host_timeout(Pass &p) {
    struct timeval due;
    if (!earliest_host_due_time(p.host, &due)) return;
    struct timeval hostNow = {0, 0};
    pal_time_tzcurrent(&hostNow, nullptr);
    if (timeval_cmp(hostNow, due) >= 0) {
        p.chosen = TimeoutSource::Zero;
        p.timeout = {0, 0};
        return;
    }
    offer_timeout(p, TimeoutSource::Host, timeval_to_timespec(timeval_sub(due, hostNow)));
}

void choose_snmp_timeout(Pass &p) {
    query_snmp(p);
    if (p.snmp.block == 0) offer_timeout(p, TimeoutSource::Snmp, timeval_to_timespec(p.snmp.timeout));
}

void clear_negative_timeout(Pass &p) {
    if (p.chosen == TimeoutSource::None) return;
    if (p.timeout.tv_sec >= 0 && p.timeout.tv_nsec >= 0) return;
    fprintf(stderr, "tmeval in pselect -ve %d:%d\n", static_cast<int>(p.timeout.tv_sec),
            static_cast<int>(p.timeout.tv_nsec));
    p.timeout = {0, 0};
}

/* --- waiting --------------------------------------------------------------- */

/* The thread's mask with the registered signals taken out. Read only when
 * the pass is about to block: the poll runs with the mask as it is. */
void build_wait_mask(const SelContext *ctx, sigset_t *mask) {
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_BLOCK, &none, mask);
    for (int signo = 1; signo <= kMaxSignal; ++signo)
        if (sigismember(&ctx->signals, signo) == 1) sigdelset(mask, signo);
}

int poll_working_sets(Pass &p) {
    struct timeval zero = {0, 0};
    SelContext *ctx = p.ctx;
    p.waitResult = select(p.width, &ctx->readyRead, &ctx->readyWrite, &ctx->readyExcept, &zero);
    return p.waitResult;
}

int wait_working_sets(Pass &p) {
    sigset_t mask;
    build_wait_mask(p.ctx, &mask);
    SelContext *ctx = p.ctx;
    const struct timespec *timeout = p.chosen == TimeoutSource::None ? nullptr : &p.timeout;
    p.waitResult = pselect(p.width, &ctx->readyRead, &ctx->readyWrite, &ctx->readyExcept, timeout, &mask);
    return p.waitResult;
}

/* --- diagnostics ----------------------------------------------------------- */

unsigned long printed_word(const fd_set *set, int i) {
    const int bit = i * kPrintedWordBits;
    return (fd_word(set, bit / kFdWordBits) >> (bit % kFdWordBits)) & 0xffffffffUL;
}

void print_einval_diagnostic(const Pass &p) {
    const SelContext *ctx = p.ctx;
    fprintf(stderr, "invalid params in select %d tl fd %d snmp fd %d fdsetsize %d ", p.width, ctx->nfds,
            p.snmp.count, kSelectSetSize);
    fprintf(stderr, "timeval %d:%d \n", static_cast<int>(p.timeout.tv_sec), static_cast<int>(p.timeout.tv_nsec));
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

bool probe_is_bad(int fd) {
    fd_set one;
    FD_ZERO(&one);
    FD_SET(fd, &one);
    struct timeval zero = {0, 0};
    return select(fd + 1, &one, nullptr, nullptr, &zero) < 0 && errno == EBADF;
}

void *callback_of(const SelContext *ctx, int fd) {
    if (fd >= ctx->nfds || fd >= ctx->fdTableSize) return nullptr;
    return reinterpret_cast<void *>(ctx->fdTable[fd].callback);
}

/* Names every watched descriptor that the kernel refuses. */
void print_ebadf_diagnostic(Pass &p) {
    const SelContext *ctx = p.ctx;
    fd_set watched;
    FD_ZERO(&watched);
    if (snmp_present()) snmp_select_info(&p.snmp.count, &watched, &p.snmp.timeout, &p.snmp.block);
    add_set(&watched, &ctx->readSet);
    add_set(&watched, &ctx->writeSet);
    add_set(&watched, &ctx->exceptSet);
    if (p.host) {
        add_set(&watched, &p.host->readfd);
        add_set(&watched, &p.host->writefd);
        add_set(&watched, &p.host->exceptfd);
    }
    const int limit = clamp_to_set_size(p.width);
    for (int fd = 0; fd < limit; ++fd)
        if (FD_ISSET(fd, &watched) && probe_is_bad(fd))
            fprintf(stderr, "SelSelect(): fd %d (callback %p) is invalid (probably close()ed)\n", fd,
                    callback_of(ctx, fd));
}

int handle_wait_failure(Pass &p) {
    const int error = errno;
    if (error == EINTR || error == kErestart) return -1;
    perror(kWaitFailed);
    if (error == EINVAL) {
        const int failures = sel_einval_count.fetch_add(1, std::memory_order_relaxed) + 1;
        print_einval_diagnostic(p);
        if (failures > kEinvalFailuresTolerated) abort();
        errno = EINVAL;
        return -1;
    }
    if (error == EBADF) print_ebadf_diagnostic(p);
    abort();
}

/* --- dispatch -------------------------------------------------------------- */

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

/* Runs one callback. True when this pass has nothing more to dispatch:
 * the ready count is spent, or the callback ran a nested pass, which reused
 * the working sets and served what this pass had left. */
bool dispatch_one(Pass &p, int fd, unsigned int event) {
    SelDispatchFD(p.ctx, fd, event);
    if (p.ctx->passCount != p.number) {
        p.ready = 0;
        return true;
    }
    return --p.ready == 0;
}

bool dispatch_exceptional(Pass &p, int limit) {
    SelContext *ctx = p.ctx;
    for (int fd = next_exceptional(ctx, 0, limit); fd >= 0; fd = next_exceptional(ctx, fd + 1, limit))
        if (dispatch_one(p, fd, SEL_EXCEPT)) return true;
    return false;
}

bool dispatch_read_write(Pass &p, int fd, unsigned int event) {
    const bool first = !p.scanDispatched;
    p.scanDispatched = true;
    const bool done = dispatch_one(p, fd, event);
    if (first) p.ctx->scanStart = fd + 1;
    return done;
}

bool dispatch_read_write_range(Pass &p, int from, int to) {
    SelContext *ctx = p.ctx;
    for (int fd = next_read_write(ctx, from, to); fd >= 0; fd = next_read_write(ctx, fd + 1, to)) {
        if (FD_ISSET(fd, &ctx->readyRead) && FD_ISSET(fd, &ctx->readSet) && dispatch_read_write(p, fd, SEL_READ))
            return true;
        if (FD_ISSET(fd, &ctx->readyWrite) && FD_ISSET(fd, &ctx->writeSet) && dispatch_read_write(p, fd, SEL_WRITE))
            return true;
    }
    return false;
}

/* Exceptional conditions first, then reading and writing round robin from
 * one past the first descriptor served by the previous scan. */
void dispatch_ready(Pass &p) {
    SelContext *ctx = p.ctx;
    const int limit = clamp_to_set_size(ctx->nfds);
    if (any_exceptional_reported(ctx) && dispatch_exceptional(p, limit)) return;
    const int start = clamp_to_set_size(ctx->scanStart);
    p.scanDispatched = false;
    if (dispatch_read_write_range(p, start, limit)) return;
    if (dispatch_read_write_range(p, 0, start)) return;
    sel_einval_count.store(0, std::memory_order_relaxed);
}

/* --- end of pass ----------------------------------------------------------- */

bool snmp_descriptor_reported(const Pass &p) {
    const int limit = clamp_to_set_size(p.snmp.count);
    for (int i = 0; i * kFdWordBits < limit; ++i)
        if (fd_word(&p.ctx->readyRead, i) & fd_word(&p.snmp.readSet, i) & fd_word_mask_below(i, limit))
            return true;
    return false;
}

void service_snmp_timeout() {
    if (snmp_timeout) snmp_timeout();
    if (run_alarms) run_alarms();
}

int finish_pass(Pass &p) {
    SelContext *ctx = p.ctx;
    SelRunTimers(ctx);
    if (p.host) {
        thread_select_nb(ctx->zg);
        SelDrainHostQueue(ctx->zg);
    }
    if (p.waitResult == 0 && p.chosen == TimeoutSource::Snmp) service_snmp_timeout();
    if (p.waitResult > 0 && p.ready > 0 && snmp_read && snmp_descriptor_reported(p)) snmp_read(&ctx->readyRead);
    return 0;
}

int dispatch_and_finish(Pass &p) {
    p.ready = p.waitResult;
    dispatch_ready(p);
    return finish_pass(p);
}

/* Steps up to the poll: working sets, host queue and sets, SNMP reads. */
void prepare_poll(Pass &p) {
    copy_interest_sets(p);
    if (p.host) {
        SelDrainHostQueue(p.ctx->zg);
        merge_host_sets(p);
    }
    query_snmp(p);
    merge_snmp_reads(p);
    raise_width(p, p.snmp.count);
}

/* Steps before the blocking wait: host queue, fresh sets, the time-out. */
void prepare_wait(Pass &p) {
    if (p.host) SelDrainHostQueue(p.ctx->zg);
    copy_interest_sets(p);
    if (p.host) merge_host_sets(p);
    choose_timer_timeout(p);
    if (p.host) choose_host_timeout(p);
    choose_snmp_timeout(p);
    merge_snmp_reads(p);
    raise_width(p, p.snmp.count);
    clear_negative_timeout(p);
}

} // namespace
} // namespace qorbu::sel

using namespace qorbu::sel;

extern "C" QORBU_API int SelSelect(void) {
    Pass p{};
    p.ctx = SelCurrentContext();
    p.number = begin_pass(p.ctx);
    p.host = host_scheduler_of(p.ctx->zg);
    p.chosen = TimeoutSource::None;

    prepare_poll(p);
    const int polled = poll_working_sets(p);
    if (polled > 0) return dispatch_and_finish(p);
    if (polled < 0) return handle_wait_failure(p);

    SelGetTime(&p.now);
    if (SelRunTimers(p.ctx) > 0) return 0;

    prepare_wait(p);
    const int waited = wait_working_sets(p);
    if (waited > 0) return dispatch_and_finish(p);
    if (waited < 0) return handle_wait_failure(p);
    return finish_pass(p);
}
