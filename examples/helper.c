/* See helper.h. */
#define _GNU_SOURCE
#include "helper.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <stdio.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include "nbio/nb.h"

extern char **environ;

/* The helper starts with an empty signal mask and default dispositions,
 * whatever the daemon blocks (its registered signals) or ignores (SIGPIPE). */
static int prepare_attributes(posix_spawnattr_t *attr)
{
    sigset_t none, defaults;
    sigemptyset(&none);
    sigemptyset(&defaults);
    sigaddset(&defaults, SIGPIPE);
    sigaddset(&defaults, SIGINT);
    sigaddset(&defaults, SIGTERM);
    if (posix_spawnattr_init(attr) != 0)
        return -1;
    posix_spawnattr_setsigmask(attr, &none);
    posix_spawnattr_setsigdefault(attr, &defaults);
    posix_spawnattr_setflags(attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    return 0;
}

static int start_helper(char *const argv[], int *readEnd, pid_t *pid)
{
    int pipeFds[2];
    if (pipe2(pipeFds, O_CLOEXEC | O_NONBLOCK) != 0)
        return errno;
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attr;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, pipeFds[1], STDOUT_FILENO);
    int err = prepare_attributes(&attr) == 0 ? 0 : ENOMEM;
    if (err == 0) {
        err = posix_spawnp(pid, argv[0], &actions, &attr, argv, environ);
        posix_spawnattr_destroy(&attr);
    }
    posix_spawn_file_actions_destroy(&actions);
    close(pipeFds[1]);
    if (err != 0) {
        close(pipeFds[0]);
        return err;
    }
    *readEnd = pipeFds[0];
    return 0;
}

/* Reads until end of file; 0, or -1 when the helper stayed silent too long. */
static int read_output(int fd, char *out, size_t cap, int timeoutMs)
{
    size_t used = 0;
    char discard[256];
    for (;;) {
        if (nb_poll(fd, POLLIN, timeoutMs) < 0) {
            out[used] = '\0';
            return -1;
        }
        const int room = used + 1 < cap;
        ssize_t n = read(fd, room ? out + used : discard, room ? cap - 1 - used : sizeof discard);
        if (n > 0 && room)
            used += (size_t)n;
        else if (n == 0 || (n < 0 && errno != EAGAIN && errno != EINTR))
            break;
    }
    out[used] = '\0';
    return 0;
}

int spawn_capture(char *const argv[], char *out, size_t cap, int timeoutMs)
{
    int fd;
    pid_t pid;
    int err = start_helper(argv, &fd, &pid);
    if (err != 0) {
        snprintf(out, cap, "cannot run %s: %s", argv[0], strerror(err));
        return -1;
    }
    int silent = read_output(fd, out, cap, timeoutMs);
    close(fd);
    if (silent)
        kill(pid, SIGKILL);
    int status;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (silent) {
        snprintf(out, cap, "%s gave no answer within %d ms", argv[0], timeoutMs);
        return -1;
    }
    if (WIFEXITED(status) && WEXITSTATUS(status) == 127 && out[0] == '\0') {
        snprintf(out, cap, "cannot run %s", argv[0]);
        return -1;
    }
    if (!WIFEXITED(status)) {
        snprintf(out, cap, "%s died of signal %d", argv[0], WIFSIGNALED(status) ? WTERMSIG(status) : 0);
        return -1;
    }
    return WEXITSTATUS(status);
}
