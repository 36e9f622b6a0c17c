/* Epoll mode: switching the process to it, and SelEpoll, one pass of the
 * loop that waits on the process-wide instance (epoll.cpp) instead of
 * pselect. */
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <pthread.h>
#include <unistd.h>

#include "selector/dispatch_private.h"
#include "selector/epoll_private.h"
#include "selector/time_private.h"

using namespace qorbu::sel;

extern "C" QORBU_API int SelUseEpoll(void) {
    if (current_epoll_fd() != 0) return 0;
    const int fd = epoll_instance_create();
    if (fd < 0) return -1;
    int expected = 0;
    if (!epoll_fd.compare_exchange_strong(expected, fd, std::memory_order_relaxed)) close(fd);
    return 0;
}

extern "C" QORBU_API void DeInitEpoll(void) { epoll_fd.store(0, std::memory_order_relaxed); }

extern "C" QORBU_API int GetEpollFd(void) { return current_epoll_fd(); }

namespace qorbu::sel {

int epoll_timeout_ms(const SelContext *ctx, const struct timespec &now) {
    if (ctx->timerCount <= 0 || !ctx->timerHeap[1]) return 0;
    const long long ms = timespec_to_ms(timespec_sub(ctx->timerHeap[1]->when, now));
    if (ms < 0) return 0;
    return ms > INT_MAX ? INT_MAX : static_cast<int>(ms);
}

int epoll_pass(bool sleep_without_timer) {
    /* 1. The thread's context; the pass is counted, so that a nested pass
     *    run by a callback ends the dispatch below. */
    SelContext *ctx = SelCurrentContext();
    const uint32_t pass = begin_pass(ctx);
    const int epfd = current_epoll_fd();
    struct epoll_event events[kEpollBatch];

    /* 2. Take up to kEpollBatch ready events without blocking. */
    int n = epoll_instance_wait(epfd, events, kEpollBatch, 0);
    if (n == 0) {
        /* 3. Nothing ready: fire the due timers; a pass that fired any ends here. */
        struct timespec now;
        read_clock(&now);
        if (SelRunTimers(ctx) > 0) return 0;
        /* 4. Block for one event until the earliest timer (not at all without
         *    one, unless the run loop asks to sleep), the registered signals
         *    unblocked for the wait only. */
        const bool timer_armed = ctx->timerCount > 0 && ctx->timerHeap[1];
        const int timeout_ms = sleep_without_timer && !timer_armed ? -1 : epoll_timeout_ms(ctx, now);
        sigset_t previous;
        pthread_sigmask(SIG_UNBLOCK, &ctx->signals, &previous);
        n = epoll_instance_wait(epfd, events, kEpollBlockingBatch, timeout_ms);
        const int wait_errno = errno;
        pthread_sigmask(SIG_SETMASK, &previous, nullptr);
        errno = wait_errno;
    }

    /* 5. An interrupted wait returns -1; any other failure ends the process. */
    if (n < 0) {
        if (errno == EINTR || errno == kErestart) return -1;
        perror("Epoll failed");
        abort();
    }

    /* 6. Dispatch the events in order, one callback each. SelRemFD drops a
     *    removed descriptor's events still to come (its number may be
     *    registered anew meanwhile), and once a callback has run a nested
     *    pass, which served what was left, the rest of the batch is stale.
     *    The running batch is saved around the loop for the pass it nests in. */
    struct epoll_event *const outer_batch = ctx->epoll_batch;
    const int32_t outer_next = ctx->epoll_batch_next, outer_end = ctx->epoll_batch_end;
    ctx->epoll_batch = events;
    ctx->epoll_batch_end = n;
    for (int i = 0; i < n && ctx->pass_count == pass; ++i) {
        ctx->epoll_batch_next = i + 1;
        const int fd = events[i].data.fd;
        SelFdEntry *entry = SelFdFind(ctx, fd);
        if (!entry || entry->events == 0) continue;
        entry->callback(fd, selector_event(events[i].events), entry->arg, entry);
    }
    ctx->epoll_batch = outer_batch;
    ctx->epoll_batch_next = outer_next;
    ctx->epoll_batch_end = outer_end;

    /* 7. Fire the due timers (the expiry run reads the clock itself). */
    SelRunTimers(ctx);
    return 0;
}

} // namespace qorbu::sel

extern "C" QORBU_API int SelEpoll(void) { return epoll_pass(false); }
