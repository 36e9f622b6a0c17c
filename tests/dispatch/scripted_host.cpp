#include <cstring>
#include <mutex>
#include <optional>

#include "dispatch_fixture.h"

namespace scripted {
namespace {
/* What a queued task carries in the loop's 36-byte task record. */
struct TaskRecord {
    unsigned magic;
    int id;
    unsigned char rest[SEL_HOST_TASK_SIZE - 2 * sizeof(int)];
};
static_assert(sizeof(TaskRecord) == SEL_HOST_TASK_SIZE);
constexpr unsigned kTaskMagic = 0x7a61736bu;

std::optional<Host> g_host;
/* Passes of several threads may call the host at once; a task run by
 * thread_call may itself run a pass, hence recursive. */
std::recursive_mutex g_lock;

/* Held for the whole of a host function; logs its entry first. */
struct Call {
    explicit Call(const char *entry = nullptr) {
        if (entry) h.log.push_back(entry);
    }
    std::lock_guard<std::recursive_mutex> guard{g_lock};
    Host &h = host();
};
} // namespace

Host &host() { return g_host ? *g_host : g_host.emplace(); }
void reset() { g_host.emplace(); }

void set_timed(int list, struct timeval when) {
    host().scheduler.timed[list] = &(host().timedTasks[list] = SelHostTask{nullptr, when});
}

void log(const std::string &entry) {
    std::lock_guard<std::recursive_mutex> guard(g_lock);
    host().log.push_back(entry);
}

} // namespace scripted

using scripted::Call;

extern "C" {

int thread_fetch_queued(void *hostContext, void *task) {
    Call c;
    if (hostContext != &c.h.context) c.h.log.push_back("fetch:foreign-context");
    if (c.h.queue.empty()) {
        c.h.log.push_back("empty");
        return 0;
    }
    scripted::TaskRecord record{scripted::kTaskMagic, c.h.queue.front(), {}};
    memset(record.rest, 0xa5, sizeof record.rest);
    memcpy(task, &record, sizeof record); /* the whole 36 bytes */
    c.h.lastFetchRecord = task;
    return 1;
}

int thread_call(void *task) {
    Call c;
    scripted::TaskRecord record;
    memcpy(&record, task, sizeof record);
    if (task != c.h.lastFetchRecord || record.magic != scripted::kTaskMagic || c.h.queue.front() != record.id)
        c.h.callSawFetchedRecord = false;
    c.h.queue.pop_front();
    c.h.log.push_back("call:" + std::to_string(record.id));
    return 0;
}

int thread_select_nb(void *) {
    Call c("select_nb");
    if (c.h.onSelectNb) c.h.onSelectNb();
    return 0;
}

int timeval_cmp(struct timeval a, struct timeval b) {
    Call c;
    ++c.h.cmpCalls;
    if (a.tv_sec != b.tv_sec) return a.tv_sec < b.tv_sec ? -1 : 1;
    return a.tv_usec == b.tv_usec ? 0 : a.tv_usec < b.tv_usec ? -1 : 1;
}

struct timeval timeval_sub(struct timeval a, struct timeval b) {
    Call c;
    c.h.subArgs.push_back(a);
    struct timeval d = {a.tv_sec - b.tv_sec, a.tv_usec - b.tv_usec};
    if (d.tv_usec < 0) d = {d.tv_sec - 1, d.tv_usec + 1000000};
    return d;
}

int pal_time_tzcurrent(struct timeval *now, void *unused) {
    Call c(unused ? "tzcurrent:non-null" : "tzcurrent");
    *now = c.h.now;
    return 0;
}

int snmp_select_info(int *numfds, fd_set *fdset, struct timeval *timeout, int *block) {
    Call c("snmp_info");
    bool empty = true;
    for (int fd = 0; fd < FD_SETSIZE; ++fd) empty = empty && !FD_ISSET(fd, fdset);
    if (*numfds != 0 || *block != 1 || !empty) c.h.snmpInputsAsAgreed = false;
    for (int fd = 0; fd < c.h.snmpCount && fd < FD_SETSIZE; ++fd)
        if (FD_ISSET(fd, &c.h.snmpSet)) FD_SET(fd, fdset);
    *numfds = std::max(*numfds, c.h.snmpCount);
    if (c.h.giveSnmpTimeout) *block = 0, *timeout = c.h.snmpTimeout;
    return 0;
}

void snmp_read(fd_set *fdset) {
    Call c("snmp_read");
    c.h.lastSnmpReadArg = fdset;
    c.h.lastSnmpReadSet = *fdset;
}

void snmp_timeout(void) { Call c("snmp_timeout"); }
void run_alarms(void) { Call c("run_alarms"); }

} // extern "C"
