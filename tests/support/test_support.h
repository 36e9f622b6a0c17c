/* What the test binaries share: the build they run in, descriptors, the
 * process's mappings, child processes, and checks of errno. */
#ifndef QORBU_TESTS_SUPPORT_TEST_SUPPORT_H
#define QORBU_TESTS_SUPPORT_TEST_SUPPORT_H

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <dirent.h>
#include <string>
#include <utility>

namespace qorbu::test {

/* Under qemu-user (i386, armhf): slower, no robust mutexes, no
 * MAP_FIXED_NOREPLACE; tests scale counts down (never checks) or skip. */
constexpr bool kEmulated =
#ifdef QORBU_TESTS_EMULATED
    true;
#else
    false;
#endif

constexpr int scaled(int native, int emulated) { return kEmulated ? emulated : native; }

inline void set_nonblocking(int fd) { fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK); }

/* A pipe whose read end sits at a chosen descriptor number, when one is given. */
struct Pipe {
    explicit Pipe(int read_at = -1) {
        int fds[2];
        EXPECT_EQ(pipe(fds), 0);
        r = fds[0], w = fds[1];
        if (read_at >= 0 && read_at != r) {
            EXPECT_EQ(dup2(r, read_at), read_at);
            close(r);
            r = read_at;
        }
    }
    ~Pipe() { close(r), close(w); }
    Pipe(const Pipe &) = delete;
    void fill() { EXPECT_EQ(write(w, "x", 1), 1); }
    int r = -1, w = -1;
};

/* A connected pair of stream sockets, non-blocking unless asked otherwise. */
struct SocketPair {
    explicit SocketPair(bool nonblocking = true) {
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fd), 0);
        if (nonblocking) set_nonblocking(fd[0]), set_nonblocking(fd[1]);
    }
    ~SocketPair() { close_end(0), close_end(1); }
    SocketPair(const SocketPair &) = delete;
    void close_end(int i) { close(fd[i]), fd[i] = -1; }
    int fd[2] = {-1, -1};
};

/* A non-blocking socket bound to an ephemeral loopback port (TCP, listening, unless asked otherwise). */
struct Listener {
    explicit Listener(int backlog = 64, bool listening = true, int type = SOCK_STREAM)
        : fd(socket(AF_INET, type, 0)) {
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof addr;
        const bool ok = bind(fd, address(), sizeof addr) == 0 &&
                        getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len) == 0 &&
                        (!listening || listen(fd, backlog) == 0);
        EXPECT_TRUE(ok) << "loopback listener: errno " << errno;
        set_nonblocking(fd);
    }
    ~Listener() { close(fd); }
    Listener(const Listener &) = delete;
    const sockaddr *address() const { return reinterpret_cast<const sockaddr *>(&addr); }
    int fd;
    sockaddr_in addr{};
};

/* Makes descriptors below `needed` openable; false when the hard limit forbids it. */
inline bool raise_fd_limit(rlim_t needed) {
    rlimit limit;
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return false;
    if (limit.rlim_cur >= needed) return true;
    limit.rlim_cur = needed;
    return setrlimit(RLIMIT_NOFILE, &limit) == 0;
}
#define SKIP_UNLESS_FD_LIMIT(needed)                                                                         \
    if (!::qorbu::test::raise_fd_limit(needed))                                                              \
    GTEST_SKIP() << "RLIMIT_NOFILE's hard limit is below " << (needed)

inline int open_descriptor_count() {
    int count = 0;
    DIR *dir = opendir("/proc/self/fd");
    while (dir != nullptr && readdir(dir) != nullptr) count++;
    if (dir != nullptr) closedir(dir);
    return count;
}

/* Permissions ("rw-p", "---p", ...) of the mapping that holds addr; empty
 * when nothing is mapped there (qemu-user leaves inaccessible pages out). */
inline std::string perms_at(uintptr_t addr) {
    FILE *maps = fopen("/proc/self/maps", "r");
    char line[512], perms[8] = "";
    unsigned long long low = 0, high = 0;
    while (maps != nullptr && fgets(line, sizeof line, maps) != nullptr)
        if (sscanf(line, "%llx-%llx %7s", &low, &high, perms) == 3 && addr >= low && addr < high) break;
    if (maps != nullptr) fclose(maps);
    return addr >= low && addr < high ? perms : "";
}

inline double seconds_now() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

/* Exit status of pid, or 128 + the signal that ended it. */
inline int wait_status(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0)
        if (errno != EINTR) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

/* Runs body in a child process that an alarm ends after `seconds`. */
template <typename Body>
pid_t start_child(Body body, unsigned seconds) {
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(seconds);
        _exit(body());
    }
    return pid;
}
template <typename Body>
int run_in_child(Body body, unsigned seconds) {
    return wait_status(start_child(body, seconds));
}

/* A call's result and the errno it left. */
using Outcome = std::pair<long, int>;
inline Outcome failure(int error) { return {-1, error}; }
#define OUTCOME(call) (errno = 0, ::qorbu::test::Outcome{static_cast<long>(call), errno})

} // namespace qorbu::test

#endif
