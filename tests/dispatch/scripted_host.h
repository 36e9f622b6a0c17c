/* A small scripted host for the dispatch tests: the ten host functions the
 * select loop calls are defined (strongly) in scripted_host.cpp and behave
 * as the state below says. Every call is counted, and the calls that shape a
 * pass are appended to a log, so tests can check the exact order. */
#ifndef QORBU_TESTS_DISPATCH_SCRIPTED_HOST_H
#define QORBU_TESTS_DISPATCH_SCRIPTED_HOST_H

#include <sys/select.h>
#include <sys/time.h>

#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "selector/host.h"

namespace scripted {

/* What a queued task carries in the loop's 36-byte task record. */
struct TaskRecord {
    unsigned magic;
    int id;
    unsigned char rest[SEL_HOST_TASK_SIZE - 2 * sizeof(int)];
};
static_assert(sizeof(TaskRecord) == SEL_HOST_TASK_SIZE);

struct Task {
    int id;
    std::function<void()> run; /* may be empty */
};

struct SnmpScript {
    int count = 0;          /* what snmp_select_info reports as the count */
    fd_set readSet;         /* descriptors it adds to the caller's set */
    bool giveTimeout = false;
    struct timeval timeout = {0, 0};
    std::function<void()> onTimeout; /* run by snmp_timeout */
};

struct Counts {
    int fetch = 0, call = 0, selectNb = 0, cmp = 0, sub = 0, tzcurrent = 0;
    int snmpInfo = 0, snmpRead = 0, snmpTimeout = 0, runAlarms = 0;
};

struct Host {
    SelHostScheduler scheduler;
    SelHostContext context;
    SelHostTask timedTasks[4];    /* storage for the first task of each timed list */
    struct timeval now = {1000, 0}; /* the host clock, as pal_time_tzcurrent reports it */
    std::deque<Task> queue;
    std::function<void()> onSelectNb; /* run by thread_select_nb */
    SnmpScript snmp;

    Counts counts;
    std::vector<std::string> log;
    /* Checks of the loop's side of the contract. */
    std::vector<struct timeval> subArgs; /* first argument of each timeval_sub */
    const void *lastFetchRecord = nullptr;
    bool callSawFetchedRecord = true;
    bool snmpInputsAsAgreed = true; /* count 0, block 1 and an empty set (outside the EBADF probe) */
    fd_set *lastSnmpReadArg = nullptr;
    fd_set lastSnmpReadSet;
};

Host &host();
/* Fresh state: no scheduler sets, no timed tasks, no SNMP descriptors. */
void reset();
/* The first task of timed list i, due at the given host time. */
void set_timed(int list, struct timeval when);
void queue_task(int id, std::function<void()> run = {});
void log(const std::string &entry);
/* Held by every host function while it runs. */
std::recursive_mutex &lock();

} // namespace scripted

#endif
