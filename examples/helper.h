/* Running a helper program from a green thread: its standard output is read
 * through a non-blocking pipe with nb_read, so the loop (and the SNMP agent
 * the helper may be talking to) keeps running meanwhile. */
#ifndef QORBU_DEMO_HELPER_H
#define QORBU_DEMO_HELPER_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Runs argv[0] (looked up in PATH) with argv, captures up to cap - 1 bytes
 * of its standard output into out (NUL-terminated) and waits for it. A
 * helper silent for longer than timeoutMs is killed. Returns its exit
 * status (0..255), or -1 with a message in out when it could not be run,
 * was killed or died of a signal. */
int spawn_capture(char *const argv[], char *out, size_t cap, int timeoutMs);

#ifdef __cplusplus
}
#endif

#endif
