/* qorbu-demo's parts, private to examples/ (and the host scheduler's test):
 * the host scheduler (host_sched.c), the echo service (echo.c), the SNMP
 * agent (snmp_agent.c), the second process (inspect.c), the self-test
 * (selftest.c) and the daemon that holds them together (main.c). */
#ifndef QORBU_DEMO_H
#define QORBU_DEMO_H

#include <netinet/in.h>
#include <stdint.h>
#include <sys/select.h>
#include <sys/time.h>
#include <time.h>

#include "greenthreads/greenthread.h"
#include "selector/host.h"
#include "selector/sel.h"
#include "shm/shm.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- the host scheduler: the host side of selector/host.h ------------------
 * The select loop drains a queue of ready tasks (thread_fetch_queued and
 * thread_call), asks the scheduler once per pass to look at its own
 * descriptors and timed lists (thread_select_nb), and waits no longer than
 * the earliest timed task (timeval_cmp, timeval_sub, pal_time_tzcurrent).
 * Every function here runs on the selector thread; nothing is locked. */

typedef void (*HostTaskFn)(void *arg);

/* The four timed lists, in the order the select loop consults them. */
typedef enum HostList {
    HOST_LIST_URGENT,
    HOST_LIST_NORMAL,
    HOST_LIST_LOW,
    HOST_LIST_IDLE,
    HOST_LIST_COUNT
} HostList;

/* What travels through the loop's 36-byte task record. */
typedef struct HostTaskRecord {
    HostTaskFn fn;
    void *arg;
} HostTaskRecord;

/* A timed task. The link comes first: the loop reads it as a SelHostTask. */
typedef struct HostTimed {
    SelHostTask link;
    HostTaskFn fn;
    void *arg;
} HostTimed;

typedef struct HostQueued {
    struct HostQueued *next;
    HostTaskRecord task;
} HostQueued;

/* The host context handed to SelSetZG. The selector's view comes first. */
typedef struct HostContext {
    SelHostContext selector;
    SelHostScheduler scheduler;
    HostQueued *queue_head, *queue_tail;
    HostTaskRecord watches[FD_SETSIZE];
} HostContext;

void host_init(HostContext *host);
/* Frees every queued and timed task without running it. */
void host_destroy(HostContext *host);
/* Queues fn(arg) to run at the next drain of the select loop. 0 or -1. */
int host_post(HostContext *host, HostTaskFn fn, void *arg);
/* Runs fn(arg) from the given list once ms milliseconds have passed on the
 * host clock; equal due times keep their order of arrival. The result is
 * for host_cancel; NULL when out of memory or for a bad list. */
HostTimed *host_after(HostContext *host, HostList list, unsigned int ms, HostTaskFn fn, void *arg);
/* 1 if the task was still waiting (it is then freed), 0 otherwise. */
int host_cancel(HostContext *host, HostTimed *task);
/* Each pass in which fd (below FD_SETSIZE) is readable queues fn(arg).
 * 0, or -1 with errno EINVAL. */
int host_watch_fd(HostContext *host, int fd, HostTaskFn fn, void *arg);
/* t + ms on the host clock (pal_time_tzcurrent: CLOCK_MONOTONIC). */
struct timeval host_timeval_add_ms(struct timeval t, unsigned int ms);

/* ---- the shared segment ------------------------------------------------------
 * A summary in the metadata area and one record per open connection,
 * allocated with ShmAlloc and linked by absolute addresses (valid in every
 * process, since every process maps the segment at the same address). A
 * second process reads all of it through a read-only handle. */

#define DEMO_SUMMARY_MAGIC 0x514f5244u /* "DROQ" */
#define DEMO_RECORD_MAGIC  0x434f5244u /* "DROC" */

/* Lives at ShmMetadata(handle, sizeof(DemoSummary)). */
typedef struct DemoSummary {
    uint32_t magic;
    int32_t pid;               /* the daemon that owns the segment */
    uint32_t open_connections; /* records in the list */
    uint32_t accepted_total;
    uint64_t bytes_echoed; /* over all connections, closed ones included */
    uintptr_t records;     /* address of the newest record, 0 when none */
} DemoSummary;

/* One per open connection, in the data area. */
typedef struct DemoConnection {
    uint32_t magic;
    int32_t fd;
    uint32_t peer_port;
    uint32_t serial; /* 1 for the first connection accepted */
    uint64_t bytes_echoed;
    uintptr_t next; /* older record, 0 at the end */
    uintptr_t prev; /* newer record, 0 at the head */
} DemoConnection;

