/* The self-test (see demo.h): its clients, its helpers (snmpget and the
 * second process, run from a green thread), its controller and verdict. */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include "demo.h"
#include "nbio/nb.h"

enum {
    kMaxChunk = 4096,
    kHelperTimeoutMs = 10000,
    kHelperOutputSize = 2048,
    kDeadlineMs = 25000, /* everything, shutdown included */
};

typedef struct Client {
    SelfTest *test;
    int fd;
    uint32_t random;
    int connected, verified;
    unsigned long long bytes;
    uint32_t round_trips;
    Greenthread *waiting;
    unsigned char out[kMaxChunk], in[kMaxChunk];
} Client;

typedef struct SnmpAnswers {
    int ok;
    unsigned long long open_connections, bytes_echoed, segment_free;
} SnmpAnswers;

typedef struct SecondProcess {
    int ok;
    unsigned int records, free_bytes;
    unsigned long long bytes, record_bytes;
    int pid;
} SecondProcess;

struct SelfTest {
    Demo *demo;
    Client *clients;
    unsigned int client_count;
    unsigned int pending; /* clients still echoing */
    int released;         /* clients may close */
    Greenthread *controller;
    int stopping, finished, timed_out;
    struct timespec echo_started;
    double echo_seconds;
    uint32_t free_while_open, free_after;
    SnmpAnswers snmp;
    SecondProcess second;
    unsigned int checks, held;
    HostTimed *deadline;
};

/* ---- clients -------------------------------------------------------------- */

static uint32_t next_random(uint32_t *state) {
    uint32_t x = *state; /* xorshift32: the state is never 0 */
    x ^= x << 13;
    x ^= x >> 17;
    x ^= x << 5;
    return *state = x;
}

static int echo_round(Client *client) {
    size_t len = 1 + next_random(&client->random) % kMaxChunk;
    for (size_t i = 0; i < len; ++i) client->out[i] = (unsigned char)next_random(&client->random);
    if (nb_write(client->fd, client->out, len) != (int)len ||
        nb_readall(client->fd, client->in, len) != (int)len || memcmp(client->out, client->in, len) != 0)
        return -1;
    client->bytes += len;
    ++client->round_trips;
    return 0;
}

static void run_client(void *arg) {
    Client *client = arg;
    SelfTest *test = client->test;
    const struct sockaddr_in *to = &test->demo->echo.address;
    client->fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (client->fd >= 0 && nb_connect(client->fd, (const struct sockaddr *)to, sizeof *to) == 0) {
        client->connected = 1;
        unsigned long round = 0;
        while (round < test->demo->options.rounds && !test->stopping && echo_round(client) == 0) ++round;
        client->verified = round == test->demo->options.rounds;
    }
    if (--test->pending == 0) greenthread_wakeup(test->controller);
    /* Stay connected until the controller has looked at the segment and
     * the agent, so that every connection is visible there. */
    while (!test->released) {
        client->waiting = current_greenthread();
        greenthread_block();
    }
    client->waiting = NULL;
    if (client->fd >= 0) close(client->fd);
    client->fd = -1;
}

static void release_clients(SelfTest *test) {
    test->released = 1;
    for (unsigned int i = 0; i < test->client_count; ++i) greenthread_wakeup(test->clients[i].waiting);
}

/* ---- snmpget and the second process --------------------------------------- */

extern char **environ;

/* Reads until end of file or a full buffer (a helper that writes more then
 * dies of SIGPIPE); -1 when the helper stayed silent too long. */
static int read_output(int fd, char *out, size_t cap) {
    size_t used = 0;
    for (ssize_t n = 1; n != 0 && used + 1 < cap;) {
        if (nb_poll(fd, POLLIN, kHelperTimeoutMs) < 0) {
            out[used] = '\0';
            return -1;
        }
        n = read(fd, out + used, cap - 1 - used);
        if (n > 0)
            used += (size_t)n;
        else if (n < 0 && errno != EAGAIN && errno != EINTR)
            break;
    }
    out[used] = '\0';
    return 0;
}

