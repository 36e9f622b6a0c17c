/* libqorbu event selector: per-thread descriptors, timers and signals. */
#ifndef QORBU_SELECTOR_SEL_H
#define QORBU_SELECTOR_SEL_H

#include <pthread.h>
#include <stdint.h>
#include <sys/select.h>
#include <sys/time.h>
#include <time.h>

#include "qorbu_api.h"

#ifdef __cplusplus
extern "C" {
#endif

#define SEL_READ        1u
#define SEL_WRITE       2u
#define SEL_EXCEPT      4u
#define SEL_IN_CALLBACK 8u

typedef struct SelTimer SelTimer;
typedef struct SelFdEntry SelFdEntry;

typedef int (*SelTimerCallback)(SelTimer *timer);

/* A caller-owned timer record. Zero it before first use; heapIndex is 0
 * while the timer is not armed. */
struct SelTimer {
    uint32_t heapIndex;
    struct timespec when; /* deadline on CLOCK_MONOTONIC */
    SelTimerCallback callback;
    void *arg;
};

typedef int (*SelFdCallback)(int fd, unsigned int event, void *arg, SelFdEntry *entry);

struct SelFdEntry {
    uint32_t events;
    int32_t idleTracked;
    struct timeval lastActivity; /* wall clock */
    SelFdCallback callback;
    void *arg;
};

/* Context and start-up */
QORBU_API int SelInit(void);
QORBU_API void SelSetZG(void *hostContext);
QORBU_API int SelAddSignal(int signo);
QORBU_API int SelRemSignal(int signo);

/* Timers */
QORBU_API int SelGetTime(struct timespec *now);
QORBU_API int SelMakeWhen(struct timespec *when, long sec, long nsec);
QORBU_API int SelAddTimer(SelTimer *t);
QORBU_API void SelRemTimer(SelTimer *t);
QORBU_API int SelModifyTimer(SelTimer *t, const struct timespec *when);
QORBU_API int SelRemoveAllTimers(void);
QORBU_API int SelDebugIsTimerActive(SelTimer *t);
QORBU_API int SelSleep(SelTimer *t, unsigned int ms);

/* Descriptors */
QORBU_API int SelAddFD(int fd, unsigned int events, int idleTracked, SelFdCallback callback, void *arg);
QORBU_API int SelRemFD(int fd);
QORBU_API void *SelGetFDArg(int fd);

/* Dispatch loops */
QORBU_API int SelSelect(void);
QORBU_API int SelUseEpoll(void);
QORBU_API void DeInitEpoll(void);
QORBU_API int GetEpollFd(void);
QORBU_API int SelEpoll(void);
QORBU_API int zarn_select(int nfds, fd_set *readfds, fd_set *writefds, fd_set *exceptfds,
                          struct timeval *timeout);

QORBU_API extern pthread_key_t sel_tl_key;
QORBU_API extern pthread_once_t sel_tl_once;
QORBU_API extern SelTimer fd_timer;
QORBU_API extern void *com2SecList, *com2SecListLast, *g_protocols_list, *g_services_list;

#ifdef __cplusplus
}
#endif

#endif
