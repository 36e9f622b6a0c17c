/* qorbu-demo: a small host daemon on libqorbu. One OS thread runs the
 * selector with the host's own task scheduler handed over (SelSetZG), a
 * Net-SNMP master agent serviced by the select loop, a TCP echo service in
 * green threads with per-connection records in a shared segment, and a
 * periodic status line. SIGINT and SIGTERM stop it cleanly. */
#define _GNU_SOURCE
#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <getopt.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <unistd.h>

#include "demo.h"

enum { kExitOk, kExitFailure, kExitUsage };
enum { kStopGraceMs = 5000 }; /* connections get this long to close after a stop */

static const char kUsage[] =
    "usage: qorbu-demo [--port N] [--snmp-port N] [--segment NAME] [--segment-size BYTES]\n"
    "                  [--segment-address A] [--status-interval MS]\n"
    "       qorbu-demo --self-test [--clients N] [--rounds N] [options above]\n"
    "       qorbu-demo --inspect NAME\n"
    "A host daemon on libqorbu: TCP echo on 127.0.0.1 in green threads, an SNMP agent, per-connection\n"
    "records in a shared segment. SIGINT or SIGTERM stops it. Exit status: 0 success, 1 failure (at\n"
    "start-up or a failed self-test check), 2 bad command line. Details: docs/demo.md.\n";

static volatile sig_atomic_t signal_write_fd = -1;

double demo_seconds_since(const struct timespec *since) {
    struct timespec now;
    SelGetTime(&now);
    return (double)(now.tv_sec - since->tv_sec) + (double)(now.tv_nsec - since->tv_nsec) / 1e9;
}

/* ---- options -------------------------------------------------------------- */

/* The numeric options come first: getopt_long returns their index, which
 * indexes kNumeric and the fields in parse_options too. */
enum { kNumericCount = 7 };

static const struct option kOptions[] = {
    {"port", required_argument, NULL, 0},
    {"snmp-port", required_argument, NULL, 1},
    {"segment-size", required_argument, NULL, 2},
    {"segment-address", required_argument, NULL, 3},
    {"status-interval", required_argument, NULL, 4},
    {"clients", required_argument, NULL, 5},
    {"rounds", required_argument, NULL, 6},
    {"segment", required_argument, NULL, 'g'},
    {"self-test", no_argument, NULL, 's'},
    {"inspect", required_argument, NULL, 'i'},
    {"help", no_argument, NULL, 'h'},
    {NULL, 0, NULL, 0},
};

/* Default, self-test default, least and greatest value of each numeric option. */
static const struct {
    unsigned long standard, self_test, min, max;
} kNumeric[kNumericCount] = {
    {7007, 0, 0, 65535},                                             /* port */
    {1161, 0, 0, 65535},                                             /* snmp-port */
    {DEMO_SEGMENT_SIZE, DEMO_SEGMENT_SIZE, 4096, 0x40000000ul},      /* segment-size */
    {DEMO_SEGMENT_ADDRESS, DEMO_SEGMENT_ADDRESS, 4096, UINTPTR_MAX}, /* segment-address */
    {5000, 500, 10, 3600000},                                        /* status-interval */
    {8, 8, 1, 500},                                                  /* clients */
    {64, 64, 1, 100000},                                             /* rounds */
};

