/* The demo's --self-test: client green threads against its own echo
 * service, snmpget against its own agent, a second process reading the
 * segment, a summary on standard output and a verdict. */
#ifndef QORBU_DEMO_SELFTEST_H
#define QORBU_DEMO_SELFTEST_H

#include "demo.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Everything the self-test must finish within, shutdown included. */
#define SELFTEST_DEADLINE_MS 25000

/* Starts the controller and the clients (green threads) and arms the
 * deadline on the host scheduler. NULL after a message on failure. */
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
