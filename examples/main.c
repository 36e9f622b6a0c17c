/* qorbu-demo: a small host daemon on libqorbu. One OS thread runs the
 * selector with the host's own task scheduler handed over (SelSetZG), a
 * Net-SNMP master agent serviced by the select loop, a TCP echo service in
 * green threads with per-connection records in a shared segment, and a
 * periodic status line. SIGINT and SIGTERM stop it cleanly. */
#define _GNU_SOURCE
#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <ftw.h>
#include <getopt.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <unistd.h>

#include "demo.h"

enum {
    kExitOk = 0,
    kExitFailure = 1,
    kExitUsage = 2,
    kDefaultPort = 7007,
    kDefaultSnmpPort = 1161,
    kDefaultStatusMs = 5000,
    kSelfTestStatusMs = 500,
    kDefaultClients = 8,
    kDefaultRounds = 64,
    kMaxClients = 500,
    kStopGraceMs = 5000,
};

static const char kUsage[] =
    "usage: qorbu-demo [options]\n"
    "       qorbu-demo --self-test [--clients N] [--rounds N] [options]\n"
    "\n"
    "A host daemon on libqorbu: TCP echo on 127.0.0.1 in green threads, an SNMP\n"
    "agent on udp:127.0.0.1, per-connection records in a shared segment, a status\n"
    "line on standard error. SIGINT or SIGTERM stops it (exit status 0).\n"
    "\n"
    "  --port N              echo port (default 7007; self-test: any free port)\n"
    "  --snmp-port N         SNMP agent port (default 1161; self-test: any free port)\n"
    "  --segment NAME        shared segment name (default qorbu-demo;\n"
    "                        self-test: qorbu-demo-selftest-PID)\n"
    "  --segment-size BYTES  data bytes of the segment (default 1048576)\n"
    "  --segment-address A   data area address, a multiple of 4096 (hex with 0x)\n"
    "  --status-interval MS  period of the status line (default 5000; self-test 500)\n"
    "  --self-test           run clients, snmpget and a second process, print a\n"
    "                        summary and exit 0 only when every check held\n"
    "  --clients N           self-test client green threads (default 8, at most 500)\n"
    "  --rounds N            echo round trips per client (default 64)\n"
    "  --help                this text\n"
    "\n"
    "Exit status: 0 success, 1 failure (start-up or a failed self-test check),\n"
    "2 bad command line.\n";

static volatile sig_atomic_t signalWritePipe = -1;

double demo_seconds_since(const struct timespec *since) {
    struct timespec now;
    SelGetTime(&now);
    return (double)(now.tv_sec - since->tv_sec) + (double)(now.tv_nsec - since->tv_nsec) / 1e9;
}

/* ---- options -------------------------------------------------------------- */

/* The numeric options come first: their ids index kNumeric. */
enum OptionId {
    OPT_PORT = 1000, OPT_SNMP_PORT, OPT_SEGMENT_SIZE, OPT_SEGMENT_ADDRESS, OPT_STATUS, OPT_CLIENTS, OPT_ROUNDS,
    OPT_SEGMENT, OPT_SELF_TEST, OPT_INSPECT, OPT_HELP
};

static const struct option kOptions[] = {
    {"port", required_argument, NULL, OPT_PORT},
    {"snmp-port", required_argument, NULL, OPT_SNMP_PORT},
    {"segment-size", required_argument, NULL, OPT_SEGMENT_SIZE},
    {"segment-address", required_argument, NULL, OPT_SEGMENT_ADDRESS},
    {"status-interval", required_argument, NULL, OPT_STATUS},
    {"clients", required_argument, NULL, OPT_CLIENTS},
    {"rounds", required_argument, NULL, OPT_ROUNDS},
    {"segment", required_argument, NULL, OPT_SEGMENT},
    {"self-test", no_argument, NULL, OPT_SELF_TEST},
    {"inspect", required_argument, NULL, OPT_INSPECT},
    {"help", no_argument, NULL, OPT_HELP},
    {NULL, 0, NULL, 0},
};

