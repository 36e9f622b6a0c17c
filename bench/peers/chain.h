// The chain of pipes of the dispatch comparison and the loop interface that
// every library implements. libevent and libev live in separate files: their
// headers clash.
#pragma once

#include <fcntl.h>
#include <sys/select.h>
#include <unistd.h>

#include "harness.h"

namespace dispatch {

// Write ends are moved up here so that the read ends, which the select
// backends watch, stay below FD_SETSIZE.
constexpr int kHighFd = 1100;

struct Chain;
struct Node {
    Chain *chain;
    int index;
};

struct Chain {
    int n, active;
    long target = 0, count = 0, writes_left = 0;
    std::vector<int> rfd, wfd;
    std::vector<Node> nodes;

    Chain(int pipes, int tokens) : n(pipes), active(tokens) {
        for (int i = 0; i < n; ++i) {
            int p[2];
            if (pipe2(p, O_NONBLOCK) != 0) {
                perror("pipe2");
                exit(1);
            }
            int w = fcntl(p[1], F_DUPFD_CLOEXEC, kHighFd);
            if (w < 0) {
                perror("F_DUPFD");
                exit(1);
            }
            close(p[1]);
            rfd.push_back(p[0]);
            wfd.push_back(w);
            if (p[0] >= FD_SETSIZE) {
                fprintf(stderr, "read end %d above FD_SETSIZE\n", p[0]);
                exit(1);
            }
        }
        for (int i = 0; i < n; ++i) nodes.push_back({this, i});
    }
    ~Chain() {
        for (int i = 0; i < n; ++i) {
            close(rfd[size_t(i)]);
            close(wfd[size_t(i)]);
        }
    }
    // Arms one run of `events` callbacks: A bytes spread over the chain.
    void start(long events) {
        target = events;
        count = 0;
        writes_left = events - active;
        char b = 'x';
        for (int j = 0; j < active; ++j)
            if (write(wfd[size_t(j * n / active)], &b, 1) != 1) abort();
    }
    void on_readable(int i) {
        char b;
        if (read(rfd[size_t(i)], &b, 1) != 1) return;
        ++count;
        if (writes_left > 0) {
            --writes_left;
            int next = i + 1 == n ? 0 : i + 1;
            if (write(wfd[size_t(next)], &b, 1) != 1) abort();
        }
    }
};

// A contender owns its chain and loop for one sample: set up, time run(),
// tear down.
struct Loop {
    virtual ~Loop() = default;
    virtual void pass() = 0;
};

Loop *make_libevent_loop(Chain &c, const char *method);
Loop *make_libev_loop(Chain &c, bool epoll);

} // namespace dispatch
