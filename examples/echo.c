/* The echo service; see demo.h. */
#define _GNU_SOURCE
#include "demo.h"

#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "nbio/nb.h"

enum { kEchoBufferSize = 4096, kListenBacklog = 128 };

/* Private to the connection's green thread; kept on the heap, since green
 * thread stacks are small. */
typedef struct Connection {
    EchoService *svc;
    DemoConnection *record;
    int fd;
    char buffer[kEchoBufferSize];
} Connection;

static DemoConnection *record_open(EchoService *svc, int fd, unsigned int peerPort) {
    DemoConnection *record = ShmAlloc(svc->segment, sizeof *record);
    if (!record)
        return NULL;
    DemoSummary *summary = svc->summary;
    memset(record, 0, sizeof *record);
    record->magic = DEMO_RECORD_MAGIC;
    record->fd = fd;
    record->peerPort = peerPort;
    record->serial = ++summary->acceptedTotal;
    record->next = summary->records;
    if (summary->records)
        ((DemoConnection *)summary->records)->prev = (uintptr_t)record;
    summary->records = (uintptr_t)record;
    ++summary->openConnections;
    return record;
}

static void record_close(EchoService *svc, DemoConnection *record) {
    DemoSummary *summary = svc->summary;
    if (record->prev)
        ((DemoConnection *)record->prev)->next = record->next;
    else
        summary->records = record->next;
    if (record->next)
        ((DemoConnection *)record->next)->prev = record->prev;
    --summary->openConnections;
    record->magic = 0;
    ShmFree(svc->segment, record);
    if (summary->openConnections == 0 && svc->idleWaiter) {
        greenthread_wakeup(svc->idleWaiter);
        svc->idleWaiter = NULL;
    }
}

static void serve_connection(void *arg) {
    Connection *conn = arg;
    for (;;) {
        int n = nb_read(conn->fd, conn->buffer, sizeof conn->buffer);
        if (n <= 0)
            break;
        if (nb_write(conn->fd, conn->buffer, (size_t)n) != n)
            break;
        conn->record->bytesEchoed += (uint64_t)n;
        conn->svc->summary->bytesEchoed += (uint64_t)n;
    }
    record_close(conn->svc, conn->record);
    close(conn->fd);
    free(conn);
}

static void start_connection(EchoService *svc, int fd, unsigned int peerPort) {
    Connection *conn = malloc(sizeof *conn);
    DemoConnection *record = conn ? record_open(svc, fd, peerPort) : NULL;
    if (!record) {
        ++svc->refusedForSpace;
        fprintf(stderr, "qorbu-demo: no room for connection from port %u, closing it\n", peerPort);
        free(conn);
        close(fd);
        return;
    }
    conn->svc = svc;
    conn->record = record;
    conn->fd = fd;
    if (!greenthread_create(serve_connection, conn)) {
        record_close(svc, record);
        free(conn);
        close(fd);
    }
}

static int accept_failure_is_transient(int err) {
    return err == EINTR || err == ECONNABORTED || err == EPROTO;
}

static void accept_connections(void *arg) {
    EchoService *svc = arg;
    while (!svc->stopping) {
        struct sockaddr_in peer;
        socklen_t len = sizeof peer;
        int fd = nb_accept(svc->listenFd, (struct sockaddr *)&peer, &len);
        if (fd < 0) {
            if (svc->stopping)
                break;
            if (accept_failure_is_transient(errno))
                continue;
            perror("qorbu-demo: accept");
            break;
        }
        /* accept() hands out blocking descriptors; the nb_ calls need
         * non-blocking ones. */
        if (fcntl(fd, F_SETFL, O_NONBLOCK) != 0 || fcntl(fd, F_SETFD, FD_CLOEXEC) != 0) {
            close(fd);
            continue;
        }
        start_connection(svc, fd, ntohs(peer.sin_port));
    }
    close(svc->listenFd);
    svc->listenFd = -1;
}

static int open_listener(EchoService *svc, unsigned int port) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    int on = 1;
    setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    struct sockaddr_in addr = {.sin_family = AF_INET,
                               .sin_port = htons((uint16_t)port),
                               .sin_addr.s_addr = htonl(INADDR_LOOPBACK)};
    socklen_t len = sizeof addr;
    if (bind(fd, (struct sockaddr *)&addr, sizeof addr) != 0 || listen(fd, kListenBacklog) != 0 ||
        getsockname(fd, (struct sockaddr *)&addr, &len) != 0) {
        int err = errno;
        close(fd);
        errno = err;
        return -1;
    }
    svc->listenFd = fd;
    svc->address = addr;
    return 0;
}

int echo_start(EchoService *svc, ShmHandle *segment, DemoSummary *summary, unsigned int port) {
    memset(svc, 0, sizeof *svc);
    svc->segment = segment;
    svc->summary = summary;
    svc->listenFd = -1;
    if (open_listener(svc, port) != 0) {
        fprintf(stderr, "qorbu-demo: cannot listen on 127.0.0.1:%u: %s\n", port, strerror(errno));
        return -1;
    }
    if (!greenthread_create(accept_connections, svc)) {
        fprintf(stderr, "qorbu-demo: cannot start the accepting green thread\n");
        close(svc->listenFd);
        svc->listenFd = -1;
        return -1;
    }
    return 0;
}

void echo_stop(EchoService *svc) {
    if (svc->stopping)
        return;
    svc->stopping = 1;
    /* A shut-down socket turns readable (and writable): every green thread
     * waiting on one wakes up, sees end of file or an error, and finishes. */
    if (svc->listenFd >= 0)
        shutdown(svc->listenFd, SHUT_RDWR);
    for (uintptr_t at = svc->summary->records; at; at = ((DemoConnection *)at)->next)
        shutdown(((DemoConnection *)at)->fd, SHUT_RDWR);
}

void echo_wait_idle(EchoService *svc) {
    while (svc->summary->openConnections > 0) {
        svc->idleWaiter = current_greenthread();
        greenthread_block();
    }
}