/* Default, self-test default, least and greatest value of each numeric option. */
static const struct {
    unsigned long long standard, selfTest, min, max;
} kNumeric[OPT_SEGMENT - OPT_PORT] = {
    {kDefaultPort, 0, 0, 65535},
    {kDefaultSnmpPort, 0, 0, 65535},
    {DEMO_SEGMENT_SIZE, DEMO_SEGMENT_SIZE, 4096, 0x40000000u},
    {DEMO_SEGMENT_ADDRESS, DEMO_SEGMENT_ADDRESS, 4096, UINTPTR_MAX},
    {kDefaultStatusMs, kSelfTestStatusMs, 10, 3600000},
    {kDefaultClients, kDefaultClients, 1, kMaxClients},
    {kDefaultRounds, kDefaultRounds, 1, 100000},
};

/* 0: run; 1: done (help printed); -1: bad command line. */
static int parse_options(int argc, char **argv, DemoOptions *options, char *nameBuffer, size_t nameSize) {
    enum { kCount = OPT_SEGMENT - OPT_PORT };
    unsigned long long value[kCount];
    int given[kCount] = {0}, option;
    *options = (DemoOptions){.segmentName = NULL};
    opterr = 0;
    while ((option = getopt_long(argc, argv, "h", kOptions, NULL)) != -1) {
        const int k = option - OPT_PORT;
        char *end;
        switch (option) {
        case OPT_SELF_TEST: options->selfTest = 1; break;
        case OPT_SEGMENT: options->segmentName = optarg; break;
        case OPT_INSPECT: options->inspect = optarg; break;
        case OPT_HELP:
        case 'h': fputs(kUsage, stdout); return 1;
        case '?':
            fprintf(stderr, "qorbu-demo: unknown option or missing value: %s (try --help)\n", argv[optind - 1]);
            return -1;
        default:
            errno = 0;
            value[k] = strtoull(optarg, &end, 0);
            if (errno != 0 || end == optarg || *end != '\0' || optarg[0] == '-' || value[k] < kNumeric[k].min ||
                value[k] > kNumeric[k].max) {
                fprintf(stderr, "qorbu-demo: --%s wants a number from %llu to %llu, not '%s'\n", kOptions[k].name,
                        kNumeric[k].min, kNumeric[k].max, optarg);
                return -1;
            }
            given[k] = 1;
        }
    }
    if (optind < argc) {
        fprintf(stderr, "qorbu-demo: unexpected argument '%s' (try --help)\n", argv[optind]);
        return -1;
    }
    for (int k = 0; k < kCount; ++k)
        if (!given[k])
            value[k] = options->selfTest ? kNumeric[k].selfTest : kNumeric[k].standard;
    options->port = (unsigned int)value[OPT_PORT - OPT_PORT];
    options->snmpPort = (unsigned int)value[OPT_SNMP_PORT - OPT_PORT];
    options->segmentSize = (uint32_t)value[OPT_SEGMENT_SIZE - OPT_PORT];
    options->segmentAddress = (uintptr_t)value[OPT_SEGMENT_ADDRESS - OPT_PORT];
    options->statusIntervalMs = (unsigned int)value[OPT_STATUS - OPT_PORT];
    options->clients = (unsigned int)value[OPT_CLIENTS - OPT_PORT];
    options->rounds = (unsigned int)value[OPT_ROUNDS - OPT_PORT];
    if (options->segmentAddress % 4096 != 0) {
        fprintf(stderr, "qorbu-demo: --segment-address must be a multiple of 4096\n");
        return -1;
    }
    if (!options->segmentName && options->selfTest) {
        snprintf(nameBuffer, nameSize, "qorbu-demo-selftest-%d", (int)getpid());
        options->segmentName = nameBuffer;
    } else if (!options->segmentName) {
        options->segmentName = "qorbu-demo";
    }
    return 0;
}

/* ---- the segment ---------------------------------------------------------- */

