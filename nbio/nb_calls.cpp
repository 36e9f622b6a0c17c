/* Blocking-style descriptor calls for green threads: each tries the system
 * call first and waits in nb_poll only when the descriptor would block. */
#include <cerrno>
#include <climits>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include "nbio/nb_private.h"

static_assert(EAGAIN == EWOULDBLOCK, "one would-block code to wait on");

namespace {

/* Results are ints, so one call moves at most INT_MAX bytes. */
constexpr size_t kMaxTransfer = INT_MAX;

/* True once the descriptor is ready; false (errno set) when the selector
 * refused the descriptor, so that nothing could ever wake the thread. */
bool wait_until_ready(int fd, int events) { return nb_poll(fd, events, 0) > 0; }

bool would_block() { return errno == EAGAIN; }

} // namespace

extern "C" {

int nb_accept(int fd, struct sockaddr *addr, socklen_t *addrlen) {
    for (;;) {
        const int accepted = accept(fd, addr, addrlen);
        if (accepted >= 0) return accepted;
        if (!would_block() || !wait_until_ready(fd, POLLIN)) return -1;
    }
}

int nb_connect(int fd, const struct sockaddr *addr, socklen_t addrlen) {
    if (connect(fd, addr, addrlen) == 0) return 0;
    if (errno != EINPROGRESS || !wait_until_ready(fd, POLLOUT)) return -1;
    int error = 0;
    socklen_t length = sizeof error;
    if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) != 0) return -1;
    if (error != 0) {
        errno = error;
        return -1;
    }
    return 0;
}

int nb_read(int fd, void *buf, size_t len) {
    if (len > kMaxTransfer) len = kMaxTransfer; /* a short read is always allowed */
    for (;;) {
        const ssize_t count = read(fd, buf, len);
        if (count >= 0) return static_cast<int>(count);
        if (!would_block() || !wait_until_ready(fd, POLLIN)) return -1;
    }
}

int nb_readall(int fd, void *buf, size_t len) {
    if (len > kMaxTransfer) {
        errno = EINVAL;
        return -1;
    }
    auto *bytes = static_cast<char *>(buf);
    size_t done = 0;
    while (done < len) {
        const ssize_t count = read(fd, bytes + done, len - done);
        if (count > 0) {
            done += static_cast<size_t>(count);
        } else if (count == 0) {
            break;
        } else if (!would_block() || !wait_until_ready(fd, POLLIN)) {
            return -1;
        }
    }
    return static_cast<int>(done);
}

int nb_write(int fd, const void *buf, size_t len) {
    if (len > kMaxTransfer) {
        errno = EINVAL;
        return -1;
    }
    const auto *bytes = static_cast<const char *>(buf);
    size_t done = 0;
    while (done < len) {
        const ssize_t count = write(fd, bytes + done, len - done);
        if (count >= 0) {
            done += static_cast<size_t>(count);
        } else if (!would_block() || !wait_until_ready(fd, POLLOUT)) {
            return -1;
        }
    }
    return static_cast<int>(done);
}

} // extern "C"