/* Runs argv[0] (looked up in PATH) and captures its standard output into out
 * (NUL-terminated) through a non-blocking pipe read with nb_poll, so that the
 * loop, and the agent the helper may be asking, keep running meanwhile. The
 * helper starts with no signal blocked and SIGPIPE no longer ignored (exec
 * resets the handled ones); one silent for kHelperTimeoutMs is killed.
 * Returns its exit status, or -1 with a message in out when it could not be
 * run, was killed or died of a signal. */
static int spawn_capture(char *const argv[], char *out, size_t cap) {
    int fds[2], status;
    pid_t pid;
    if (pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) {
        snprintf(out, cap, "cannot run %s: %s", argv[0], strerror(errno));
        return -1;
    }
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attr;
    sigset_t none, pipe_signal;
    sigemptyset(&none);
    sigemptyset(&pipe_signal);
    sigaddset(&pipe_signal, SIGPIPE);
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
    posix_spawnattr_init(&attr);
    posix_spawnattr_setsigmask(&attr, &none);
    posix_spawnattr_setsigdefault(&attr, &pipe_signal);
    posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    const int err = posix_spawnp(&pid, argv[0], &actions, &attr, argv, environ);
    posix_spawnattr_destroy(&attr);
    posix_spawn_file_actions_destroy(&actions);
    close(fds[1]);
    if (err != 0) {
        close(fds[0]);
        snprintf(out, cap, "cannot run %s: %s", argv[0], strerror(err));
        return -1;
    }
    const int silent = read_output(fds[0], out, cap) != 0;
    close(fds[0]);
    if (silent) kill(pid, SIGKILL);
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {}
    if (silent)
        snprintf(out, cap, "%s gave no answer within %d ms", argv[0], kHelperTimeoutMs);
    else if (!WIFEXITED(status))
        snprintf(out, cap, "%s died of signal %d", argv[0], WIFSIGNALED(status) ? WTERMSIG(status) : 0);
    return silent || !WIFEXITED(status) ? -1 : WEXITSTATUS(status);
}

static int parse_snmp_value(const char *output, const char *oid, unsigned long long *value) {
    char prefix[96];
    snprintf(prefix, sizeof prefix, ".%s = ", oid);
    const char *line = strstr(output, prefix);
    const char *colon = line ? strchr(line + strlen(prefix), ':') : NULL;
    if (!colon) return -1;
    char *end;
    errno = 0;
    *value = strtoull(colon + 1, &end, 10);
    return errno == 0 && end != colon + 1 ? 0 : -1;
}

static void query_agent(SelfTest *test) {
    char target[48], output[kHelperOutputSize];
    snprintf(target, sizeof target, "udp:127.0.0.1:%u", test->demo->snmp_port);
    char *argv[] = {"snmpget",
                    "-v2c",
                    "-c",
                    "public",
                    "-On",
                    "-t",
                    "2",
                    "-r",
                    "2",
                    target,
                    DEMO_OID_OPEN_CONNECTIONS,
                    DEMO_OID_BYTES_ECHOED,
                    DEMO_OID_SEGMENT_FREE,
                    NULL};
    int status = spawn_capture(argv, output, sizeof output);
    SnmpAnswers *snmp = &test->snmp;
    snmp->ok = status == 0 &&
               parse_snmp_value(output, DEMO_OID_OPEN_CONNECTIONS, &snmp->open_connections) == 0 &&
               parse_snmp_value(output, DEMO_OID_BYTES_ECHOED, &snmp->bytes_echoed) == 0 &&
               parse_snmp_value(output, DEMO_OID_SEGMENT_FREE, &snmp->segment_free) == 0;
    if (!snmp->ok)
        fprintf(stderr, "qorbu-demo: snmpget failed (status %d): %s\n", status,
                status < 0 ? output : "unexpected answer");
}

