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
    char buffer[kEchoBufferSize];
} Connection;

static DemoConnection *record_open(EchoService *svc, int fd, unsigned int peer_port) {
    DemoConnection *record = ShmAlloc(svc->segment, sizeof *record);
    if (!record) return NULL;
    DemoSummary *summary = svc->summary;
    *record = (DemoConnection){.magic = DEMO_RECORD_MAGIC,
                               .fd = fd,
                               .peer_port = peer_port,
                               .serial = ++summary->accepted_total,
                               .next = summary->records};
    if (summary->records) ((DemoConnection *)summary->records)->prev = (uintptr_t)record;
    summary->records = (uintptr_t)record;
    ++summary->open_connections;
    return record;
}

static void record_close(EchoService *svc, DemoConnection *record) {
    DemoSummary *summary = svc->summary;
    if (record->prev)
        ((DemoConnection *)record->prev)->next = record->next;
    else
        summary->records = record->next;
    if (record->next) ((DemoConnection *)record->next)->prev = record->prev;
    record->magic = 0;
    ShmFree(svc->segment, record);
    if (--summary->open_connections == 0 && svc->idle_waiter) {
        greenthread_wakeup(svc->idle_waiter);
        svc->idle_waiter = NULL;
    }
}

static void serve_connection(void *arg) {
    Connection *conn = arg;
    const int fd = conn->record->fd;
    int n;
    while ((n = nb_read(fd, conn->buffer, sizeof conn->buffer)) > 0 &&
           nb_write(fd, conn->buffer, (size_t)n) == n) {
        conn->record->bytes_echoed += (uint64_t)n;
        conn->svc->summary->bytes_echoed += (uint64_t)n;
    }
    record_close(conn->svc, conn->record);
    close(fd);
    free(conn);
}

/* A connection whose green thread cannot be created ends the process
 * (greenthread_create raises SIGSEGV), so only memory is checked here. */
static void start_connection(EchoService *svc, int fd, unsigned int peer_port) {
    Connection *conn = malloc(sizeof *conn);
    DemoConnection *record = conn ? record_open(svc, fd, peer_port) : NULL;
    if (!record) {
        fprintf(stderr, "qorbu-demo: no room for connection from port %u, closing it\n", peer_port);
        free(conn);
        close(fd);
        return;
    }
    conn->svc = svc;
    conn->record = record;
    greenthread_create(serve_connection, conn);
}

static void accept_connections(void *arg) {
    EchoService *svc = arg;
    while (!svc->stopping) {
        struct sockaddr_in peer;
        socklen_t len = sizeof peer;
        int fd = nb_accept(svc->listen_fd, (struct sockaddr *)&peer, &len);
        if (fd < 0) {
            if (svc->stopping || errno == EINTR || errno == ECONNABORTED || errno == EPROTO) continue;
            perror("qorbu-demo: accept");
            break;
        }
        /* accept() hands out blocking descriptors; the nb_ calls need non-blocking ones. */
        fcntl(fd, F_SETFL, O_NONBLOCK);
        fcntl(fd, F_SETFD, FD_CLOEXEC);
        start_connection(svc, fd, ntohs(peer.sin_port));
    }
    close(svc->listen_fd);
    svc->listen_fd = -1;
}

int echo_start(EchoService *svc, ShmHandle *segment, DemoSummary *summary, unsigned int port) {
    *svc = (EchoService){.segment = segment, .summary = summary, .listen_fd = -1};
    svc->address = (struct sockaddr_in){
        .sin_family = AF_INET, .sin_port = htons((uint16_t)port), .sin_addr.s_addr = htonl(INADDR_LOOPBACK)};
    socklen_t len = sizeof svc->address;
    int on = 1, fd = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0 || setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on) != 0 ||
        bind(fd, (struct sockaddr *)&svc->address, len) != 0 || listen(fd, kListenBacklog) != 0 ||
        getsockname(fd, (struct sockaddr *)&svc->address, &len) != 0) {
        fprintf(stderr, "qorbu-demo: cannot listen on 127.0.0.1:%u: %s\n", port, strerror(errno));
        if (fd >= 0) close(fd);
        return -1;
    }
    svc->listen_fd = fd;
    greenthread_create(accept_connections, svc);
    return 0;
}

void echo_stop(EchoService *svc) {
    if (svc->stopping) return;
    svc->stopping = 1;
    /* A shut-down socket turns readable (and writable): every green thread
     * waiting on one wakes up, sees end of file or an error, and finishes. */
    if (svc->listen_fd >= 0) shutdown(svc->listen_fd, SHUT_RDWR);
    for (uintptr_t at = svc->summary->records; at; at = ((DemoConnection *)at)->next)
        shutdown(((DemoConnection *)at)->fd, SHUT_RDWR);
}

void echo_wait_idle(EchoService *svc) {
    while (svc->summary->open_connections > 0) {
        svc->idle_waiter = current_greenthread();
        greenthread_block();
    }
}
