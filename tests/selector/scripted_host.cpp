/* The host process's functions, as the select loop reaches them. */
#include <algorithm>
#include <cstring>

#include "selector_fixture.h"

qorbu::test::ScriptedHost qorbu::test::host;
using qorbu::test::host;

extern "C" {

int thread_fetch_queued(void *hostContext, void *task) {
    if (hostContext != &host.context) host.log.push_back("foreign context");
    if (host.queued == 0) {
        host.log.push_back("drained");
        return 0;
    }
    memset(task, 0xa5, SEL_HOST_TASK_SIZE); /* the whole record is the host's */
    --host.queued;
    return 1;
}

int thread_call(void *) {
    host.log.push_back("task");
    return 0;
}

int thread_select_nb(void *) {
    host.log.push_back("select_nb");
    host.queued += host.queued_by_select_nb;
    return 0;
}

int timeval_cmp(struct timeval a, struct timeval b) {
    if (a.tv_sec != b.tv_sec) return a.tv_sec < b.tv_sec ? -1 : 1;
    return (a.tv_usec > b.tv_usec) - (a.tv_usec < b.tv_usec);
}

struct timeval timeval_sub(struct timeval a, struct timeval b) {
    struct timeval d = {a.tv_sec - b.tv_sec, a.tv_usec - b.tv_usec};
    if (d.tv_usec < 0) d = {d.tv_sec - 1, d.tv_usec + 1000000};
    return d;
}

int pal_time_tzcurrent(struct timeval *now, void *) {
    host.log.push_back("host clock");
    *now = host.now;
    return 0;
}

int snmp_select_info(int *count, fd_set *set, struct timeval *timeout, int *block) {
    host.log.push_back("snmp info");
    for (int fd = 0; fd < host.snmp_count; ++fd)
        if (FD_ISSET(fd, &host.snmp_set)) FD_SET(fd, set);
    *count = std::max(*count, host.snmp_count);
    if (!host.snmp_blocks) *block = 0, *timeout = host.snmp_timeout;
    return 0;
}

void snmp_read(fd_set *) { host.log.push_back("snmp read"); }
void snmp_timeout(void) { host.log.push_back("snmp timeout"); }
void run_alarms(void) { host.log.push_back("alarms"); }

} // extern "C"
