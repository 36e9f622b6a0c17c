/* The self-test (see demo.h): its clients, its helpers (snmpget and the
 * second process, run from a green thread), its controller and verdict. */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
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
    kMaxFailures = 16,
    kFailureTextSize = 160,
};

typedef struct Client {
    SelfTest *test;
    unsigned int index;
    int fd;
    uint32_t random;
    int connected;
    int verified;
    uint64_t bytes;
    uint32_t roundTrips;
    Greenthread *waiting;
    unsigned char out[kMaxChunk];
    unsigned char in[kMaxChunk];
} Client;

typedef struct SnmpAnswers {
    int ok;
    uint64_t openConnections, bytesEchoed, segmentFree;
} SnmpAnswers;

typedef struct SecondProcess {
    int ok;
    unsigned int records;
    unsigned long long bytes, recordBytes;
    unsigned int freeBytes;
    int pid;
} SecondProcess;

struct SelfTest {
    Demo *demo;
    Client *clients;
    unsigned int clientCount;
    unsigned int pending;        /* clients still echoing */
    unsigned int released;       /* clients may close */
    Greenthread *controller;
    int controllerWaiting;
    int stopping;
    int finished;
    int timedOut;
    struct timespec echoStarted;
    double echoSeconds;
    uint32_t freeWhileOpen;
    uint32_t freeAfter;
    SnmpAnswers snmp;
    SecondProcess second;
    unsigned int checks, held;
    unsigned int failureCount;
    char failures[kMaxFailures][kFailureTextSize];
    HostTimed *deadline;
};

/* ---- the checks ----------------------------------------------------------- */

__attribute__((format(printf, 3, 4))) static void check(SelfTest *test, int held, const char *format, ...) {
    ++test->checks;
    if (held) {
        ++test->held;
        return;
    }
    if (test->failureCount < kMaxFailures) {
        va_list args;
        va_start(args, format);
        vsnprintf(test->failures[test->failureCount], kFailureTextSize, format, args);
        va_end(args);
    }
    ++test->failureCount;
}

/* ---- clients -------------------------------------------------------------- */

static uint32_t next_random(uint32_t *state) {
    uint32_t x = *state; /* xorshift32 */
    x ^= x << 13;
    x ^= x >> 17;
    x ^= x << 5;
    return *state = x;
}

static int connect_client(Client *client) {
    client->fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (client->fd < 0)
        return -1;
    const struct sockaddr_in *to = &client->test->demo->echo.address;
    return nb_connect(client->fd, (const struct sockaddr *)to, sizeof *to);
}

static int echo_round(Client *client) {
    size_t len = 1 + next_random(&client->random) % kMaxChunk;
    for (size_t i = 0; i < len; ++i)
        client->out[i] = (unsigned char)next_random(&client->random);
    if (nb_write(client->fd, client->out, len) != (int)len)
        return -1;
    if (nb_readall(client->fd, client->in, len) != (int)len)
        return -1;
    if (memcmp(client->out, client->in, len) != 0)
        return -1;
    client->bytes += len;
    ++client->roundTrips;
    return 0;
}

static void client_finished_echoing(SelfTest *test) {
    if (--test->pending == 0 && test->controllerWaiting)
        greenthread_wakeup(test->controller);
}

static void run_client(void *arg) {
    Client *client = arg;
    SelfTest *test = client->test;
    if (connect_client(client) == 0) {
        client->connected = 1;
        unsigned int round = 0;
        while (round < test->demo->options.rounds && !test->stopping && echo_round(client) == 0)
            ++round;
        client->verified = round == test->demo->options.rounds;
    }
    client_finished_echoing(test);
    /* Stay connected until the controller has looked at the segment and
     * the agent, so that every connection is visible there. */
    while (!test->released && !test->stopping) {
        client->waiting = current_greenthread();
        greenthread_block();
    }
    client->waiting = NULL;
    if (client->fd >= 0)
        close(client->fd);
    client->fd = -1;
}

