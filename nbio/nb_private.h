/* Internals of the blocking-style descriptor calls, shared with the
 * white-box tests. */
#ifndef QORBU_NBIO_NB_PRIVATE_H
#define QORBU_NBIO_NB_PRIVATE_H

#include <cstdint>

#include "greenthreads/greenthread.h"
#include "nbio/nb.h"
#include "selector/sel.h"

/* One wait of nb_poll: lives on the waiting thread's stack and is the
 * argument of both selector callbacks. */
typedef struct NbWait {
    Greenthread *thread;
    int32_t result; /* 0 while waiting, 1 once ready, -1 once timed out */
} NbWait;

#if UINTPTR_MAX == 0xffffffffu
static_assert(sizeof(NbWait) == 8, "NbWait is two 32-bit words on 32-bit targets");
#endif

int nb_poll_on_ready(int fd, unsigned int event, void *arg, SelFdEntry *entry);
int nb_poll_on_timeout(SelTimer *timer);

namespace qorbu::nb {

/* The selector mask for nb_poll's poll(2)-style event bits: POLLIN and
 * POLLOUT count, every other bit is ignored. */
unsigned int selector_mask(int events);

} // namespace qorbu::nb

#endif