static int create_segment(Demo *demo) {
    const DemoOptions *options = &demo->options;
    char object[256];
    snprintf(object, sizeof object, "/%s", options->segmentName);
    int fd = shm_open(object, O_RDONLY, 0);
    if (fd >= 0) {
        close(fd);
        fprintf(stderr, "qorbu-demo: segment %s already exists (another qorbu-demo? remove it with "
                        "'qorbu-shm unlink %s')\n", options->segmentName, options->segmentName);
        return -1;
    }
    demo->segment = ShmCreate(options->segmentName, (void *)options->segmentAddress, options->segmentSize);
    if (!demo->segment && errno == EEXIST) { /* the library never maps over memory in use */
        ShmUnlink(options->segmentName);        /* the object it made stays unsized: remove it */
        fprintf(stderr, "qorbu-demo: the address range at %#lx is in use; choose --segment-address\n",
                (unsigned long)(options->segmentAddress - (uintptr_t)ShmOverhead()));
        return -1;
    }
    if (!demo->segment) {
        fprintf(stderr, "qorbu-demo: cannot create segment %s: %s\n", options->segmentName, strerror(errno));
        return -1;
    }
    demo->summary = ShmMetadata(demo->segment, sizeof *demo->summary);
    memset(demo->summary, 0, sizeof *demo->summary);
    demo->summary->magic = DEMO_SUMMARY_MAGIC;
    demo->summary->pid = (int32_t)getpid();
    demo->freeAtStart = ShmTotalFree(demo->segment);
    return 0;
}

static void remove_segment(Demo *demo) {
    if (!demo->segment)
        return;
    ShmClose(demo->segment);
    demo->segment = NULL;
    demo->summary = NULL;
    ShmUnlink(demo->options.segmentName);
}

/* ---- the SNMP agent -------------------------------------------------------- */

static int remove_entry(const char *path, const struct stat *st, int flag, struct FTW *ftw) {
    (void)st, (void)flag, (void)ftw;
    remove(path);
    return 0;
}

static int start_agent(Demo *demo) {
    strcpy(demo->stateDir, "/tmp/qorbu-demo-snmp-XXXXXX");
    if (!mkdtemp(demo->stateDir)) {
        perror("qorbu-demo: mkdtemp");
        demo->stateDir[0] = '\0';
        return -1;
    }
    /* snmpget, run by the self-test, reads its configuration from here. */
    setenv("SNMPCONFPATH", demo->stateDir, 1);
    setenv("SNMP_PERSISTENT_DIR", demo->stateDir, 1);
    demo->snmpPort = demo->options.snmpPort ? demo->options.snmpPort : agent_pick_free_port();
    return agent_start(demo->segment, demo->summary, demo->snmpPort, demo->stateDir);
}

static void stop_agent(Demo *demo) {
    agent_stop();
    if (demo->stateDir[0])
        nftw(demo->stateDir, remove_entry, 8, FTW_DEPTH | FTW_PHYS);
}

/* ---- status line ---------------------------------------------------------- */

static void log_status(Demo *demo) {
    ++demo->statusLines;
    fprintf(stderr,
            "qorbu-demo: status: %u connections open, %u accepted, %llu bytes echoed, %u of %u segment "
            "bytes free, up %.1f s\n",
            demo->summary->openConnections, demo->summary->acceptedTotal,
            (unsigned long long)demo->summary->bytesEchoed, ShmTotalFree(demo->segment), demo->freeAtStart,
            demo_seconds_since(&demo->started));
}

static int on_status_timer(SelTimer *timer) {
    Demo *demo = timer->arg;
    log_status(demo);
    if (!demo->stopping)
        SelSleep(timer, demo->options.statusIntervalMs);
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
    if (demo->stopping)
        return;
    demo->stopping = 1;
    SelRemTimer(&demo->statusTimer);
    echo_stop(&demo->echo);
    if (demo->selfTest)
        selftest_stop(demo->selfTest);
    host_after(&demo->host, HOST_LIST_URGENT, kStopGraceMs, on_stop_grace_expired, demo);
}

