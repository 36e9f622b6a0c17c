/* The demo's in-process Net-SNMP master agent. It listens on one loopback
 * UDP port, reads no configuration or persistent files, answers the
 * community "public" from 127.0.0.1 only, and is serviced by the selector's
 * select loop (snmp_select_info, snmp_read, snmp_timeout, run_alarms): it
 * opens no thread and sets no signal handler of its own. */
#ifndef QORBU_DEMO_SNMP_AGENT_H
#define QORBU_DEMO_SNMP_AGENT_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Where the scalars' values come from, read at every request. */
typedef struct AgentSource {
    uint32_t (*openConnections)(void *arg);
    uint64_t (*bytesEchoed)(void *arg);
    uint32_t (*segmentFreeBytes)(void *arg);
    void *arg;
} AgentSource;

/* The scalars, under netSnmpPlaypen (1.3.6.1.4.1.8072.9999.9999), for local
 * experiments; each is the instance .0 of these objects. */
#define DEMO_OID_BASE "1.3.6.1.4.1.8072.9999.9999.7"
#define DEMO_OID_OPEN_CONNECTIONS DEMO_OID_BASE ".1.0"   /* Gauge32 */
#define DEMO_OID_BYTES_ECHOED DEMO_OID_BASE ".2.0"       /* Counter64 */
#define DEMO_OID_SEGMENT_FREE DEMO_OID_BASE ".3.0"       /* Gauge32 */

/* Starts the agent on udp:127.0.0.1:port, keeping Net-SNMP's state in
 * stateDir (an empty private directory). 0, or -1 after a message on
 * standard error. */
int agent_start(const AgentSource *source, unsigned int port, const char *stateDir);
void agent_stop(void);

/* A UDP port on 127.0.0.1 that was free a moment ago, or 0. */
unsigned int agent_pick_free_port(void);

#ifdef __cplusplus
}
#endif

#endif
