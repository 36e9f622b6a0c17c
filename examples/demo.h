/* The demo host's state, shared by its parts. One instance lives in main. */
#ifndef QORBU_DEMO_DEMO_H
#define QORBU_DEMO_DEMO_H

#include <stdint.h>
#include <time.h>

#include "demo_segment.h"
#include "echo.h"
#include "host_sched.h"
#include "selector/sel.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct DemoOptions {
    int selfTest;
    unsigned int clients;         /* self-test client green threads */
    unsigned int rounds;          /* echo round trips per client */
    unsigned int port;            /* echo port; 0: any free port */
    unsigned int snmpPort;        /* SNMP agent port; 0: any free port */
    const char *segmentName;
    uint32_t segmentSize;
    uintptr_t segmentAddress;     /* data area address given to ShmCreate */
    unsigned int statusIntervalMs;
    const char *inspect;          /* --inspect NAME: the second-process reader */
} DemoOptions;

typedef struct SelfTest SelfTest;

typedef struct Demo {
    DemoOptions options;
    HostContext host;
    ShmHandle *segment;
    DemoSummary *summary;
    uint32_t freeAtStart;
    EchoService echo;
    SelTimer statusTimer;
    uint32_t statusLines;
    int signalPipe[2];
    char stateDir[64];
    unsigned int snmpPort;
    struct timespec started;
    int stopping;
    SelfTest *selfTest;
} Demo;

/* Queues the orderly stop as a host task; safe to call more than once. */
void demo_request_stop(Demo *demo, const char *reason);

/* Seconds since a monotonic time stamp. */
double demo_seconds_since(const struct timespec *since);

#ifdef __cplusplus
}
#endif

#endif
