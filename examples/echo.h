/* The demo's TCP echo service on loopback: one green thread accepts, one
 * green thread per connection echoes, each connection with a record in the
 * shared segment (demo_segment.h). */
#ifndef QORBU_DEMO_ECHO_H
#define QORBU_DEMO_ECHO_H

#include <netinet/in.h>
#include <stdint.h>

#include "demo_segment.h"
#include "greenthreads/greenthread.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct EchoService {
    ShmHandle *segment;
    DemoSummary *summary;
    int listenFd;
    struct sockaddr_in address; /* where it listens */
    int stopping;
    uint32_t refusedForSpace;   /* connections closed for lack of segment space */
    Greenthread *idleWaiter;    /* woken when the last connection has closed */
} EchoService;

/* Listens on 127.0.0.1:port (0: any free port) and starts the accepting
 * green thread. The segment's metadata area must hold an initialised
 * DemoSummary. 0, or -1 after a message on standard error. */
int echo_start(EchoService *svc, ShmHandle *segment, DemoSummary *summary, unsigned int port);

/* Stops accepting and ends every connection; the green threads finish on
 * their own during the next passes of the loop. */
void echo_stop(EchoService *svc);

/* Blocks the calling green thread until no connection is open. */
void echo_wait_idle(EchoService *svc);

#ifdef __cplusplus
}
#endif

#endif
