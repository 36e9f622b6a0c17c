// The per-thread descriptor registry: one entry per descriptor number, the
// select-mode interest sets and nfds, or the process-wide epoll instance.
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/time.h>

#include "selector/epoll_private.h"
#include "selector/sel_private.h"

using namespace qorbu::sel;

namespace qorbu::sel {
std::atomic<int> epoll_fd{0};
} // namespace qorbu::sel

namespace {

constexpr unsigned kRegistrableEvents = SEL_READ | SEL_WRITE | SEL_EXCEPT;
constexpr size_t kMaxTableEntries = SIZE_MAX / sizeof(SelFdEntry);

void stamp_activity(SelFdEntry *entry) {
    if (entry->idleTracked == 1) gettimeofday(&entry->lastActivity, nullptr);
}

void set_interest(SelContext *ctx, int fd, unsigned events) {
    if (events & SEL_READ) FD_SET(fd, &ctx->readSet);
    if (events & SEL_WRITE) FD_SET(fd, &ctx->writeSet);
    if (events & SEL_EXCEPT) FD_SET(fd, &ctx->exceptSet);
}

void clear_interest(SelContext *ctx, int fd, unsigned events) {
    if (events & SEL_READ) FD_CLR(fd, &ctx->readSet);
    if (events & SEL_WRITE) FD_CLR(fd, &ctx->writeSet);
    if (events & SEL_EXCEPT) FD_CLR(fd, &ctx->exceptSet);
}

void clear_everywhere(SelContext *ctx, int fd) {
    clear_interest(ctx, fd, kRegistrableEvents);
    FD_CLR(fd, &ctx->readyRead);
    FD_CLR(fd, &ctx->readyWrite);
    FD_CLR(fd, &ctx->readyExcept);
}

// nfds becomes one past the highest descriptor still registered, 1 when none is.
void lower_nfds(SelContext *ctx, int fd) {
    int i = fd;
    while (i > 0 && ctx->fdTable[i].events == 0) --i;
    ctx->nfds = i + 1;
}

bool is_open_descriptor(int fd) { return fcntl(fd, F_GETFD) != -1 || errno != EBADF; }

// Events of the running epoll batch that are still to come for fd are not
// dispatched: they were meant for the registration just removed.
void drop_pending_events(SelContext *ctx, int fd) {
    struct epoll_event *batch = ctx->epoll_batch;
    if (batch == nullptr) return;
    for (int i = ctx->epoll_batch_next; i < ctx->epoll_batch_end; ++i)
        if (batch[i].data.fd == fd) batch[i].data.fd = -1;
}

} // namespace

extern "C" {

SelFdEntry *SelFdSlot(SelContext *ctx, int fd) {
    if (fd >= ctx->fdTableSize) {
        size_t entries = static_cast<size_t>(fd) + 1;
        if (entries > kMaxTableEntries) {
            errno = ENOMEM;
            return nullptr;
        }
        auto *table = static_cast<SelFdEntry *>(realloc(ctx->fdTable, entries * sizeof(SelFdEntry)));
        if (table == nullptr) return nullptr;
        memset(table + ctx->fdTableSize, 0, (entries - ctx->fdTableSize) * sizeof(SelFdEntry));
        ctx->fdTable = table;
        ctx->fdTableSize = fd + 1;
    }
    return &ctx->fdTable[fd];
}

int SelAddFD(int fd, unsigned int events, int idleTracked, SelFdCallback callback, void *arg) {
    const int epfd = current_epoll_fd();
    // A select-mode descriptor must fit in an fd_set; every event needs a callback.
    if ((events & ~kRegistrableEvents) != 0 || fd < 0 || callback == nullptr ||
        (epfd == 0 && fd >= kSelectSetSize)) {
        errno = EINVAL;
        return -1;
    }
    SelContext *ctx = SelCurrentContext();
    // Epoll mode takes any number: one that is not an open descriptor is
    // refused, as epoll would refuse it, before the table grows to reach it.
    if (epfd != 0 && fd >= ctx->fdTableSize && !is_open_descriptor(fd)) {
        errno = EBUSY;
        return -1;
    }
    SelFdEntry *entry = SelFdSlot(ctx, fd);
    if (entry == nullptr) return -1;
    if (entry->events != 0) {
        errno = EBUSY;
        return -1;
    }
    entry->events = events;
    entry->idleTracked = idleTracked;
    entry->callback = callback;
    entry->arg = arg;
    stamp_activity(entry);

    if (epfd != 0) {
        if (epoll_instance_add(epfd, fd, events) != 0) {
            errno = EBUSY; // the entry stays filled until SelRemFD
            return -1;
        }
        return 0;
    }

    set_interest(ctx, fd, events);
    if (events != 0 && fd >= ctx->nfds) ctx->nfds = fd + 1;
    return 0;
}

int SelRemFD(int fd) {
    const int epfd = current_epoll_fd();
    SelContext *ctx = SelCurrentContext();
    if ((epfd == 0 && fd >= ctx->nfds) || fd < 0) {
        errno = EINVAL;
        return -1;
    }
    // A descriptor beyond the table has no entry to free: nothing grows.
    if (SelFdEntry *entry = SelFdFind(ctx, fd))
        entry->events = 0; // also drops SEL_IN_CALLBACK: a running dispatch step restores nothing

    // Whichever mode the descriptor was registered in, no trace of it stays
    // in the select-mode sets: the reaper and later select passes go by them.
    if (fd < ctx->nfds) {
        clear_everywhere(ctx, fd);
        if (ctx->nfds == fd + 1) lower_nfds(ctx, fd);
    }
    if (epfd != 0) {
        drop_pending_events(ctx, fd);
        if (epoll_instance_remove(epfd, fd) != 0) {
            errno = EINVAL;
            return -1;
        }
    }
    return 0;
}

void *SelGetFDArg(int fd) {
    SelContext *ctx = SelCurrentContext();
    if ((current_epoll_fd() == 0 && fd >= ctx->nfds) || fd < 0) {
        errno = EINVAL;
        return nullptr;
    }
    // Beyond the table: a slot never used.
    const SelFdEntry *entry = SelFdFind(ctx, fd);
    return entry == nullptr ? nullptr : entry->arg;
}

void SelDispatchFD(SelContext *ctx, int fd, unsigned int event) {
    SelFdEntry *entry = &ctx->fdTable[fd];
    const unsigned registered = entry->events;
    entry->events = registered | SEL_IN_CALLBACK;
    // While the callback runs, a nested pass neither waits on nor dispatches fd.
    clear_interest(ctx, fd, registered);
    stamp_activity(entry);

    entry->callback(fd, event, entry->arg, entry);

    entry = &ctx->fdTable[fd]; // the callback may have moved the table
    if ((entry->events & SEL_IN_CALLBACK) == 0)
        return; // removed (and perhaps registered anew) by the callback
    entry->events &= ~SEL_IN_CALLBACK;
    set_interest(ctx, fd, entry->events);
}

} // extern "C"
