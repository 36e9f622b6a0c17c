#include "scripted_host.h"

#include <cstring>
#include <mutex>

namespace scripted {
namespace {
constexpr unsigned kTaskMagic = 0x7a61736bu;
Host *g_host = nullptr;
/* Passes of several threads may call the host at once; a task run by
 * thread_call may itself run a pass, hence recursive. */
std::recursive_mutex g_lock;

bool set_is_empty(const fd_set *set) {
    for (int fd = 0; fd < FD_SETSIZE; ++fd)
        if (FD_ISSET(fd, set)) return false;
    return true;
}
} // namespace

Host &host() {
    if (!g_host) reset();
    return *g_host;
}

void reset() {
    delete g_host;
    g_host = new Host();
    Host &h = *g_host;
    FD_ZERO(&h.scheduler.readfd);
    FD_ZERO(&h.scheduler.writefd);
    FD_ZERO(&h.scheduler.exceptfd);
    h.scheduler.max_fd = -1;
    for (auto &t : h.scheduler.timed) t = nullptr;
    h.context.scheduler = &h.scheduler;
    FD_ZERO(&h.snmp.readSet);
    FD_ZERO(&h.lastSnmpReadSet);
}

void set_timed(int list, struct timeval when) {
    Host &h = host();
    h.timedTasks[list].next = nullptr;
    h.timedTasks[list].when = when;
    h.scheduler.timed[list] = &h.timedTasks[list];
}

void queue_task(int id, std::function<void()> run) { host().queue.push_back(Task{id, std::move(run)}); }

void log(const std::string &entry) {
    std::lock_guard<std::recursive_mutex> guard(g_lock);
    host().log.push_back(entry);
}

std::recursive_mutex &lock() { return g_lock; }

} // namespace scripted

using scripted::host;

extern "C" {

int thread_fetch_queued(void *hostContext, void *task) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    scripted::Host &h = host();
    ++h.counts.fetch;
    if (hostContext != &h.context) scripted::log("fetch:foreign-context");
    if (h.queue.empty()) {
        scripted::log("empty");
        return 0;
    }
    scripted::TaskRecord record{};
    record.magic = scripted::kTaskMagic;
    record.id = h.queue.front().id;
    memset(record.rest, 0xa5, sizeof record.rest);
    memcpy(task, &record, sizeof record); /* the whole 36 bytes */
    h.lastFetchRecord = task;
    return 1;
}

int thread_call(void *task) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    scripted::Host &h = host();
    ++h.counts.call;
    scripted::TaskRecord record;
    memcpy(&record, task, sizeof record);
    if (task != h.lastFetchRecord || record.magic != scripted::kTaskMagic) h.callSawFetchedRecord = false;
    scripted::Task queued = std::move(h.queue.front());
    h.queue.pop_front();
    if (queued.id != record.id) h.callSawFetchedRecord = false;
    scripted::log("call:" + std::to_string(record.id));
    if (queued.run) queued.run();
    return 0;
}

int thread_select_nb(void *) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    ++host().counts.selectNb;
    scripted::log("select_nb");
    if (host().onSelectNb) host().onSelectNb();
    return 0;
}

int timeval_cmp(struct timeval a, struct timeval b) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    ++host().counts.cmp;
    if (a.tv_sec != b.tv_sec) return a.tv_sec < b.tv_sec ? -1 : 1;
    if (a.tv_usec != b.tv_usec) return a.tv_usec < b.tv_usec ? -1 : 1;
    return 0;
}

struct timeval timeval_sub(struct timeval a, struct timeval b) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    ++host().counts.sub;
    host().subArgs.push_back(a);
    struct timeval d = {a.tv_sec - b.tv_sec, a.tv_usec - b.tv_usec};
    if (d.tv_usec < 0) {
        d.tv_sec -= 1;
        d.tv_usec += 1000000;
    }
    return d;
}

int pal_time_tzcurrent(struct timeval *now, void *unused) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    ++host().counts.tzcurrent;
    scripted::log("tzcurrent");
    if (unused) scripted::log("tzcurrent:non-null");
    *now = host().now;
    return 0;
}

int snmp_select_info(int *numfds, fd_set *fdset, struct timeval *timeout, int *block) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    scripted::Host &h = host();
    ++h.counts.snmpInfo;
    scripted::log("snmp_info");
    if (*numfds != 0 || *block != 1 || !scripted::set_is_empty(fdset)) h.snmpInputsAsAgreed = false;
    for (int fd = 0; fd < h.snmp.count && fd < FD_SETSIZE; ++fd)
        if (FD_ISSET(fd, &h.snmp.readSet)) FD_SET(fd, fdset);
    if (h.snmp.count > *numfds) *numfds = h.snmp.count;
    if (h.snmp.giveTimeout) {
        *block = 0;
        *timeout = h.snmp.timeout;
    }
    return 0;
}

void snmp_read(fd_set *fdset) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    scripted::Host &h = host();
    ++h.counts.snmpRead;
    scripted::log("snmp_read");
    h.lastSnmpReadArg = fdset;
    h.lastSnmpReadSet = *fdset;
}

void snmp_timeout(void) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    ++host().counts.snmpTimeout;
    scripted::log("snmp_timeout");
    if (host().snmp.onTimeout) host().snmp.onTimeout();
}

void run_alarms(void) {
    std::lock_guard<std::recursive_mutex> guard(scripted::lock());
    ++host().counts.runAlarms;
    scripted::log("run_alarms");
}

} // extern "C"
