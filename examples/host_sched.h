/* The demo host's own task scheduler: the host side of selector/host.h.
 *
 * The select loop drains a queue of ready tasks (thread_fetch_queued and
 * thread_call), asks the scheduler once per pass to look at its own
 * descriptors and timed lists (thread_select_nb), and waits no longer than
 * the earliest timed task (timeval_cmp, timeval_sub, pal_time_tzcurrent).
 * Every function here runs on the selector thread; nothing is locked. */
#ifndef QORBU_DEMO_HOST_SCHED_H
#define QORBU_DEMO_HOST_SCHED_H

#include <stdint.h>
#include <sys/select.h>
#include <sys/time.h>

#include "selector/host.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef void (*HostTaskFn)(void *arg);

/* The four timed lists, in the order the select loop consults them. */
typedef enum HostList {
    HOST_LIST_URGENT = 0,
    HOST_LIST_NORMAL = 1,
    HOST_LIST_LOW = 2,
    HOST_LIST_IDLE = 3,
    HOST_LIST_COUNT = 4
} HostList;

/* A timed task. The link must come first: the select loop reads the first
 * task of each list as a SelHostTask (its due time). */
typedef struct HostTimed {
    SelHostTask link;
    HostTaskFn fn;
    void *arg;
    int list;
} HostTimed;

/* What travels through the loop's 36-byte task record. */
typedef struct HostTaskRecord {
    HostTaskFn fn;
    void *arg;
} HostTaskRecord;

typedef struct HostQueued {
    struct HostQueued *next;
    HostTaskRecord task;
} HostQueued;

typedef struct HostWatch {
    HostTaskFn fn;
    void *arg;
} HostWatch;

/* The host context handed to SelSetZG. The selector's view comes first. */
typedef struct HostContext {
    SelHostContext selector;
    SelHostScheduler scheduler;
    HostQueued *queueHead;
    HostQueued *queueTail;
    HostWatch watches[FD_SETSIZE];
    uint32_t timedDue;   /* timed tasks moved to the queue */
    uint32_t watchesFired;
} HostContext;

void host_init(HostContext *host);
/* Frees every queued and timed task without running it. */
void host_destroy(HostContext *host);

/* Queues fn(arg) to run at the next drain of the select loop. 0 or -1. */
int host_post(HostContext *host, HostTaskFn fn, void *arg);

/* Runs fn(arg) from the given list once ms milliseconds have passed on the
 * host clock. The result identifies the task for host_cancel; NULL when out
 * of memory. Equal due times keep their order of arrival. */
HostTimed *host_after(HostContext *host, HostList list, unsigned int ms, HostTaskFn fn, void *arg);
/* Removes a timed task that has not been queued yet; returns 1 if it was
 * still waiting, 0 otherwise (the handle is then no longer valid). */
int host_cancel(HostContext *host, HostTimed *task);

/* Watches a descriptor (below FD_SETSIZE) for readability: each pass in
 * which it is readable queues fn(arg). 0, or -1 with errno EINVAL. */
int host_watch_fd(HostContext *host, int fd, HostTaskFn fn, void *arg);
void host_unwatch_fd(HostContext *host, int fd);

/* The host clock: CLOCK_MONOTONIC as a timeval. */
struct timeval host_now(void);
struct timeval host_timeval_add_ms(struct timeval t, unsigned int ms);

#ifdef __cplusplus
}
#endif

#endif