static void release_clients(SelfTest *test) {
    test->released = 1;
    for (unsigned int i = 0; i < test->clientCount; ++i)
        if (test->clients[i].waiting)
            greenthread_wakeup(test->clients[i].waiting);
}

/* ---- snmpget and the second process --------------------------------------- */

extern char **environ;

/* The helper starts with an empty signal mask and default dispositions,
 * whatever the daemon blocks (its registered signals) or ignores (SIGPIPE). */
static int prepare_attributes(posix_spawnattr_t *attr) {
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

static int start_helper(char *const argv[], int *readEnd, pid_t *pid) {
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
static int read_output(int fd, char *out, size_t cap, int timeoutMs) {
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

/* Runs argv[0] (looked up in PATH) with argv, captures up to cap - 1 bytes
 * of its standard output into out (NUL-terminated) and waits for it, while
 * the loop (and the SNMP agent the helper may be talking to) keeps running:
 * the output is read through a non-blocking pipe with nb_poll. A helper
 * silent for longer than timeoutMs is killed. Returns its exit status
 * (0..255), or -1 with a message in out when it could not be run, was
 * killed or died of a signal. */
static int spawn_capture(char *const argv[], char *out, size_t cap, int timeoutMs) {
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

static int parse_snmp_value(const char *output, const char *oid, uint64_t *value) {
    char prefix[96];
    snprintf(prefix, sizeof prefix, ".%s = ", oid);
    const char *line = strstr(output, prefix);
    if (!line)
        return -1;
    const char *colon = strchr(line + strlen(prefix), ':');
    if (!colon)
        return -1;
    char *end;
    errno = 0;
    unsigned long long parsed = strtoull(colon + 1, &end, 10);
    if (errno != 0 || end == colon + 1)
        return -1;
    *value = parsed;
    return 0;
}

static void query_agent(SelfTest *test) {
    char target[48], output[kHelperOutputSize];
    snprintf(target, sizeof target, "udp:127.0.0.1:%u", test->demo->snmpPort);
    char *argv[] = {"snmpget", "-v2c", "-c", "public", "-On", "-t", "2", "-r", "2", target,
                    DEMO_OID_OPEN_CONNECTIONS, DEMO_OID_BYTES_ECHOED, DEMO_OID_SEGMENT_FREE, NULL};
    int status = spawn_capture(argv, output, sizeof output, kHelperTimeoutMs);
    SnmpAnswers *snmp = &test->snmp;
    snmp->ok = status == 0 && parse_snmp_value(output, DEMO_OID_OPEN_CONNECTIONS, &snmp->openConnections) == 0 &&
               parse_snmp_value(output, DEMO_OID_BYTES_ECHOED, &snmp->bytesEchoed) == 0 &&
               parse_snmp_value(output, DEMO_OID_SEGMENT_FREE, &snmp->segmentFree) == 0;
    if (!snmp->ok)
        fprintf(stderr, "qorbu-demo: snmpget failed (status %d): %s\n", status,
                status < 0 ? output : "unexpected answer");
}

static void read_segment_from_second_process(SelfTest *test) {
    char self[4096], output[kHelperOutputSize];
    ssize_t len = readlink("/proc/self/exe", self, sizeof self - 1);
    if (len <= 0) {
        perror("qorbu-demo: /proc/self/exe");
        return;
    }
    self[len] = '\0';
    char *argv[] = {self, "--inspect", (char *)test->demo->options.segmentName, NULL};
    int status = spawn_capture(argv, output, sizeof output, kHelperTimeoutMs);
    SecondProcess *second = &test->second;
    second->ok = status == 0 &&
                 sscanf(output, "records %u bytes %llu record-bytes %llu free %u pid %d", &second->records,
                        &second->bytes, &second->recordBytes, &second->freeBytes, &second->pid) == 5;
    if (!second->ok)
        fprintf(stderr, "qorbu-demo: the second process failed (status %d): %s\n", status, output);
}

/* ---- the controller ------------------------------------------------------- */

/* What the clients did, counted once for the checks and the summary. */
typedef struct Tally {
    unsigned int connected, verified, roundTrips;
    uint64_t sent;
} Tally;

static Tally count_clients(const SelfTest *test) {
    Tally t = {0, 0, 0, 0};
    for (const Client *c = test->clients; c < test->clients + test->clientCount; ++c) {
        t.connected += (unsigned int)c->connected;
        t.verified += (unsigned int)c->verified;
        t.roundTrips += c->roundTrips;
        t.sent += c->bytes;
    }
    return t;
}

/* The 14 checks. */
static void evaluate(SelfTest *test, const Tally *t) {
    const unsigned int n = test->clientCount, freeWhileOpen = test->freeWhileOpen;
    const uint64_t echoed = test->demo->summary->bytesEchoed;
    const SnmpAnswers *snmp = &test->snmp;
    const SecondProcess *second = &test->second;
    check(test, t->connected == n, "%u of %u clients connected", t->connected, n);
    check(test, t->verified == n, "%u of %u clients got every byte back", t->verified, n);
    check(test, echoed == t->sent, "the service echoed %" PRIu64 " bytes, the clients sent %" PRIu64, echoed,
          t->sent);
    check(test, snmp->ok, "snmpget gave no usable answer");
    if (snmp->ok) {
        check(test, snmp->openConnections == n, "SNMP open connections %" PRIu64 ", expected %u",
              snmp->openConnections, n);
        check(test, snmp->bytesEchoed == echoed, "SNMP bytes echoed %" PRIu64 ", expected %" PRIu64,
              snmp->bytesEchoed, echoed);
        check(test, snmp->segmentFree == freeWhileOpen, "SNMP segment free %" PRIu64 ", expected %u",
              snmp->segmentFree, freeWhileOpen);
    }
    check(test, second->ok, "the second process could not read the segment");
    if (second->ok) {
        check(test, second->pid == test->demo->summary->pid, "the second process saw owner pid %d, not %d",
              second->pid, test->demo->summary->pid);
        check(test, second->records == n, "the second process saw %u records, expected %u", second->records, n);
        check(test, second->bytes == echoed && second->recordBytes == echoed,
              "the second process saw %llu bytes (%llu in records), expected %" PRIu64, second->bytes,
              second->recordBytes, echoed);
        check(test, second->freeBytes == freeWhileOpen, "the second process counted %u free bytes, expected %u",
              second->freeBytes, freeWhileOpen);
    }
    check(test, test->freeAfter == test->demo->freeAtStart,
          "free bytes %u after the clients left, %u before: records leaked", test->freeAfter,
          test->demo->freeAtStart);
    check(test, !test->stopping, "the self-test was interrupted%s", test->timedOut ? " by its deadline" : "");
}

static void print_summary(const SelfTest *test, const Tally *t) {
    const SnmpAnswers *snmp = &test->snmp;
    const SecondProcess *second = &test->second;
    const double seconds = test->echoSeconds > 0 ? test->echoSeconds : 1e-9;
    printf("qorbu-demo self-test\n");
    printf("  connections     %u of %u clients connected\n", t->connected, test->clientCount);
    printf("  bytes echoed    %" PRIu64 "\n", test->demo->summary->bytesEchoed);
    printf("  round trips     %u in %.3f s, %.0f per second\n", t->roundTrips, test->echoSeconds,
           t->roundTrips / seconds);
    if (snmp->ok)
        printf("  snmpget         open connections %" PRIu64 ", bytes echoed %" PRIu64 ", segment free %" PRIu64
               "\n", snmp->openConnections, snmp->bytesEchoed, snmp->segmentFree);
    else
        printf("  snmpget         no answer\n");
    if (second->ok)
        printf("  second process  %u records, %llu bytes, %u bytes free\n", second->records, second->bytes,
               second->freeBytes);
    else
        printf("  second process  no answer\n");
    printf("  segment free    %u bytes before, %u with the clients connected, %u after\n",
           test->demo->freeAtStart, test->freeWhileOpen, test->freeAfter);
    for (unsigned int i = 0; i < test->failureCount && i < kMaxFailures; ++i)
        printf("  FAILED          %s\n", test->failures[i]);
    printf("  result          %s: %u of %u checks held\n", selftest_passed(test) ? "PASS" : "FAIL", test->held,
           test->checks);
    fflush(stdout);
}

static void run_controller(void *arg) {
    SelfTest *test = arg;
    Demo *demo = test->demo;
    while (test->pending > 0) { /* woken by the last client to finish echoing */
        test->controllerWaiting = 1;
        greenthread_block();
    }
    test->controllerWaiting = 0;
    test->echoSeconds = demo_seconds_since(&test->echoStarted);
    if (!test->stopping) {
        test->freeWhileOpen = ShmTotalFree(demo->segment);
        query_agent(test);
        read_segment_from_second_process(test);
    }
    release_clients(test);
    echo_wait_idle(&demo->echo);
    test->freeAfter = ShmTotalFree(demo->segment);
    const Tally tally = count_clients(test);
    evaluate(test, &tally);
    test->finished = 1;
    print_summary(test, &tally);
    demo_request_stop(demo, "self-test finished");
}

static void on_deadline(void *arg) {
    SelfTest *test = arg;
    test->deadline = NULL;
    if (test->finished)
        return;
    fprintf(stderr, "qorbu-demo: the self-test did not finish within %d ms\n", SELFTEST_DEADLINE_MS);
    test->timedOut = 1;
    demo_request_stop(test->demo, "self-test deadline");
}

/* ---- the interface -------------------------------------------------------- */

SelfTest *selftest_start(Demo *demo) {
    SelfTest *test = calloc(1, sizeof *test);
    unsigned int count = demo->options.clients;
    Client *clients = test ? calloc(count, sizeof *clients) : NULL;
    if (!clients) {
        free(test);
        fprintf(stderr, "qorbu-demo: out of memory for %u self-test clients\n", count);
        return NULL;
    }
    test->demo = demo;
    test->clients = clients;
    test->clientCount = count;
    SelGetTime(&test->echoStarted);
    test->controller = greenthread_create(run_controller, test);
    if (!test->controller) {
        selftest_free(test);
        return NULL;
    }
    for (unsigned int i = 0; i < count; ++i) {
        clients[i].test = test;
        clients[i].index = i;
        clients[i].fd = -1;
        clients[i].random = 0x9e3779b9u * (i + 1) ^ (uint32_t)getpid();
        if (clients[i].random == 0)
            clients[i].random = 1;
        if (greenthread_create(run_client, &clients[i]))
            ++test->pending;
    }
    test->deadline = host_after(&demo->host, HOST_LIST_URGENT, SELFTEST_DEADLINE_MS, on_deadline, test);
    return test;
}

void selftest_stop(SelfTest *test) {
    if (test->finished || test->stopping)
        return;
    test->stopping = 1;
    for (unsigned int i = 0; i < test->clientCount; ++i) {
        Client *client = &test->clients[i];
        if (client->fd >= 0)
            shutdown(client->fd, SHUT_RDWR);
        if (client->waiting)
            greenthread_wakeup(client->waiting);
    }
}

int selftest_passed(const SelfTest *test) {
    return test->finished && test->checks > 0 && test->held == test->checks;
}

void selftest_free(SelfTest *test) {
    if (!test)
        return;
    if (test->deadline)
        host_cancel(&test->demo->host, test->deadline);
    free(test->clients);
    free(test);
}
