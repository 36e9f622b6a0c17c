/* See selftest.h. */
#define _GNU_SOURCE
#include "selftest.h"

#include <errno.h>
#include <inttypes.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "nbio/nb.h"
#include "snmp_agent.h"
#include "helper.h"

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

__attribute__((format(printf, 3, 4))) static void check(SelfTest *test, int held, const char *format, ...)
{
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

static uint32_t next_random(uint32_t *state)
{
    uint32_t x = *state; /* xorshift32 */
    x ^= x << 13;
    x ^= x >> 17;
    x ^= x << 5;
    return *state = x;
}

static int connect_client(Client *client)
{
    client->fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (client->fd < 0)
        return -1;
    const struct sockaddr_in *to = &client->test->demo->echo.address;
    return nb_connect(client->fd, (const struct sockaddr *)to, sizeof *to);
}

static int echo_round(Client *client)
{
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

static void client_finished_echoing(SelfTest *test)
{
    if (--test->pending == 0 && test->controllerWaiting)
        greenthread_wakeup(test->controller);
}

static void run_client(void *arg)
{
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

static void release_clients(SelfTest *test)
{
    test->released = 1;
    for (unsigned int i = 0; i < test->clientCount; ++i)
        if (test->clients[i].waiting)
            greenthread_wakeup(test->clients[i].waiting);
}

/* ---- snmpget and the second process --------------------------------------- */

static int parse_snmp_value(const char *output, const char *oid, uint64_t *value)
{
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

static void query_agent(SelfTest *test)
{
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

static void read_segment_from_second_process(SelfTest *test)
{
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

static void wait_for_clients(SelfTest *test)
{
    while (test->pending > 0) {
        test->controllerWaiting = 1;
        greenthread_block();
    }
    test->controllerWaiting = 0;
}

static void evaluate(SelfTest *test)
{
    unsigned int connected = 0, verified = 0;
    uint64_t sent = 0;
    for (unsigned int i = 0; i < test->clientCount; ++i) {
        connected += (unsigned int)test->clients[i].connected;
        verified += (unsigned int)test->clients[i].verified;
        sent += test->clients[i].bytes;
    }
    const DemoSummary *summary = test->demo->summary;
    const uint64_t echoed = summary->bytesEchoed;
    check(test, connected == test->clientCount, "%u of %u clients connected", connected, test->clientCount);
    check(test, verified == test->clientCount, "%u of %u clients got every byte back", verified,
          test->clientCount);
    check(test, echoed == sent, "the service echoed %" PRIu64 " bytes, the clients sent %" PRIu64, echoed, sent);
    check(test, test->snmp.ok, "snmpget gave no usable answer");
    if (test->snmp.ok) {
        check(test, test->snmp.openConnections == test->clientCount,
              "SNMP open connections %" PRIu64 ", expected %u", test->snmp.openConnections, test->clientCount);
        check(test, test->snmp.bytesEchoed == echoed, "SNMP bytes echoed %" PRIu64 ", expected %" PRIu64,
              test->snmp.bytesEchoed, echoed);
        check(test, test->snmp.segmentFree == test->freeWhileOpen,
              "SNMP segment free %" PRIu64 ", expected %u", test->snmp.segmentFree, test->freeWhileOpen);
    }
    const SecondProcess *second = &test->second;
    check(test, second->ok, "the second process could not read the segment");
    if (second->ok) {
        check(test, second->pid == test->demo->summary->pid, "the second process saw owner pid %d, not %d",
              second->pid, test->demo->summary->pid);
        check(test, second->records == test->clientCount, "the second process saw %u records, expected %u",
              second->records, test->clientCount);
        check(test, second->bytes == echoed && second->recordBytes == echoed,
              "the second process saw %llu bytes (%llu in records), expected %" PRIu64, second->bytes,
              second->recordBytes, echoed);
        check(test, second->freeBytes == test->freeWhileOpen, "the second process counted %u free bytes, expected %u",
              second->freeBytes, test->freeWhileOpen);
    }
    check(test, test->freeAfter == test->demo->freeAtStart,
          "free bytes %u after the clients left, %u before: records leaked", test->freeAfter,
          test->demo->freeAtStart);
}

static void print_summary(const SelfTest *test)
{
    unsigned int connected = 0, roundTrips = 0;
    for (unsigned int i = 0; i < test->clientCount; ++i) {
        connected += (unsigned int)test->clients[i].connected;
        roundTrips += test->clients[i].roundTrips;
    }
    const double seconds = test->echoSeconds > 0 ? test->echoSeconds : 1e-9;
    printf("qorbu-demo self-test\n");
    printf("  connections     %u of %u clients connected\n", connected, test->clientCount);
    printf("  bytes echoed    %" PRIu64 "\n", test->demo->summary->bytesEchoed);
    printf("  round trips     %u in %.3f s, %.0f per second\n", roundTrips, test->echoSeconds,
           roundTrips / seconds);
    if (test->snmp.ok)
        printf("  snmpget         open connections %" PRIu64 ", bytes echoed %" PRIu64 ", segment free %" PRIu64
               "\n",
               test->snmp.openConnections, test->snmp.bytesEchoed, test->snmp.segmentFree);
    else
        printf("  snmpget         no answer\n");
    if (test->second.ok)
        printf("  second process  %u records, %llu bytes, %u bytes free\n", test->second.records,
               test->second.bytes, test->second.freeBytes);
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

static void run_controller(void *arg)
{
    SelfTest *test = arg;
    Demo *demo = test->demo;
    wait_for_clients(test);
    test->echoSeconds = demo_seconds_since(&test->echoStarted);
    if (!test->stopping) {
        test->freeWhileOpen = ShmTotalFree(demo->segment);
        query_agent(test);
        read_segment_from_second_process(test);
    }
    release_clients(test);
    echo_wait_idle(&demo->echo);
    test->freeAfter = ShmTotalFree(demo->segment);
    evaluate(test);
    check(test, !test->stopping, "the self-test was interrupted%s", test->timedOut ? " by its deadline" : "");
    test->finished = 1;
    print_summary(test);
    demo_request_stop(demo, "self-test finished");
}

static void on_deadline(void *arg)
{
    SelfTest *test = arg;
    test->deadline = NULL;
    if (test->finished)
        return;
    fprintf(stderr, "qorbu-demo: the self-test did not finish within %d ms\n", SELFTEST_DEADLINE_MS);
    test->timedOut = 1;
    demo_request_stop(test->demo, "self-test deadline");
}

/* ---- the interface -------------------------------------------------------- */

SelfTest *selftest_start(Demo *demo)
{
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

void selftest_stop(SelfTest *test)
{
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

int selftest_passed(const SelfTest *test)
{
    return test->finished && test->checks > 0 && test->held == test->checks;
}

void selftest_free(SelfTest *test)
{
    if (!test)
        return;
    if (test->deadline)
        host_cancel(&test->demo->host, test->deadline);
    free(test->clients);
    free(test);
}