static void inspect_from_second_process(SelfTest *test) {
    char output[kHelperOutputSize];
    char *argv[] = {"/proc/self/exe", "--inspect", (char *)test->demo->options.segment_name, NULL};
    int status = spawn_capture(argv, output, sizeof output);
    SecondProcess *second = &test->second;
    second->ok = status == 0 &&
                 sscanf(output, "records %u bytes %llu record-bytes %llu free %u pid %d", &second->records,
                        &second->bytes, &second->record_bytes, &second->free_bytes, &second->pid) == 5;
    if (!second->ok)
        fprintf(stderr, "qorbu-demo: the second process failed (status %d): %s\n", status, output);
}

/* ---- the controller ------------------------------------------------------- */

/* What the clients did, counted once for the checks and the summary. */
typedef struct Tally {
    unsigned int connected, verified, round_trips;
    unsigned long long sent;
} Tally;

/* Counts one check; a failed one is listed in the summary with what was seen. */
__attribute__((format(printf, 3, 4))) static void check(SelfTest *test, int held, const char *format, ...) {
    ++test->checks;
    if (held) {
        ++test->held;
        return;
    }
    va_list args;
    va_start(args, format);
    printf("  FAILED          ");
    vprintf(format, args);
    putchar('\n');
    va_end(args);
}

/* The 14 checks. */
static void evaluate(SelfTest *test, const Tally *t) {
    const unsigned int n = test->client_count, free_while_open = test->free_while_open;
    const unsigned long long echoed = test->demo->summary->bytes_echoed;
    const SnmpAnswers *snmp = &test->snmp;
    const SecondProcess *second = &test->second;
    check(test, t->connected == n, "%u of %u clients connected", t->connected, n);
    check(test, t->verified == n, "%u of %u clients got every byte back", t->verified, n);
    check(test, echoed == t->sent, "the service echoed %llu bytes, the clients sent %llu", echoed, t->sent);
    check(test, snmp->ok, "snmpget gave no usable answer");
    if (snmp->ok) {
        check(test, snmp->open_connections == n, "SNMP open connections %llu, expected %u",
              snmp->open_connections, n);
        check(test, snmp->bytes_echoed == echoed, "SNMP bytes echoed %llu, expected %llu", snmp->bytes_echoed,
              echoed);
        check(test, snmp->segment_free == free_while_open, "SNMP segment free %llu, expected %u",
              snmp->segment_free, free_while_open);
    }
    check(test, second->ok, "the second process could not read the segment");
    if (second->ok) {
        check(test, second->pid == test->demo->summary->pid, "the second process saw owner pid %d, not %d",
              second->pid, test->demo->summary->pid);
        check(test, second->records == n, "the second process saw %u records, expected %u", second->records,
              n);
        check(test, second->bytes == echoed && second->record_bytes == echoed,
              "the second process saw %llu bytes (%llu in records), expected %llu", second->bytes,
              second->record_bytes, echoed);
        check(test, second->free_bytes == free_while_open,
              "the second process counted %u free bytes, expected %u", second->free_bytes, free_while_open);
    }
    check(test, test->free_after == test->demo->free_at_start,
          "free bytes %u after the clients left, %u before: records leaked", test->free_after,
          test->demo->free_at_start);
    check(test, !test->stopping, "the self-test was interrupted%s",
          test->timed_out ? " by its deadline" : "");
}

