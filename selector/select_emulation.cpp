/* zarn_select: select() answered by one pass of the calling thread's
 * selector, so that the thread's other descriptors and timers keep being
 * served while the caller waits. */
#include <cerrno>
#include <cstring>

#include "selector/dispatch_private.h"

namespace {

/* Handed as the argument of every temporary registration. */
struct SelectWait {
    fd_set *readfds;
    fd_set *writefds;
    fd_set *exceptfds;
    int32_t readyCount;
};

void report(fd_set *set, int fd, SelectWait *wait) {
    if (!set) return;
    FD_SET(fd, set);
    ++wait->readyCount;
}

int select_collect_ready(int fd, unsigned int event, void *arg, SelFdEntry *) {
    auto *wait = static_cast<SelectWait *>(arg);
    if (event == SEL_READ) report(wait->readfds, fd, wait);
    else if (event == SEL_WRITE) report(wait->writefds, fd, wait);
    else if (event == SEL_EXCEPT) report(wait->exceptfds, fd, wait);
    return 0;
}

int select_on_timeout(SelTimer *) { return 0; }

bool requested(const fd_set *set, int fd) { return set && FD_ISSET(fd, set); }

unsigned int requested_events(const SelectWait &wait, int fd) {
    return (requested(wait.readfds, fd) ? SEL_READ : 0u) | (requested(wait.writefds, fd) ? SEL_WRITE : 0u) |
           (requested(wait.exceptfds, fd) ? SEL_EXCEPT : 0u);
}

/* A descriptor that is already registered in this thread belongs to its
 * owner: it is neither re-registered nor removed afterwards. */
bool registered_by_owner(int fd) {
    SelFdEntry *entry = SelFdSlot(SelCurrentContext(), fd);
    return entry && entry->events != 0;
}

/* An entry filled by our SelAddFD is ours to remove, even when the epoll
 * instance refused the descriptor after the entry was filled. */
bool holds_our_registration(int fd, const SelectWait *wait) {
    const SelContext *ctx = SelCurrentContext();
    if (fd >= ctx->fdTableSize) return false;
    const SelFdEntry &entry = ctx->fdTable[fd];
    return entry.events != 0 && entry.callback == select_collect_ready && entry.arg == wait;
}

void register_requested(int nfds, SelectWait *wait, fd_set *ours) {
    FD_ZERO(ours);
    for (int fd = 0; fd < nfds; ++fd) {
        const unsigned int events = requested_events(*wait, fd);
        if (events == 0 || registered_by_owner(fd)) continue;
        SelAddFD(fd, events, 0, select_collect_ready, wait);
        if (holds_our_registration(fd, wait)) FD_SET(fd, ours);
    }
}

void remove_ours(int nfds, const fd_set *ours) {
    for (int fd = 0; fd < nfds; ++fd)
        if (FD_ISSET(fd, ours)) SelRemFD(fd);
}

/* Arms the time-out timer unless the deadline came out negative. */
bool arm_timeout(SelTimer *timer, const struct timeval *timeout, SelectWait *wait) {
    if (!timeout) return false;
    memset(timer, 0, sizeof *timer);
    timer->callback = select_on_timeout;
    timer->arg = wait;
    SelMakeWhen(&timer->when, timeout->tv_sec, static_cast<long>(timeout->tv_usec) * qorbu::sel::kNsecPerUsec);
    if (timer->when.tv_sec < 0) return false;
    SelAddTimer(timer);
    return true;
}

void clear_if_present(fd_set *set) {
    if (set) FD_ZERO(set);
}

} // namespace

extern "C" QORBU_API int zarn_select(int nfds, fd_set *readfds, fd_set *writefds, fd_set *exceptfds,
                                     struct timeval *timeout) {
    if (nfds < 0 || nfds > qorbu::sel::kSelectSetSize) {
        errno = EINVAL;
        return -1;
    }
    errno = 0;
    SelectWait wait = {readfds, writefds, exceptfds, 0};
    fd_set ours;
    register_requested(nfds, &wait, &ours);
    SelTimer timer;
    const bool armed = arm_timeout(&timer, timeout, &wait);
    clear_if_present(readfds);
    clear_if_present(writefds);
    clear_if_present(exceptfds);

    const int result = SelSelect();
    const int passErrno = errno;

    remove_ours(nfds, &ours);
    if (armed) SelRemTimer(&timer);
    if (result < 0) {
        errno = passErrno;
        return -1;
    }
    return wait.readyCount;
}
