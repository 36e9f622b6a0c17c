// Descriptors and green-thread helpers for the descriptor-call tests.
#ifndef QORBU_TESTS_GREENTHREADS_NB_TEST_SUPPORT_H
#define QORBU_TESTS_GREENTHREADS_NB_TEST_SUPPORT_H

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include "greenthreads/greenthread_private.h"
#include "nbio/nb_private.h"
#include "selector/sel_private.h"

namespace qorbu::test {

inline void set_nonblocking(int fd)
{
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
}

/* A connected pair of non-blocking stream sockets. */
struct SocketPair {
    int fd[2] = {-1, -1};
    SocketPair()
    {
        if (socketpair(AF_UNIX, SOCK_STREAM, 0, fd) == 0) {
            set_nonblocking(fd[0]);
            set_nonblocking(fd[1]);
        }
    }
    ~SocketPair()
    {
        for (int f : fd)
            if (f >= 0)
                close(f);
    }
    void close_end(int i)
    {
        close(fd[i]);
        fd[i] = -1;
    }
};

/* A non-blocking TCP listener on an ephemeral loopback port. */
struct Listener {
    int fd = -1;
    sockaddr_in addr{};
    explicit Listener(int backlog = 64, bool listening = true)
    {
        fd = socket(AF_INET, SOCK_STREAM, 0);
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr.sin_port = 0;
        socklen_t len = sizeof addr;
        if (bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof addr) != 0 ||
            getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len) != 0 ||
            (listening && listen(fd, backlog) != 0)) {
            close(fd);
            fd = -1;
            return;
        }
        set_nonblocking(fd);
    }
    ~Listener()
    {
        if (fd >= 0)
            close(fd);
    }
    const sockaddr *address() const { return reinterpret_cast<const sockaddr *>(&addr); }
};

inline int tcp_socket()
{
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking(fd);
    return fd;
}

inline double seconds_now()
{
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

/* Registration state of fd in this thread's selector: its event mask, 0
 * when unregistered. */
inline unsigned registered_events(int fd)
{
    SelContext *ctx = SelCurrentContext();
    if (fd < 0 || fd >= ctx->fdTableSize)
        return 0;
    return ctx->fdTable[fd].events;
}

inline int armed_timers() { return SelCurrentContext()->timerCount; }

/* Runs fn(arg) in a green thread; start the threads with greenthreads_run. */
template <typename Fn>
Greenthread *spawn(Fn *fn)
{
    return greenthread_create([](void *arg) { (*static_cast<Fn *>(arg))(); }, fn);
}

/* Lets the other queued threads run n times. */
inline void yield_times(int n)
{
    for (int i = 0; i < n; ++i)
        greenthread_yield();
}

/* Sleeps in the selector: a wait on no event ends with its time-out. */
inline void sleep_ms(int ms) { nb_poll(-1, 0, ms); }

/* Ensures descriptors up to `needed` can be opened; false when the hard
 * limit forbids it. */
inline bool raise_fd_limit(rlim_t needed)
{
    rlimit limit;
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0)
        return false;
    if (limit.rlim_cur >= needed)
        return true;
    if (limit.rlim_max != RLIM_INFINITY && limit.rlim_max < needed)
        return false;
    limit.rlim_cur = needed;
    return setrlimit(RLIMIT_NOFILE, &limit) == 0;
}

class GreenIo : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(SelInit(), 0);
        greenthreads_init();
        timersBefore = armed_timers();
    }
    /* Every wait removes its registration and timer on return. */
    void expect_nothing_left(int fd)
    {
        EXPECT_EQ(registered_events(fd), 0u) << "descriptor " << fd << " still registered";
        EXPECT_EQ(armed_timers(), timersBefore) << "a timer is still armed";
    }
    int timersBefore = 0;
};

} // namespace qorbu::test

#endif
