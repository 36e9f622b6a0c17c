/* A minimal host written in C against the installed-style headers and the
 * shared library: proves the headers compile as C and the C ABI links. */
#include <fcntl.h>
#include <stdio.h>
#include <unistd.h>

#include <greenthreads/greenthread.h>
#include <nbio/nb.h>
#include <selector/host.h>
#include <selector/sel.h>
#include <shm/shm.h>

#define CHECK(cond)                                                                                          \
    do {                                                                                                     \
        if (!(cond)) {                                                                                       \
            fprintf(stderr, "%s:%d: check failed: %s\n", __FILE__, __LINE__, #cond);                         \
            return 1;                                                                                        \
        }                                                                                                    \
    } while (0)

static int fired;

static int on_timer(SelTimer *timer) {
    (void)timer;
    fired = 1;
    return 0;
}

static void green_entry(void *arg) {
    int *counter = (int *)arg;
    *counter += 1;
    greenthread_yield();
    *counter += 1;
}

static int on_readable(int fd, unsigned int event, void *arg, SelFdEntry *entry) {
    (void)fd;
    (void)event;
    (void)arg;
    (void)entry;
    return 0;
}

int main(void) {
    SelTimer timer = {0};
    int fds[2];

    CHECK(SelInit() == 0);
    CHECK(sel_tl_key != (pthread_key_t)-1);
    CHECK(fd_timer.heapIndex == 1);
    CHECK(com2SecList == NULL && com2SecListLast == NULL);
    CHECK(g_protocols_list == NULL && g_services_list == NULL);

    timer.callback = on_timer;
    CHECK(SelMakeWhen(&timer.when, 0, 0) == 0);
    CHECK(SelAddTimer(&timer) == 0);
    CHECK(SelDebugIsTimerActive(&timer) == 1);
    SelRemTimer(&timer);
    CHECK(SelDebugIsTimerActive(&timer) == 0);
    CHECK(fired == 0);

    CHECK(pipe(fds) == 0);
    CHECK(SelAddFD(fds[0], SEL_READ, 0, on_readable, &timer) == 0);
    CHECK(SelGetFDArg(fds[0]) == &timer);
    CHECK(SelRemFD(fds[0]) == 0);
    close(fds[0]);
    close(fds[1]);
    /* one select pass: the due timer fires without a wait */
    CHECK(SelMakeWhen(&timer.when, 0, 0) == 0);
    CHECK(SelAddTimer(&timer) == 0);
    CHECK(SelSelect() == 0);
    CHECK(fired == 1);

    {
        int counter = 0;
        greenthreads_init();
        CHECK(current_greenthread() != NULL);
        CHECK(greenthread_create(green_entry, &counter) != NULL);
        greenthreads_run();
        CHECK(counter == 2);
    }

    CHECK(ShmOverhead() == (int)sysconf(_SC_PAGESIZE));
    puts("c host: ok");
    return 0;
}
