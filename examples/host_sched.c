/* The demo host's task scheduler; see demo.h. */
#define _GNU_SOURCE
#include "demo.h"

#include <errno.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>

_Static_assert(sizeof(HostTaskRecord) <= SEL_HOST_TASK_SIZE, "a task must fit the select loop's task record");
_Static_assert(offsetof(HostTimed, link) == 0, "the loop reads a timed task as a SelHostTask");
_Static_assert(offsetof(HostContext, selector) == 0, "SelSetZG takes the selector's view");

enum { kUsecPerSec = 1000000 };

/* All-zero fd_sets are empty: only the highest descriptor needs a value. */
void host_init(HostContext *host) {
    memset(host, 0, sizeof *host);
    host->selector.scheduler = &host->scheduler;
    host->scheduler.max_fd = -1;
}

void host_destroy(HostContext *host) {
    for (HostQueued *item = host->queue_head, *next; item; item = next) {
        next = item->next;
        free(item);
    }
    host->queue_head = host->queue_tail = NULL;
    for (int list = 0; list < HOST_LIST_COUNT; ++list) {
        for (SelHostTask *task = host->scheduler.timed[list], *next; task; task = next) {
            next = task->next;
            free(task);
        }
        host->scheduler.timed[list] = NULL;
    }
}

int host_post(HostContext *host, HostTaskFn fn, void *arg) {
    HostQueued *item = malloc(sizeof *item);
    if (!item) return -1;
    *item = (HostQueued){.next = NULL, .task = {fn, arg}};
    *(host->queue_tail ? &host->queue_tail->next : &host->queue_head) = item;
    host->queue_tail = item;
    return 0;
}

struct timeval host_timeval_add_ms(struct timeval t, unsigned int ms) {
    t.tv_sec += ms / 1000;
    t.tv_usec += (long)(ms % 1000) * 1000;
    if (t.tv_usec >= kUsecPerSec) {
        t.tv_sec += 1;
        t.tv_usec -= kUsecPerSec;
    }
    return t;
}

HostTimed *host_after(HostContext *host, HostList list, unsigned int ms, HostTaskFn fn, void *arg) {
    HostTimed *task = (unsigned int)list < HOST_LIST_COUNT ? calloc(1, sizeof *task) : NULL;
    if (!task) return NULL;
    pal_time_tzcurrent(&task->link.when, NULL);
    task->link.when = host_timeval_add_ms(task->link.when, ms);
    task->fn = fn;
    task->arg = arg;
    /* Earliest first; a new task goes after every task due at the same time. */
    SelHostTask **link = &host->scheduler.timed[list];
    while (*link && timeval_cmp((*link)->when, task->link.when) <= 0) link = &(*link)->next;
    task->link.next = *link;
    *link = &task->link;
    return task;
}

int host_cancel(HostContext *host, HostTimed *task) {
    for (int list = 0; list < HOST_LIST_COUNT; ++list) {
        for (SelHostTask **link = &host->scheduler.timed[list]; *link; link = &(*link)->next) {
            if (*link == &task->link) {
                *link = task->link.next;
                free(task);
                return 1;
            }
        }
    }
    return 0;
}

int host_watch_fd(HostContext *host, int fd, HostTaskFn fn, void *arg) {
    if (fd < 0 || fd >= FD_SETSIZE || !fn) {
        errno = EINVAL;
        return -1;
    }
    host->watches[fd] = (HostTaskRecord){fn, arg};
    FD_SET(fd, &host->scheduler.readfd);
    if (fd > host->scheduler.max_fd) host->scheduler.max_fd = fd;
    return 0;
}

/* ---- the functions the select loop calls --------------------------------- */

int thread_fetch_queued(void *context, void *task) {
    HostContext *host = context;
    HostQueued *item = host->queue_head;
    if (!item) return 0;
    host->queue_head = item->next;
    if (!host->queue_head) host->queue_tail = NULL;
    memcpy(task, &item->task, sizeof item->task);
    free(item);
    return 1;
}

int thread_call(void *task) {
    HostTaskRecord record;
    memcpy(&record, task, sizeof record);
    record.fn(record.arg);
    return 0;
}

static int queue_readable_watches(HostContext *host) {
    fd_set ready = host->scheduler.readfd;
    struct timeval zero = {0, 0};
    int queued = 0;
    if (host->scheduler.max_fd < 0 || select(host->scheduler.max_fd + 1, &ready, NULL, NULL, &zero) <= 0)
        return 0;
    for (int fd = 0; fd <= host->scheduler.max_fd; ++fd)
        if (FD_ISSET(fd, &ready) && host_post(host, host->watches[fd].fn, host->watches[fd].arg) == 0)
            ++queued;
    return queued;
}

static int queue_due_timed(HostContext *host) {
    struct timeval now;
    pal_time_tzcurrent(&now, NULL);
    int queued = 0;
    for (int list = 0; list < HOST_LIST_COUNT; ++list) {
        SelHostTask *head;
        while ((head = host->scheduler.timed[list]) && timeval_cmp(head->when, now) <= 0) {
            HostTimed *task = (HostTimed *)head;
            if (host_post(host, task->fn, task->arg) != 0) break; /* out of memory: try again next pass */
            host->scheduler.timed[list] = head->next;
            free(task);
            ++queued;
        }
    }
    return queued;
}

int thread_select_nb(void *context) { return queue_readable_watches(context) + queue_due_timed(context); }

int timeval_cmp(struct timeval a, struct timeval b) {
    if (a.tv_sec != b.tv_sec) return a.tv_sec < b.tv_sec ? -1 : 1;
    return a.tv_usec < b.tv_usec ? -1 : a.tv_usec > b.tv_usec;
}

struct timeval timeval_sub(struct timeval a, struct timeval b) {
    struct timeval d = {.tv_sec = a.tv_sec - b.tv_sec, .tv_usec = a.tv_usec - b.tv_usec};
    if (d.tv_usec < 0) {
        d.tv_sec -= 1;
        d.tv_usec += kUsecPerSec;
    }
    return d;
}

int pal_time_tzcurrent(struct timeval *now, void *unused) {
    (void)unused;
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    *now = (struct timeval){.tv_sec = ts.tv_sec, .tv_usec = ts.tv_nsec / 1000};
    return 0;
}
