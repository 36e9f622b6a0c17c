/* The epoll backend (epoll.cpp): calls on an epoll instance that know
 * nothing of the registry or the passes. Each answers as the system call it
 * makes: a count or 0, or -1 with the kernel's errno. */
#ifndef QORBU_SELECTOR_EPOLL_PRIVATE_H
#define QORBU_SELECTOR_EPOLL_PRIVATE_H

#include <sys/epoll.h>

#include <cstdint>

#include "selector/sel.h"

namespace qorbu::sel {

/* A new instance, close-on-exec and never at descriptor 0. */
int epoll_instance_create();
/* Watches fd for the selector's event bits, level-triggered; the event's
 * data is the descriptor number. */
int epoll_instance_add(int epfd, int fd, unsigned int events);
int epoll_instance_remove(int epfd, int fd);
/* Waits up to timeout_ms (-1: without limit) for at most max_events events. */
int epoll_instance_wait(int epfd, struct epoll_event *events, int max_events, int timeout_ms);

/* The selector's one bit for a reported event: SEL_READ when readable, else
 * SEL_WRITE when writable, else SEL_EXCEPT (an error or a hang-up alone). */
inline unsigned int selector_event(uint32_t flags) {
    if (flags & EPOLLIN) return SEL_READ;
    if (flags & EPOLLOUT) return SEL_WRITE;
    return SEL_EXCEPT;
}

} // namespace qorbu::sel

#endif
