/* zarn_select: select() answered by one pass of the calling thread's
 * selector, so that the thread's other descriptors and timers keep being
 * served while the caller waits. */
#include <cerrno>
#include <climits>
#include <cstring>

#include "selector/dispatch_private.h"
#include "selector/time_private.h"

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
    if (event == SEL_READ)
        report(wait->readfds, fd, wait);
    else if (event == SEL_WRITE)
        report(wait->writefds, fd, wait);
    else if (event == SEL_EXCEPT)
        report(wait->exceptfds, fd, wait);
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
    const SelFdEntry *entry = SelFdFind(SelCurrentContext(), fd);
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

/* select() carries whole seconds out of tv_usec (and borrows them for a
 * negative one); so does the wait here, in 64-bit arithmetic that saturates
 * where the sum would overflow. */
void split_timeout(const struct timeval &tv, long *sec, long *nsec) {
    using qorbu::sel::kUsecPerSec;
    long long usec = tv.tv_usec;
    long long carry = usec / kUsecPerSec;
    usec %= kUsecPerSec;
    if (usec < 0) {
        usec += kUsecPerSec;
        --carry;
    }
    long long seconds;
    if (__builtin_add_overflow(static_cast<long long>(tv.tv_sec), carry, &seconds))
        seconds = carry > 0 ? LLONG_MAX : LLONG_MIN;
    *sec = seconds > LONG_MAX ? LONG_MAX : seconds < LONG_MIN ? LONG_MIN : static_cast<long>(seconds);
    *nsec = static_cast<long>(usec * qorbu::sel::kNsecPerUsec);
}

/* Arms the time-out timer unless the deadline came out negative. */
bool arm_timeout(SelTimer *timer, const struct timeval *timeout, SelectWait *wait) {
    if (!timeout) return false;
    memset(timer, 0, sizeof *timer);
    timer->callback = select_on_timeout;
    timer->arg = wait;
    long sec, nsec;
    split_timeout(*timeout, &sec, &nsec);
    SelMakeWhen(&timer->when, sec, nsec);
    if (timer->when.tv_sec < 0) return false;
    SelAddTimer(timer);
    return true;
}

void clear_if_present(fd_set *set) {
    if (set) FD_ZERO(set);
}

fd_set *copy_if_present(const fd_set *set, fd_set *copy) {
    if (!set) return nullptr;
    *copy = *set;
    return copy;
}

/* select() refuses a set that holds a descriptor which is not open, and so
 * does this call, before anything is registered: the pass would take it for
 * a registration whose owner closed it and end the process. One probe that
 * does not wait checks them all. */
bool holds_closed_descriptor(int nfds, const SelectWait &wait) {
    if (nfds == 0 || (!wait.readfds && !wait.writefds && !wait.exceptfds)) return false;
    fd_set r, w, e;
    struct timeval zero = {0, 0};
    return select(nfds, copy_if_present(wait.readfds, &r), copy_if_present(wait.writefds, &w),
                  copy_if_present(wait.exceptfds, &e), &zero) < 0 &&
           errno == EBADF;
}

} // namespace

extern "C" QORBU_API int zarn_select(int nfds, fd_set *readfds, fd_set *writefds, fd_set *exceptfds,
                                     struct timeval *timeout) {
    if (nfds < 0 || nfds > qorbu::sel::kSelectSetSize) {
        errno = EINVAL;
        return -1;
    }
    SelectWait wait = {readfds, writefds, exceptfds, 0};
    if (holds_closed_descriptor(nfds, wait)) return -1; /* errno EBADF */
    errno = 0;
    fd_set ours;
    register_requested(nfds, &wait, &ours);
    SelTimer timer;
    const bool armed = arm_timeout(&timer, timeout, &wait);
    clear_if_present(readfds);
    clear_if_present(writefds);
    clear_if_present(exceptfds);

    const int result = SelSelect();
    const int pass_errno = errno;

    remove_ours(nfds, &ours);
    if (armed) SelRemTimer(&timer);
    if (result < 0) {
        errno = pass_errno;
        return -1;
    }
    return wait.readyCount;
}