void demo_request_stop(Demo *demo, const char *reason) {
    if (!demo->stopping)
        fprintf(stderr, "qorbu-demo: stopping: %s\n", reason);
    host_post(&demo->host, stop_now, demo);
}

/* The handlers only note the signal in a pipe that the host scheduler
 * watches; the stop itself runs as a host task on the loop. */
static void on_signal(int signo) {
    int saved = errno;
    unsigned char byte = (unsigned char)signo;
    if (signalWritePipe >= 0 && write(signalWritePipe, &byte, 1) < 0) {
        /* the pipe is full: a stop is already pending */
    }
    errno = saved;
}

static void on_signal_pipe(void *arg) {
    Demo *demo = arg;
    unsigned char bytes[16];
    ssize_t n = read(demo->signalPipe[0], bytes, sizeof bytes);
    if (n > 0)
        demo_request_stop(demo, bytes[n - 1] == SIGINT ? "SIGINT" : "SIGTERM");
}

static int install_signals(Demo *demo) {
    if (pipe2(demo->signalPipe, O_CLOEXEC | O_NONBLOCK) != 0)
        return -1;
    signalWritePipe = demo->signalPipe[1];
    if (host_watch_fd(&demo->host, demo->signalPipe[0], on_signal_pipe, demo) != 0)
        return -1;
    struct sigaction action;
    memset(&action, 0, sizeof action);
    action.sa_handler = on_signal;
    sigemptyset(&action.sa_mask);
    /* No SA_RESTART: the select loop's wait returns with EINTR. The signals
     * stay blocked except during that wait (SelAddSignal). */
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
    if (create_segment(demo) != 0 || start_agent(demo) != 0)
        return -1;
    /* After SelAddSignal: every green thread starts with the registered
     * signals blocked, like the main context. */
    greenthreads_init();
    if (echo_start(&demo->echo, demo->segment, demo->summary, demo->options.port) != 0)
        return -1;
    demo->statusTimer.arg = demo;
    demo->statusTimer.callback = on_status_timer;
    SelSleep(&demo->statusTimer, demo->options.statusIntervalMs);
    fprintf(stderr, "qorbu-demo: pid %d, echo on 127.0.0.1:%u, SNMP on udp:127.0.0.1:%u, segment %s (%u bytes free)\n",
            (int)getpid(), (unsigned int)ntohs(demo->echo.address.sin_port), demo->snmpPort,
            demo->options.segmentName, demo->freeAtStart);
    if (demo->options.selfTest && !(demo->selfTest = selftest_start(demo)))
        return -1;
    return 0;
}

static void finish(Demo *demo) {
    SelRemTimer(&demo->statusTimer);
    if (demo->summary)
        log_status(demo);
    stop_agent(demo);
    remove_segment(demo);
    host_destroy(&demo->host);
    SelSetZG(NULL);
    signalWritePipe = -1;
}

static int run_daemon(Demo *demo) {
    SelGetTime(&demo->started);
    demo->signalPipe[0] = demo->signalPipe[1] = -1;
    if (start(demo) != 0) {
        finish(demo);
        return kExitFailure;
    }
    /* Runs until the last green thread (the acceptor, the connections and
     * the self-test's threads) has finished. */
    greenthreads_run();
    int status = kExitOk;
    if (demo->selfTest && !selftest_passed(demo->selfTest))
        status = kExitFailure;
    selftest_free(demo->selfTest);
    demo->selfTest = NULL;
    finish(demo);
    fprintf(stderr, "qorbu-demo: stopped\n");
    return status;
}

int main(int argc, char **argv) {
    static Demo demo;
    char selfTestName[64];
    int parsed = parse_options(argc, argv, &demo.options, selfTestName, sizeof selfTestName);
    if (parsed != 0)
        return parsed > 0 ? kExitOk : kExitUsage;
    if (demo.options.inspect)
        return inspect_segment(demo.options.inspect);
    return run_daemon(&demo);
}
