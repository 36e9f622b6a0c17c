// Helpers shared by the green-thread test binaries.
#ifndef QORBU_TESTS_GREENTHREADS_GT_TEST_SUPPORT_H
#define QORBU_TESTS_GREENTHREADS_GT_TEST_SUPPORT_H

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <string>
#include <utility>

#include "greenthreads/greenthread_private.h"
#include "nbio/nb_private.h"
#include "selector/sel_private.h"
#include "support/test_support.h"

namespace qorbu::test {

/* Permissions ("rw-p", "---p", ...) of the mapping that holds addr, and
 * whether addr is where that mapping starts; empty when none holds it. */
struct MappingAt {
    std::string perms;
    bool startsHere = false;
};

inline MappingAt mapping_at(const void *addr) {
    MappingAt found;
    FILE *maps = fopen("/proc/self/maps", "r");
    if (maps == nullptr) return found;
    const auto target = reinterpret_cast<uintptr_t>(addr);
    char line[512];
    while (fgets(line, sizeof line, maps) != nullptr) {
        unsigned long long low = 0, high = 0;
        char perms[8] = {};
        if (sscanf(line, "%llx-%llx %7s", &low, &high, perms) == 3 && target >= low && target < high) {
            found.perms = perms;
            found.startsHere = target == low;
            break;
        }
    }
    fclose(maps);
    return found;
}

/* qemu-user leaves inaccessible guest pages out of its /proc/self/maps. */
inline bool is_inaccessible(const MappingAt &mapping) {
    return mapping.perms == "---p" || (kEmulated && mapping.perms.empty());
}

inline void set_nonblocking(int fd) { fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK); }

/* A connected pair of non-blocking stream sockets. */
struct SocketPair {
    int fd[2] = {-1, -1};
    SocketPair() {
        if (socketpair(AF_UNIX, SOCK_STREAM, 0, fd) == 0) {
            set_nonblocking(fd[0]);
            set_nonblocking(fd[1]);
        }
    }
    ~SocketPair() { close_end(0), close_end(1); }
    void close_end(int i) { close(fd[i]), fd[i] = -1; } // closing -1 is harmless
};

/* A non-blocking TCP socket bound to an ephemeral loopback port. */
struct Listener {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    explicit Listener(int backlog = 64, bool listening = true) {
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof addr;
        if (bind(fd, address(), sizeof addr) != 0 ||
            getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len) != 0 ||
            (listening && listen(fd, backlog) != 0)) {
            close(fd);
            fd = -1;
            return;
        }
        set_nonblocking(fd);
    }
    ~Listener() { close(fd); }
    const sockaddr *address() const { return reinterpret_cast<const sockaddr *>(&addr); }
};

inline int tcp_socket() {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    set_nonblocking(fd);
    return fd;
}

inline double seconds_now() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

/* fd's event mask in this thread's selector, 0 when unregistered. */
inline unsigned registered_events(int fd) {
    SelContext *ctx = SelCurrentContext();
    return fd < 0 || fd >= ctx->fdTableSize ? 0 : ctx->fdTable[fd].events;
}

inline int armed_timers() { return SelCurrentContext()->timerCount; }

/* Runs fn() in a green thread; start the threads with greenthreads_run. */
template <typename Fn>
Greenthread *spawn(Fn *fn) {
    return greenthread_create([](void *arg) { (*static_cast<Fn *>(arg))(); }, fn);
}

/* Starts each functor in a green thread and runs them all to their end. */
template <typename... Fn>
void run_threads(Fn &...fns) {
    (spawn(&fns), ...);
    greenthreads_run();
}

/* A call's result and the errno it left. */
using Outcome = std::pair<int, int>;
inline Outcome with_errno(int result) { return {result, errno}; }
inline Outcome failure(int error) { return {-1, error}; }

/* Ensures descriptors up to `needed` can be opened; false when the hard
 * limit forbids it. */
inline bool raise_fd_limit(rlim_t needed) {
    rlimit limit;
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return false;
    if (limit.rlim_cur >= needed) return true;
    limit.rlim_cur = needed; // refused above the hard limit
    return setrlimit(RLIMIT_NOFILE, &limit) == 0;
}

#define SKIP_UNLESS_FD_LIMIT(needed)                                                                         \
    if (!::qorbu::test::raise_fd_limit(needed))                                                              \
    GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below " << (needed)

class GreenIo : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(SelInit(), 0);
        greenthreads_init();
        ASSERT_NE(current_greenthread(), nullptr);
        timersBefore = armed_timers();
    }
    /* Every wait removes its registration and timer on return. */
    void expect_nothing_left(int fd) {
        EXPECT_EQ(registered_events(fd), 0u) << "descriptor " << fd << " still registered";
        EXPECT_EQ(armed_timers(), timersBefore) << "a timer is still armed";
    }
    int timersBefore = 0;
};

} // namespace qorbu::test

#endif
