/* The demo host's task scheduler; see demo.h. */
#define _GNU_SOURCE
#include "demo.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/select.h>
#include <stddef.h>
#include <time.h>

_Static_assert(sizeof(HostTaskRecord) <= SEL_HOST_TASK_SIZE,
               "a task must fit the select loop's task record");
_Static_assert(offsetof(HostTimed, link) == 0, "the loop reads a timed task as a SelHostTask");
_Static_assert(offsetof(HostContext, selector) == 0, "SelSetZG takes the selector's view");

enum { kUsecPerSec = 1000000 };

void host_init(HostContext *host) {
    memset(host, 0, sizeof *host);
    host->selector.scheduler = &host->scheduler;
    FD_ZERO(&host->scheduler.readfd);
    FD_ZERO(&host->scheduler.writefd);
    FD_ZERO(&host->scheduler.exceptfd);
    host->scheduler.max_fd = -1;
}

void host_destroy(HostContext *host) {
    while (host->queueHead) {
        HostQueued *next = host->queueHead->next;
        free(host->queueHead);
        host->queueHead = next;
    }
    host->queueTail = NULL;
    for (int list = 0; list < HOST_LIST_COUNT; ++list) {
        SelHostTask *task = host->scheduler.timed[list];
        while (task) {
            SelHostTask *next = task->next;
            free(task);
            task = next;
        }
        host->scheduler.timed[list] = NULL;
    }
}

int host_post(HostContext *host, HostTaskFn fn, void *arg) {
    HostQueued *item = malloc(sizeof *item);
    if (!item)
        return -1;
    item->next = NULL;
    item->task.fn = fn;
    item->task.arg = arg;
    if (host->queueTail)
        host->queueTail->next = item;
    else
        host->queueHead = item;
    host->queueTail = item;
    return 0;
}

struct timeval host_now(void) {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    struct timeval tv = {.tv_sec = now.tv_sec, .tv_usec = now.tv_nsec / 1000};
    return tv;
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
    if ((int)list < 0 || list >= HOST_LIST_COUNT)
        return NULL;
    HostTimed *task = calloc(1, sizeof *task);
    if (!task)
        return NULL;
    task->link.when = host_timeval_add_ms(host_now(), ms);
    task->fn = fn;
    task->arg = arg;
    task->list = list;
    /* Keep the list sorted, earliest first; a new task goes after every task
     * due at the same time. */
    SelHostTask **link = &host->scheduler.timed[list];
    while (*link && timeval_cmp((*link)->when, task->link.when) <= 0)
        link = &(*link)->next;
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

static void recompute_max_fd(HostContext *host) {
    int fd = host->scheduler.max_fd;
    while (fd >= 0 && !FD_ISSET(fd, &host->scheduler.readfd))
        --fd;
    host->scheduler.max_fd = fd;
}

int host_watch_fd(HostContext *host, int fd, HostTaskFn fn, void *arg) {
    if (fd < 0 || fd >= FD_SETSIZE || !fn) {
        errno = EINVAL;
        return -1;
    }
    host->watches[fd].fn = fn;
    host->watches[fd].arg = arg;
    FD_SET(fd, &host->scheduler.readfd);
    if (fd > host->scheduler.max_fd)
        host->scheduler.max_fd = fd;
    return 0;
}

void host_unwatch_fd(HostContext *host, int fd) {
    if (fd < 0 || fd >= FD_SETSIZE)
        return;
    FD_CLR(fd, &host->scheduler.readfd);
    host->watches[fd].fn = NULL;
    host->watches[fd].arg = NULL;
    if (fd == host->scheduler.max_fd)
        recompute_max_fd(host);
}

/* ---- the functions the select loop calls --------------------------------- */

int thread_fetch_queued(void *hostContext, void *task) {
    HostContext *host = hostContext;
    HostQueued *item = host->queueHead;
    if (!item)
        return 0;
    host->queueHead = item->next;
    if (!host->queueHead)
        host->queueTail = NULL;
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
    if (host->scheduler.max_fd < 0)
        return 0;
    fd_set ready = host->scheduler.readfd;
    struct timeval zero = {0, 0};
    int count = select(host->scheduler.max_fd + 1, &ready, NULL, NULL, &zero);
    if (count <= 0)
        return 0;
    int queued = 0;
    for (int fd = 0; fd <= host->scheduler.max_fd; ++fd) {
        if (FD_ISSET(fd, &ready) && host->watches[fd].fn &&
            host_post(host, host->watches[fd].fn, host->watches[fd].arg) == 0) {
            ++host->watchesFired;
            ++queued;
        }
    }
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
            if (host_post(host, task->fn, task->arg) != 0)
                break; /* out of memory: try again next pass */
            host->scheduler.timed[list] = head->next;
            free(task);
            ++host->timedDue;
            ++queued;
        }
    }
    return queued;
}

int thread_select_nb(void *hostContext) {
    HostContext *host = hostContext;
    return queue_readable_watches(host) + queue_due_timed(host);
}

int timeval_cmp(struct timeval a, struct timeval b) {
    if (a.tv_sec != b.tv_sec)
        return a.tv_sec < b.tv_sec ? -1 : 1;
    if (a.tv_usec != b.tv_usec)
        return a.tv_usec < b.tv_usec ? -1 : 1;
    return 0;
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
    *now = host_now();
    return 0;
}