/* 0: run; 1: done (help printed); -1: bad command line. */
static int parse_options(int argc, char **argv, DemoOptions *options) {
    static char self_test_name[64];
    unsigned long *const field[kNumericCount] = {&options->port,
                                                 &options->snmp_port,
                                                 &options->segment_size,
                                                 &options->segment_address,
                                                 &options->status_interval_ms,
                                                 &options->clients,
                                                 &options->rounds};
    int given[kNumericCount] = {0}, option;
    opterr = 0;
    while ((option = getopt_long(argc, argv, "h", kOptions, NULL)) != -1) {
        char *end;
        switch (option) {
        case 's': options->self_test = 1; break;
        case 'g': options->segment_name = optarg; break;
        case 'i': options->inspect = optarg; break;
        case 'h': fputs(kUsage, stdout); return 1;
        case '?':
            fprintf(stderr, "qorbu-demo: unknown option or missing value: %s (try --help)\n",
                    argv[optind - 1]);
            return -1;
        default:
            errno = 0;
            *field[option] = strtoul(optarg, &end, 0);
            if (errno != 0 || end == optarg || *end != '\0' || optarg[0] == '-' ||
                *field[option] < kNumeric[option].min || *field[option] > kNumeric[option].max) {
                fprintf(stderr, "qorbu-demo: --%s wants a number from %lu to %lu, not '%s'\n",
                        kOptions[option].name, kNumeric[option].min, kNumeric[option].max, optarg);
                return -1;
            }
            given[option] = 1;
        }
    }
    if (optind < argc) {
        fprintf(stderr, "qorbu-demo: unexpected argument '%s' (try --help)\n", argv[optind]);
        return -1;
    }
    for (int k = 0; k < kNumericCount; ++k)
        if (!given[k]) *field[k] = options->self_test ? kNumeric[k].self_test : kNumeric[k].standard;
    if (options->segment_address % 4096 != 0) {
        fprintf(stderr, "qorbu-demo: --segment-address must be a multiple of 4096\n");
        return -1;
    }
    if (!options->segment_name && options->self_test) {
        snprintf(self_test_name, sizeof self_test_name, "qorbu-demo-selftest-%d", (int)getpid());
        options->segment_name = self_test_name;
    } else if (!options->segment_name) {
        options->segment_name = "qorbu-demo";
    }
    return 0;
}

/* ---- the segment ---------------------------------------------------------- */

static int create_segment(Demo *demo) {
    const DemoOptions *options = &demo->options;
    char object[256];
    snprintf(object, sizeof object, "/%s", options->segment_name);
    int fd = shm_open(object, O_RDONLY, 0);
    if (fd >= 0) {
        close(fd);
        fprintf(stderr,
                "qorbu-demo: segment %s already exists (another qorbu-demo? remove it with "
                "'qorbu-shm unlink %s')\n",
                options->segment_name, options->segment_name);
        return -1;
    }
    demo->segment = ShmCreate(options->segment_name, (void *)options->segment_address, options->segment_size);
    if (!demo->segment && errno == EEXIST) { /* the library never maps over memory in use */
        ShmUnlink(options->segment_name);    /* the object it made stays unsized: remove it */
        fprintf(stderr, "qorbu-demo: the address range at %#lx is in use; choose --segment-address\n",
                options->segment_address - (unsigned long)ShmOverhead());
        return -1;
    }
    if (!demo->segment) {
        fprintf(stderr, "qorbu-demo: cannot create segment %s: %s\n", options->segment_name, strerror(errno));
        return -1;
    }
    demo->summary = ShmMetadata(demo->segment, sizeof *demo->summary);
    *demo->summary = (DemoSummary){.magic = DEMO_SUMMARY_MAGIC, .pid = (int32_t)getpid()};
    demo->free_at_start = ShmTotalFree(demo->segment);
    return 0;
}

/* ---- status line ---------------------------------------------------------- */

static void log_status(Demo *demo) {
    fprintf(stderr,
            "qorbu-demo: status: %u connections open, %u accepted, %llu bytes echoed, %u of %u segment "
            "bytes free, up %.1f s\n",
            demo->summary->open_connections, demo->summary->accepted_total,
            (unsigned long long)demo->summary->bytes_echoed, ShmTotalFree(demo->segment), demo->free_at_start,
            demo_seconds_since(&demo->started));
}

static int on_status_timer(SelTimer *timer) {
    Demo *demo = timer->arg;
    log_status(demo);
    if (!demo->stopping) SelSleep(timer, demo->options.status_interval_ms);
    return 0;
}

/* ---- stopping ------------------------------------------------------------- */

static void on_stop_grace_expired(void *arg) {
    (void)arg;
    fprintf(stderr, "qorbu-demo: connections did not close within %d ms, exiting\n", kStopGraceMs);
    _exit(kExitFailure);
}

static void stop_now(void *arg) {
    Demo *demo = arg;
    if (demo->stopping) return;
    demo->stopping = 1;
    SelRemTimer(&demo->status_timer);
    echo_stop(&demo->echo);
    if (demo->test) selftest_stop(demo->test);
    host_after(&demo->host, HOST_LIST_URGENT, kStopGraceMs, on_stop_grace_expired, demo);
}

void demo_request_stop(Demo *demo, const char *reason) {
    if (!demo->stopping) fprintf(stderr, "qorbu-demo: stopping: %s\n", reason);
    host_post(&demo->host, stop_now, demo);
}

