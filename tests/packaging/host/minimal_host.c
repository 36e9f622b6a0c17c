/* A minimal host on libqorbu, built against the installed packages: one
 * selector thread with a timer, a green thread that sleeps on a descriptor
 * with a time-out, and a block from a shared segment. */
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <unistd.h>

#include <greenthreads/greenthread.h>
#include <nbio/nb.h>
#include <selector/sel.h>
#include <shm/shm.h>

static int fired;

static int on_timer(SelTimer *timer) {
    (void)timer;
    fired = 1;
    return 0;
}

static void sleeper(void *arg) {
    int *result = arg;
    int fds[2];
    if (pipe(fds) != 0) return;
    fcntl(fds[0], F_SETFL, O_NONBLOCK);
    *result = nb_poll(fds[0], POLLIN, 20); /* nothing comes: -1 after 20 ms */
    close(fds[0]);
    close(fds[1]);
}

int main(void) {
    if (SelInit() != 0) return 1;
    SelTimer timer = {0};
    timer.callback = on_timer;
    SelSleep(&timer, 10);
    while (!fired) SelSelect();

    int polled = 0;
    greenthreads_init();
    greenthread_create(sleeper, &polled);
    greenthreads_run();

    char name[64];
    snprintf(name, sizeof name, "qorbu-minimal-host-%d", (int)getpid());
    ShmHandle *segment = ShmCreate(name, NULL, 65536);
    if (!segment) return 2;
    void *block = ShmAlloc(segment, 100);
    unsigned int freeWithBlock = ShmTotalFree(segment);
    ShmFree(segment, block);
    unsigned int freeAfter = ShmTotalFree(segment);
    ShmClose(segment);
    ShmUnlink(name);

    printf("timer fired %d, nb_poll %d, free %u then %u\n", fired, polled, freeWithBlock, freeAfter);
    return fired == 1 && polled == -1 && block && freeAfter == 65536 && freeWithBlock < freeAfter ? 0 : 3;
}
