/* nb_poll: park the calling green thread in the selector until a descriptor
 * is ready or an optional time-out expires. */
#include <cerrno>
#include <poll.h>

#include "greenthreads/greenthread_private.h"
#include "nbio/nb_private.h"
#include "selector/time_private.h"

namespace qorbu::nb {
namespace {

/* Blocks the green thread until a callback has set the result; a wakeup
 * from elsewhere that leaves it at 0 blocks again. The main context may not
 * block: it waits by taking turns of the run loop itself. */
void wait_for_result(const NbWait &wait) {
    if (gt::in_main_context()) {
        while (wait.result == 0) gt::run_one_turn();
        return;
    }
    while (wait.result == 0) greenthread_block();
}

/* In epoll mode the registry may keep the entry when epoll itself refuses
 * the descriptor; an entry that points at this wait must not outlive it.
 * Someone else's registration is left alone. */
void forget_refused_registration(int fd, NbWait &wait) {
    const int saved = errno;
    if (fd >= 0 && SelGetFDArg(fd) == &wait) SelRemFD(fd);
    errno = saved;
}

int arm_timeout(SelTimer &timer, NbWait &wait, int timeout) {
    timer.heapIndex = 0;
    timer.callback = nb_poll_on_timeout;
    timer.arg = &wait;
    const struct timespec span = sel::ms_to_timespec(timeout);
    SelMakeWhen(&timer.when, static_cast<long>(span.tv_sec), span.tv_nsec);
    return SelAddTimer(&timer) == 0 ? 0 : -1;
}

} // namespace

unsigned int selector_mask(int events) {
    unsigned int mask = 0;
    if (events & POLLIN) mask |= SEL_READ;
    if (events & POLLOUT) mask |= SEL_WRITE;
    return mask;
}

} // namespace qorbu::nb

using namespace qorbu;

int nb_poll_on_ready(int, unsigned int, void *arg, SelFdEntry *) {
    auto *wait = static_cast<NbWait *>(arg);
    wait->result = 1;
    greenthread_wakeup(wait->thread);
    return 0;
}

int nb_poll_on_timeout(SelTimer *timer) {
    auto *wait = static_cast<NbWait *>(timer->arg);
    if (wait->result != 0) return 0;
    wait->result = -1;
    greenthread_wakeup(wait->thread);
    return 0;
}

extern "C" int nb_poll(int fd, int events, int timeout) {
    NbWait wait = {current_greenthread(), 0};
    const unsigned int mask = nb::selector_mask(events);
    const bool watch_descriptor = mask != 0;
    if (!watch_descriptor && timeout <= 0) {
        errno = EINVAL; /* nothing could ever end this wait */
        return -1;
    }
    /* A descriptor the selector refuses (invalid, out of its range, already
     * registered) could never wake us: fail at once with its errno. */
    if (watch_descriptor && SelAddFD(fd, mask, 0, nb_poll_on_ready, &wait) != 0) {
        nb::forget_refused_registration(fd, wait);
        return -1;
    }
    SelTimer timer = {};
    if (timeout > 0 && nb::arm_timeout(timer, wait, timeout) != 0) {
        const int saved = errno;
        if (watch_descriptor) SelRemFD(fd);
        errno = saved;
        return -1;
    }
    nb::wait_for_result(wait);
    if (timeout > 0) SelRemTimer(&timer);
    if (watch_descriptor) SelRemFD(fd);
    return wait.result;
}