/* The handlers only note the signal in a pipe that the host scheduler
 * watches; the stop itself runs as a host task on the loop. */
static void on_signal(int signo) {
    const int saved = errno;
    const unsigned char byte = (unsigned char)signo;
    if (write(signal_write_fd, &byte, 1) < 0) {
        /* the pipe is full: a stop is already pending */
    }
    errno = saved;
}

static void on_signal_pipe(void *arg) {
    Demo *demo = arg;
    unsigned char bytes[16];
    ssize_t n = read(demo->signal_pipe[0], bytes, sizeof bytes);
    if (n > 0) demo_request_stop(demo, bytes[n - 1] == SIGINT ? "SIGINT" : "SIGTERM");
}

static int install_signals(Demo *demo) {
    if (pipe2(demo->signal_pipe, O_CLOEXEC | O_NONBLOCK) != 0) return -1;
    signal_write_fd = demo->signal_pipe[1];
    if (host_watch_fd(&demo->host, demo->signal_pipe[0], on_signal_pipe, demo) != 0) return -1;
    /* No SA_RESTART: the select loop's wait returns with EINTR. The signals
     * stay blocked except during that wait (SelAddSignal). */
    struct sigaction action = {.sa_handler = on_signal};
    sigemptyset(&action.sa_mask);
    if (SelAddSignal(SIGINT) != 0 || SelAddSignal(SIGTERM) != 0 || sigaction(SIGINT, &action, NULL) != 0 ||
        sigaction(SIGTERM, &action, NULL) != 0)
        return -1;
    signal(SIGPIPE, SIG_IGN);
    return 0;
}

/* ---- the daemon ----------------------------------------------------------- */

static int start(Demo *demo) {
    if (SelInit() != 0) {
        perror("qorbu-demo: SelInit");
        return -1;
    }
    host_init(&demo->host);
    SelSetZG(&demo->host);
    if (install_signals(demo) != 0) {
        perror("qorbu-demo: signals");
        return -1;
    }
    demo->snmp_port = (unsigned int)demo->options.snmp_port;
    if (create_segment(demo) != 0 || agent_start(demo->segment, demo->summary, &demo->snmp_port) != 0)
        return -1;
    /* After SelAddSignal: every green thread starts with the registered
     * signals blocked, like the main context. */
    greenthreads_init();
    if (echo_start(&demo->echo, demo->segment, demo->summary, demo->options.port) != 0) return -1;
    demo->status_timer = (SelTimer){.callback = on_status_timer, .arg = demo};
    SelSleep(&demo->status_timer, demo->options.status_interval_ms);
    fprintf(stderr,
            "qorbu-demo: pid %d, echo on 127.0.0.1:%u, SNMP on udp:127.0.0.1:%u, segment %s "
            "(%u bytes free)\n",
            (int)getpid(), (unsigned int)ntohs(demo->echo.address.sin_port), demo->snmp_port,
            demo->options.segment_name, demo->free_at_start);
    if (demo->options.self_test && !(demo->test = selftest_start(demo))) return -1;
    return 0;
}

static void finish(Demo *demo) {
    SelRemTimer(&demo->status_timer);
    agent_stop();
    if (demo->segment) {
        log_status(demo);
        ShmClose(demo->segment);
        ShmUnlink(demo->options.segment_name);
    }
    host_destroy(&demo->host);
    SelSetZG(NULL);
}

static int run_daemon(Demo *demo) {
    SelGetTime(&demo->started);
    if (start(demo) != 0) {
        finish(demo);
        return kExitFailure;
    }
    /* Runs until the last green thread (the acceptor, the connections and
     * the self-test's threads) has finished. */
    greenthreads_run();
    const int status = demo->test && !selftest_passed(demo->test) ? kExitFailure : kExitOk;
    selftest_free(demo->test);
    finish(demo);
    fprintf(stderr, "qorbu-demo: stopped\n");
    return status;
}

int main(int argc, char **argv) {
    static Demo demo;
    const int parsed = parse_options(argc, argv, &demo.options);
    if (parsed != 0) return parsed > 0 ? kExitOk : kExitUsage;
    if (demo.options.inspect) return inspect_segment(demo.options.inspect);
    return run_daemon(&demo);
}
