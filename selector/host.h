/* What the select loop reads from the host process, and the functions the
 * host (or the Net-SNMP library it links) provides. The library refers to
 * these functions weakly: a process without them skips that source. */
#ifndef QORBU_SELECTOR_HOST_H
#define QORBU_SELECTOR_HOST_H

#include <sys/select.h>
#include <sys/time.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct SelHostTask {
    struct SelHostTask *next;
    struct timeval when;
} SelHostTask; /* host may extend */

typedef struct SelHostScheduler {
    fd_set readfd, writefd, exceptfd; /* the host's interest sets */
    int max_fd;                       /* highest host descriptor, inclusive; -1 when none */
    SelHostTask *timed[4];            /* first task of each timed list, earliest first; NULL when empty */
} SelHostScheduler;

typedef struct SelHostContext {
    SelHostScheduler *scheduler;
} SelHostContext; /* what SelSetZG takes; host may extend */

#define SEL_HOST_TASK_SIZE 36

int thread_fetch_queued(void *hostContext, void *task); /* task: SEL_HOST_TASK_SIZE bytes */
int thread_call(void *task);
int thread_select_nb(void *hostContext);
int timeval_cmp(struct timeval a, struct timeval b);
struct timeval timeval_sub(struct timeval a, struct timeval b);
int pal_time_tzcurrent(struct timeval *now, void *unused);

/* Net-SNMP, with Net-SNMP's own signatures */
int snmp_select_info(int *numfds, fd_set *fdset, struct timeval *timeout, int *block);
void snmp_read(fd_set *fdset);
void snmp_timeout(void);
void run_alarms(void);

#ifdef __cplusplus
}
#endif

#endif
