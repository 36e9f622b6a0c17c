/* The epoll backend: the only code that creates, changes or waits on an
 * epoll instance. It knows descriptors and the selector's event bits, and
 * nothing of the registry or of the passes that call it. */
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

#include "selector/epoll_private.h"

namespace qorbu::sel {

int epoll_instance_create() {
    int fd = epoll_create(1);
    /* Descriptor 0 would read as "select mode", so an instance created there
     * is moved to the lowest free descriptor above it. */
    if (fd == 0) {
        const int moved = fcntl(fd, F_DUPFD, 1);
        close(fd);
        fd = moved;
    }
    if (fd < 0) return -1;
    const int flags = fcntl(fd, F_GETFD);
    if (flags < 0 || fcntl(fd, F_SETFD, flags | FD_CLOEXEC) < 0) abort();
    return fd;
}

int epoll_instance_add(int epfd, int fd, unsigned int events) {
    struct epoll_event ev;
    memset(&ev, 0, sizeof ev);
    if (events & SEL_READ) ev.events |= EPOLLIN;
    if (events & SEL_WRITE) ev.events |= EPOLLOUT;
    if (events & SEL_EXCEPT) ev.events |= EPOLLERR | EPOLLHUP;
    ev.data.fd = fd;
    return epoll_ctl(epfd, EPOLL_CTL_ADD, fd, &ev);
}

int epoll_instance_remove(int epfd, int fd) { return epoll_ctl(epfd, EPOLL_CTL_DEL, fd, nullptr); }

int epoll_instance_wait(int epfd, struct epoll_event *events, int max_events, int timeout_ms) {
    return epoll_wait(epfd, events, max_events, timeout_ms);
}

} // namespace qorbu::sel
