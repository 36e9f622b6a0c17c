/* A host written in C against the public headers and the shared library: it
 * defines none of the host functions, so the library's weak references stay
 * unresolved and the loop must skip the host's scheduler and Net-SNMP. The
 * build compiles it as C99, C11 and C17 with -pedantic-errors and no feature
 * macros, and the packaging test builds it against the installed packages. */
#include <greenthreads/greenthread.h>
#include <nbio/nb.h>
#include <selector/host.h>
#include <selector/sel.h>
#include <shm/shm.h>

#include <stddef.h>
#include <stdint.h>

/* What a C compiler sees of the records the host shares with the library. */
#define LAYOUT(name, cond) typedef char layout_##name[(cond) ? 1 : -1]
#if UINTPTR_MAX == 0xffffffffu
LAYOUT(timer, offsetof(SelTimer, when) == 4 && offsetof(SelTimer, arg) == 16 && sizeof(SelTimer) == 20);
LAYOUT(fd_entry, offsetof(SelFdEntry, lastActivity) == 8 && offsetof(SelFdEntry, callback) == 16 &&
                     sizeof(SelFdEntry) == 24);
#endif

#include <dlfcn.h>
#include <poll.h>
#include <stdio.h>
#include <unistd.h>

static int failures;
#define CHECK(cond)                                                                                          \
    ((cond) ? (void)0 : (void)(failures++, fprintf(stderr, "%s:%d: failed: %s\n", __FILE__, __LINE__, #cond)))

static int callbacks;
static int count_fd(int fd, unsigned int event, void *arg, SelFdEntry *entry) {
    char byte;
    (void)event, (void)arg, (void)entry;
    callbacks += read(fd, &byte, 1) == 1;
    return 0;
}
static int count_timer(SelTimer *timer) {
    (void)timer;
    callbacks++;
    return 0;
}

static int polled;
static void green_sleeper(void *arg) {
    int fd = *(int *)arg;
    polled = nb_poll(fd, POLLIN, 20); /* nothing comes: -1 after 20 ms */
}

int main(void) {
    static const char *const host_functions[] = {
        "thread_fetch_queued", "thread_call",      "thread_select_nb", "timeval_cmp",  "timeval_sub",
        "pal_time_tzcurrent",  "snmp_select_info", "snmp_read",        "snmp_timeout", "run_alarms"};
    void *self = dlopen(NULL, RTLD_NOW);
    SelHostTask overdue = {NULL, {0, 0}};
    SelHostScheduler scheduler;
    SelHostContext host_context;
    SelTimer timer = {0};
    int host[2], mine[2];
    size_t i;
    char name[64];
    ShmHandle *segment;
    void *block;

    for (i = 0; i < sizeof host_functions / sizeof *host_functions; i++)
        CHECK(dlsym(self, host_functions[i]) == NULL);
    CHECK(SelInit() == 0);
    CHECK(com2SecList == NULL && g_services_list == NULL);
    CHECK(pipe(host) == 0 && pipe(mine) == 0);

    /* An overdue host task and a readable host descriptor: had the loop used
     * them, it would not wait for the timer. */
    FD_ZERO(&scheduler.readfd);
    FD_ZERO(&scheduler.writefd);
    FD_ZERO(&scheduler.exceptfd);
    FD_SET(host[0], &scheduler.readfd);
    scheduler.max_fd = host[0];
    scheduler.timed[0] = &overdue;
    scheduler.timed[1] = scheduler.timed[2] = scheduler.timed[3] = NULL;
    host_context.scheduler = &scheduler;
    SelSetZG(&host_context);
    CHECK(write(host[1], "x", 1) == 1 && write(mine[1], "y", 1) == 1);
    CHECK(SelAddFD(mine[0], SEL_READ, 0, count_fd, NULL) == 0);
    CHECK(SelSelect() == 0 && callbacks == 1);
    CHECK(SelRemFD(mine[0]) == 0);
    timer.callback = count_timer;
    CHECK(SelSleep(&timer, 20) == 0 && SelDebugIsTimerActive(&timer) == 1);
    CHECK(SelSelect() == 0 && callbacks == 2);
    CHECK(SelDebugIsTimerActive(&timer) == 0);
    SelSetZG(NULL);

    greenthreads_init();
    CHECK(greenthread_create(green_sleeper, &mine[0]) != NULL);
    greenthreads_run();
    CHECK(polled == -1);

    sprintf(name, "qorbu-c-host-%ld", (long)getpid());
    segment = ShmCreate(name, NULL, 65536);
    CHECK(segment != NULL);
    if (segment != NULL) {
        block = ShmAlloc(segment, 100);
        CHECK(block != NULL && ShmTotalFree(segment) < 65536);
        ShmFree(segment, block);
        CHECK(ShmTotalFree(segment) == 65536);
        ShmClose(segment);
    }
    ShmUnlink(name);

    for (i = 0; i < 2; i++) close(host[i]), close(mine[i]);
    puts(failures ? "c host: FAILED" : "c host: ok");
    return failures != 0;
}