/* The default data area address: one a fresh process is not likely to use,
 * so a second process can map the segment there too. */
#if UINTPTR_MAX == 0xffffffffu
#define DEMO_SEGMENT_ADDRESS 0x30001000ul
#else
#define DEMO_SEGMENT_ADDRESS 0x5a0000001000ul
#endif
#define DEMO_SEGMENT_SIZE (1ul << 20)

/* The second process (qorbu-demo --inspect NAME): prints one line and
 * returns the exit status. */
int inspect_segment(const char *name);

/* ---- the echo service ----------------------------------------------------------
 * TCP on loopback: one green thread accepts, one green thread per connection
 * echoes, each connection with a record in the shared segment. */
typedef struct EchoService {
    ShmHandle *segment;
    DemoSummary *summary;
    int listen_fd;
    struct sockaddr_in address; /* where it listens */
    int stopping;
    Greenthread *idle_waiter; /* woken when the last connection has closed */
} EchoService;

/* Listens on 127.0.0.1:port (0: any free port) and starts the accepting
 * green thread; summary must be initialised. 0, or -1 after a message. */
int echo_start(EchoService *svc, ShmHandle *segment, DemoSummary *summary, unsigned int port);
/* Stops accepting and ends every connection; the green threads finish on
 * their own during the next passes of the loop. */
void echo_stop(EchoService *svc);
/* Blocks the calling green thread until no connection is open. */
void echo_wait_idle(EchoService *svc);

/* ---- the SNMP agent --------------------------------------------------------------
 * An in-process Net-SNMP master agent on one loopback UDP port, answering the
 * community "public" from 127.0.0.1, serviced by the selector's select loop:
 * no thread, no signal handler, no system configuration or state files. */

/* The scalars, instances .0 under netSnmpPlaypen (1.3.6.1.4.1.8072.9999.9999). */
#define DEMO_OID_BASE             "1.3.6.1.4.1.8072.9999.9999.7"
#define DEMO_OID_OPEN_CONNECTIONS DEMO_OID_BASE ".1.0" /* Gauge32 */
#define DEMO_OID_BYTES_ECHOED     DEMO_OID_BASE ".2.0" /* Counter64 */
#define DEMO_OID_SEGMENT_FREE     DEMO_OID_BASE ".3.0" /* Gauge32 */

/* Starts the agent on udp:127.0.0.1:*port (0: a free port, stored there),
 * with Net-SNMP's state in a private directory; the values are read from
 * the segment at every request. 0, or -1 after a message. */
int agent_start(ShmHandle *segment, const DemoSummary *summary, unsigned int *port);
/* Shuts down what agent_start set up and removes the directory. */
void agent_stop(void);

/* ---- the daemon ------------------------------------------------------------------ */

typedef struct DemoOptions {
    int self_test;
    const char *segment_name;
    const char *inspect; /* --inspect NAME: run as the second process */
    unsigned long port, snmp_port, segment_size, segment_address, status_interval_ms;
    unsigned long clients, rounds; /* self-test client green threads, round trips of each */
} DemoOptions;

typedef struct SelfTest SelfTest;

/* The daemon's state; one instance lives in main. */
typedef struct Demo {
    DemoOptions options;
    HostContext host;
    ShmHandle *segment;
    DemoSummary *summary;
    uint32_t free_at_start;
    EchoService echo;
    SelTimer status_timer;
    int signal_pipe[2];
    unsigned int snmp_port;
    struct timespec started;
    int stopping;
    SelfTest *test;
} Demo;

/* Queues the orderly stop as a host task; safe to call more than once. */
void demo_request_stop(Demo *demo, const char *reason);
double demo_seconds_since(const struct timespec *since);

/* ---- the self-test -----------------------------------------------------------------
 * Client green threads against the daemon's own echo service, snmpget
 * against its own agent, a second process reading the segment, a summary on
 * standard output and a verdict. */

/* Starts the controller and the clients and arms a deadline on the host
 * scheduler. NULL after a message on failure. */
SelfTest *selftest_start(Demo *demo);
/* The daemon is stopping: ends the clients early (the verdict is then a
 * failure unless the self-test had already finished). */
void selftest_stop(SelfTest *test);
/* 1 when every check held. */
int selftest_passed(const SelfTest *test);
void selftest_free(SelfTest *test);

#ifdef __cplusplus
}
#endif

#endif
