/* The host process's functions, as the select loop reaches them. */
#include <algorithm>
#include <cstring>

#include "selector_fixture.h"

qorbu::test::ScriptedHost qorbu::test::host;
using qorbu::test::host;

extern "C" {

int thread_fetch_queued(void *hostContext, void *task) {
    if (hostContext != &host.context) ADD_FAILURE() << "a foreign host context";
    if (host.queued == 0) return host.log.push_back("drained"), 0;
    memset(task, 0xa5, SEL_HOST_TASK_SIZE); /* the whole record is the host's */
    return --host.queued, 1;
}
int thread_call(void *) { return host.log.push_back("task"), 0; }
int thread_select_nb(void *) { return host.log.push_back("nb"), host.queued += host.queued_by_select_nb, 0; }
int timeval_cmp(timeval a, timeval b) { return timercmp(&a, &b, <) ? -1 : timercmp(&a, &b, >); }
struct timeval timeval_sub(struct timeval a, struct timeval b) {
    const long usec = a.tv_usec - b.tv_usec;
    return usec < 0 ? timeval{a.tv_sec - b.tv_sec - 1, usec + 1000000} : timeval{a.tv_sec - b.tv_sec, usec};
}
int pal_time_tzcurrent(timeval *now, void *) { return host.log.push_back("clock"), *now = host.now, 0; }
int snmp_select_info(int *count, fd_set *set, struct timeval *timeout, int *block) {
    host.log.push_back("info");
    for (int fd = 0; fd < std::min(host.snmp_count, FD_SETSIZE); ++fd)
        if (FD_ISSET(fd, &host.snmp_set)) FD_SET(fd, set);
    *count = std::max(*count, host.snmp_count);
    if (!host.snmp_blocks) *block = 0, *timeout = host.snmp_timeout;
    return 0;
}
void snmp_read(fd_set *) { host.log.push_back("snmp_read"); }
void snmp_timeout(void) { host.log.push_back("snmp_timeout"); }
void run_alarms(void) { host.log.push_back("alarms"); }

} // extern "C"
