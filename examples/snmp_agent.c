/* The demo's SNMP agent; see demo.h. Compiled without
 * `net-snmp-config --cflags`, whose large-file flags would change off_t
 * for the rest of the program. */
#define _GNU_SOURCE
#include "demo.h"

#include <arpa/inet.h>
#include <ftw.h>
#include <netinet/in.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <net-snmp/net-snmp-config.h>
#include <net-snmp/net-snmp-includes.h>
#include <net-snmp/agent/net-snmp-agent-includes.h>

static const char kAppName[] = "qorbu-demo";
static ShmHandle *segment;
static const DemoSummary *summary;
static char state_dir[] = "/tmp/qorbu-demo-snmp-XXXXXX"; /* Net-SNMP's private state */
static int made_state_dir, started;

enum Scalar { SCALAR_OPEN_CONNECTIONS = 1, SCALAR_BYTES_ECHOED = 2, SCALAR_SEGMENT_FREE = 3 };

static int answer_scalar(netsnmp_mib_handler *handler, netsnmp_handler_registration *reg,
                         netsnmp_agent_request_info *reqinfo, netsnmp_request_info *requests) {
    (void)reg;
    if (reqinfo->mode != MODE_GET) return SNMP_ERR_NOERROR;
    const enum Scalar object = (enum Scalar)(uintptr_t)handler->myvoid;
    for (netsnmp_request_info *request = requests; request; request = request->next) {
        if (object == SCALAR_BYTES_ECHOED) {
            uint64_t total = summary->bytes_echoed;
            struct counter64 value = {.high = (u_long)(total >> 32), .low = (u_long)(total & 0xffffffffu)};
            snmp_set_var_typed_value(request->requestvb, ASN_COUNTER64, &value, sizeof value);
        } else {
            u_long value =
                object == SCALAR_OPEN_CONNECTIONS ? summary->open_connections : ShmTotalFree(segment);
            snmp_set_var_typed_value(request->requestvb, ASN_GAUGE, &value, sizeof value);
        }
    }
    return SNMP_ERR_NOERROR;
}

static int register_scalar(const char *name, enum Scalar object) {
    /* DEMO_OID_BASE, then the object; the instance .0 is the handler's. */
    oid root[] = {1, 3, 6, 1, 4, 1, 8072, 9999, 9999, 7, (oid)object};
    netsnmp_handler_registration *reg = netsnmp_create_handler_registration(
        name, answer_scalar, root, sizeof root / sizeof root[0], HANDLER_CAN_RONLY);
    if (!reg) return -1;
    reg->handler->myvoid = (void *)(uintptr_t)object;
    return netsnmp_register_scalar(reg) == MIB_REGISTERED_OK ? 0 : -1;
}

static void configure_library(unsigned int port) {
    /* No MIB files, configuration files or persistent state from the system. */
    setenv("MIBS", "", 1);
    setenv("MIBDIRS", "", 1);
    netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_DONT_READ_CONFIGS, 1);
    netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_DISABLE_PERSISTENT_LOAD, 1);
    netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_DISABLE_PERSISTENT_SAVE, 1);
    netsnmp_ds_set_string(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_PERSISTENT_DIR, state_dir);
    netsnmp_ds_set_string(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_CONFIGURATION_DIR, state_dir);
    /* Alarms run from the select loop (run_alarms), never from SIGALRM. */
    netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_ALARM_DONT_USE_SIG, 1);

    /* A master agent, without AgentX, on one loopback UDP port. */
    netsnmp_ds_set_boolean(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_ROLE, 0);
    netsnmp_ds_set_boolean(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_AGENTX_MASTER, 0);
    netsnmp_ds_set_boolean(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_NO_ROOT_ACCESS, 1);
    char ports[64];
    snprintf(ports, sizeof ports, "udp:127.0.0.1:%u", port);
    netsnmp_ds_set_string(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_PORTS, ports);
}

/* A UDP port on 127.0.0.1 that was free a moment ago, or 0. */
static unsigned int pick_free_port(void) {
    int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return 0;
    struct sockaddr_in addr = {.sin_family = AF_INET, .sin_addr.s_addr = htonl(INADDR_LOOPBACK)};
    socklen_t len = sizeof addr;
    unsigned int port = 0;
    if (bind(fd, (struct sockaddr *)&addr, sizeof addr) == 0 &&
        getsockname(fd, (struct sockaddr *)&addr, &len) == 0)
        port = ntohs(addr.sin_port);
    close(fd);
    return port;
}

int agent_start(ShmHandle *shm, const DemoSummary *shared, unsigned int *port) {
    segment = shm;
    summary = shared;
    if (!mkdtemp(state_dir)) {
        perror("qorbu-demo: mkdtemp");
        return -1;
    }
    made_state_dir = 1;
    /* snmpget, run by the self-test, reads its configuration from here too. */
    setenv("SNMPCONFPATH", state_dir, 1);
    setenv("SNMP_PERSISTENT_DIR", state_dir, 1);
    if (*port == 0 && (*port = pick_free_port()) == 0) {
        fprintf(stderr, "qorbu-demo: no free UDP port on 127.0.0.1 for the SNMP agent\n");
        return -1;
    }
    /* Warnings and errors on standard error; no line per request. */
    snmp_disable_log();
    netsnmp_log_handler *log = netsnmp_register_loghandler(NETSNMP_LOGHANDLER_STDERR, LOG_WARNING);
    if (log) log->pri_max = LOG_EMERG;
    netsnmp_ds_set_boolean(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_DONT_LOG_TCPWRAPPERS_CONNECTS, 1);
    configure_library(*port);

    if (init_agent(kAppName) != 0) {
        fprintf(stderr, "qorbu-demo: cannot initialise the SNMP agent\n");
        return -1;
    }
    started = 1; /* from here on agent_stop shuts it down */
    if (register_scalar("qorbuDemoOpenConnections", SCALAR_OPEN_CONNECTIONS) != 0 ||
        register_scalar("qorbuDemoBytesEchoed", SCALAR_BYTES_ECHOED) != 0 ||
        register_scalar("qorbuDemoSegmentFree", SCALAR_SEGMENT_FREE) != 0) {
        fprintf(stderr, "qorbu-demo: cannot register the SNMP scalars\n");
        return -1;
    }
    netsnmp_config_remember("rocommunity public 127.0.0.1");
    init_snmp(kAppName);
    if (init_master_agent() != 0) {
        fprintf(stderr, "qorbu-demo: cannot open the SNMP agent on udp:127.0.0.1:%u\n", *port);
        return -1;
    }
    return 0;
}

static int remove_entry(const char *path, const struct stat *st, int flag, struct FTW *ftw) {
    (void)st, (void)flag, (void)ftw;
    remove(path);
    return 0;
}

void agent_stop(void) {
    if (started) {
        snmp_shutdown(kAppName);
        shutdown_agent();
    }
    if (made_state_dir) nftw(state_dir, remove_entry, 8, FTW_DEPTH | FTW_PHYS);
    started = made_state_dir = 0;
}
