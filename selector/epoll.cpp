/* The epoll backend: one process-wide, level-triggered epoll instance and
 * SelEpoll, one pass of the loop that waits on it. */
#include <sys/epoll.h>

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

#include "selector/dispatch_private.h"
#include "selector/time_private.h"

namespace qorbu::sel {
namespace {

/* Descriptor 0 would read as "select mode", so an instance created there is
 * moved to the lowest free descriptor above it. */
int move_off_descriptor_zero(int fd) {
    if (fd != 0) return fd;
    const int moved = fcntl(fd, F_DUPFD, 1);
    close(fd);
    return moved;
}

void set_close_on_exec_or_abort(int fd) {
    const int flags = fcntl(fd, F_GETFD);
    if (flags < 0 || fcntl(fd, F_SETFD, flags | FD_CLOEXEC) < 0) abort();
}

unsigned int selector_event(uint32_t epollEvents) {
    if (epollEvents & EPOLLIN) return SEL_READ;
    if (epollEvents & EPOLLOUT) return SEL_WRITE;
    return SEL_EXCEPT;
}

/* Dispatches the batch in order. SelRemFD drops a removed descriptor's
 * events still to come (its number may be registered anew meanwhile), and
 * once a callback has run a nested pass, which served what was left, the
 * rest of the batch is stale. */
void dispatch_events(SelContext *ctx, struct epoll_event *events, int count, uint32_t pass) {
    struct epoll_event *const outerBatch = ctx->epollBatch;
    const int32_t outerNext = ctx->epollBatchNext, outerEnd = ctx->epollBatchEnd;
    ctx->epollBatch = events;
    ctx->epollBatchEnd = count;
    for (int i = 0; i < count && ctx->passCount == pass; ++i) {
        ctx->epollBatchNext = i + 1;
        const int fd = events[i].data.fd;
        SelFdEntry *entry = SelFdFind(ctx, fd);
        if (!entry || entry->events == 0) continue;
        entry->callback(fd, selector_event(events[i].events), entry->arg, entry);
    }
    ctx->epollBatch = outerBatch;
    ctx->epollBatchNext = outerNext;
    ctx->epollBatchEnd = outerEnd;
}

bool timer_armed(const SelContext *ctx) { return ctx->timerCount > 0 && ctx->timerHeap[1]; }

} // namespace

int epoll_timeout_ms(const SelContext *ctx, const struct timespec &now) {
    if (ctx->timerCount <= 0 || !ctx->timerHeap[1]) return 0;
    const long long ms = timespec_to_ms(timespec_sub(ctx->timerHeap[1]->when, now));
    if (ms < 0) return 0;
    return ms > INT_MAX ? INT_MAX : static_cast<int>(ms);
}

namespace {

/* Blocks for at most one event with the registered signals unblocked for
 * the wait only. */
int wait_blocking(const SelContext *ctx, int epfd, struct epoll_event *events, int timeoutMs) {
    sigset_t previous;
    pthread_sigmask(SIG_UNBLOCK, &ctx->signals, &previous);
    const int n = epoll_wait(epfd, events, kEpollBlockingBatch, timeoutMs);
    const int waitErrno = errno;
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    errno = waitErrno;
    return n;
}

int handle_epoll_failure() {
    if (errno == EINTR || errno == kErestart) return -1;
    perror("Epoll failed");
    abort();
}

int run_timers_and_return(SelContext *ctx) {
    SelRunTimers(ctx); /* reads the clock itself */
    return 0;
}

} // namespace
} // namespace qorbu::sel

using namespace qorbu::sel;

extern "C" QORBU_API int SelUseEpoll(void) {
    if (current_epoll_fd() != 0) return 0;
    const int fd = move_off_descriptor_zero(epoll_create(1));
    if (fd < 0) return -1;
    set_close_on_exec_or_abort(fd);
    int expected = 0;
    if (!epoll_fd.compare_exchange_strong(expected, fd, std::memory_order_relaxed)) close(fd);
    return 0;
}

extern "C" QORBU_API void DeInitEpoll(void) { epoll_fd.store(0, std::memory_order_relaxed); }

extern "C" QORBU_API int GetEpollFd(void) { return current_epoll_fd(); }

namespace qorbu::sel {

int epoll_pass(bool sleepWithoutTimer) {
    SelContext *ctx = SelCurrentContext();
    const uint32_t pass = begin_pass(ctx);
    const int epfd = current_epoll_fd();
    struct epoll_event events[kEpollBatch];

    int n = epoll_wait(epfd, events, kEpollBatch, 0);
    if (n < 0) return handle_epoll_failure();
    if (n == 0) {
        struct timespec now;
        SelGetTime(&now);
        if (SelRunTimers(ctx) > 0) return 0;
        const int timeoutMs = sleepWithoutTimer && !timer_armed(ctx) ? -1 : epoll_timeout_ms(ctx, now);
        n = wait_blocking(ctx, epfd, events, timeoutMs);
        if (n < 0) return handle_epoll_failure();
    }
    dispatch_events(ctx, events, n, pass);
    return run_timers_and_return(ctx);
}

} // namespace qorbu::sel

extern "C" QORBU_API int SelEpoll(void) { return epoll_pass(false); }
