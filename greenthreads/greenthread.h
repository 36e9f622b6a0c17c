/* libqorbu green threads: cooperative threads on small guarded stacks,
 * scheduled on the one OS thread that called greenthreads_init. */
#ifndef QORBU_GREENTHREADS_GREENTHREAD_H
#define QORBU_GREENTHREADS_GREENTHREAD_H

#include "qorbu_api.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct Greenthread Greenthread;
typedef void (*GreenthreadEntry)(void *arg);

QORBU_API void greenthreads_init(void);
QORBU_API void greenthreads_run(void);
QORBU_API Greenthread *greenthread_create(GreenthreadEntry entry, void *arg);
QORBU_API void greenthread_yield(void);
QORBU_API void greenthread_block(void);
QORBU_API void greenthread_wakeup(Greenthread *thread);
QORBU_API Greenthread *current_greenthread(void);

#ifdef __cplusplus
}
#endif

#endif