/* The summary, the failed checks and the verdict on standard output. */
static void report(SelfTest *test) {
    Tally t = {0, 0, 0, 0};
    for (const Client *c = test->clients; c < test->clients + test->client_count; ++c) {
        t.connected += (unsigned int)c->connected;
        t.verified += (unsigned int)c->verified;
        t.round_trips += c->round_trips;
        t.sent += c->bytes;
    }
    const SnmpAnswers *snmp = &test->snmp;
    const SecondProcess *second = &test->second;
    printf("qorbu-demo self-test\n");
    printf("  connections     %u of %u clients connected\n", t.connected, test->client_count);
    printf("  bytes echoed    %llu\n", (unsigned long long)test->demo->summary->bytes_echoed);
    printf("  round trips     %u in %.3f s, %.0f per second\n", t.round_trips, test->echo_seconds,
           t.round_trips / (test->echo_seconds > 0 ? test->echo_seconds : 1e-9));
    if (snmp->ok)
        printf("  snmpget         open connections %llu, bytes echoed %llu, segment free %llu\n",
               snmp->open_connections, snmp->bytes_echoed, snmp->segment_free);
    else
        printf("  snmpget         no answer\n");
    if (second->ok)
        printf("  second process  %u records, %llu bytes, %u bytes free\n", second->records, second->bytes,
               second->free_bytes);
    else
        printf("  second process  no answer\n");
    printf("  segment free    %u bytes before, %u with the clients connected, %u after\n",
           test->demo->free_at_start, test->free_while_open, test->free_after);
    evaluate(test, &t);
    test->finished = 1;
    printf("  result          %s: %u of %u checks held\n", selftest_passed(test) ? "PASS" : "FAIL",
           test->held, test->checks);
    fflush(stdout);
}

static void run_controller(void *arg) {
    SelfTest *test = arg;
    Demo *demo = test->demo;
    while (test->pending > 0) /* woken by the last client to finish echoing */
        greenthread_block();
    test->echo_seconds = demo_seconds_since(&test->echo_started);
    if (!test->stopping) {
        test->free_while_open = ShmTotalFree(demo->segment);
        query_agent(test);
        inspect_from_second_process(test);
    }
    release_clients(test);
    echo_wait_idle(&demo->echo);
    test->free_after = ShmTotalFree(demo->segment);
    report(test);
    demo_request_stop(demo, "self-test finished");
}

static void on_deadline(void *arg) {
    SelfTest *test = arg;
    test->deadline = NULL;
    if (test->finished) return;
    fprintf(stderr, "qorbu-demo: the self-test did not finish within %d ms\n", kDeadlineMs);
    test->timed_out = 1;
    demo_request_stop(test->demo, "self-test deadline");
}

/* ---- the interface -------------------------------------------------------- */

/* A green thread that cannot be created ends the process (greenthread_create
 * raises SIGSEGV), so only memory is checked here. */
SelfTest *selftest_start(Demo *demo) {
    const unsigned int count = (unsigned int)demo->options.clients;
    SelfTest *test = calloc(1, sizeof *test);
    Client *clients = test ? calloc(count, sizeof *clients) : NULL;
    if (!clients) {
        free(test);
        fprintf(stderr, "qorbu-demo: out of memory for %u self-test clients\n", count);
        return NULL;
    }
    *test = (SelfTest){.demo = demo, .clients = clients, .client_count = count, .pending = count};
    SelGetTime(&test->echo_started);
    test->controller = greenthread_create(run_controller, test);
    for (unsigned int i = 0; i < count; ++i) {
        const uint32_t seed = (0x9e3779b9u * (i + 1) ^ (uint32_t)getpid()) | 1;
        clients[i] = (Client){.test = test, .fd = -1, .random = seed};
        greenthread_create(run_client, &clients[i]);
    }
    test->deadline = host_after(&demo->host, HOST_LIST_URGENT, kDeadlineMs, on_deadline, test);
    return test;
}

void selftest_stop(SelfTest *test) {
    if (test->finished || test->stopping) return;
    test->stopping = 1;
    for (unsigned int i = 0; i < test->client_count; ++i)
        if (test->clients[i].fd >= 0) shutdown(test->clients[i].fd, SHUT_RDWR);
    release_clients(test);
}

int selftest_passed(const SelfTest *test) {
    return test->finished && test->checks > 0 && test->held == test->checks;
}

void selftest_free(SelfTest *test) {
    if (!test) return;
    if (test->deadline) host_cancel(&test->demo->host, test->deadline);
    free(test->clients);
    free(test);
}
