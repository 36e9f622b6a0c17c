/* Set-up shared by the dispatch-loop tests: a selector context, the scripted
 * host, descriptors placed at chosen numbers and a callback that logs. */
#ifndef QORBU_TESTS_DISPATCH_FIXTURE_H
#define QORBU_TESTS_DISPATCH_FIXTURE_H

#include <fcntl.h>
#include <gtest/gtest.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "scripted_host.h"
#include "selector/sel_private.h"

namespace dispatch_test {

/* qemu-i386 (7.2) aborts the process when another thread signals a thread
 * blocked in epoll_wait; the i386 guests skip that one case. */
#if defined(QORBU_TESTS_EMULATED) && defined(__i386__)
inline constexpr bool kNoCrossThreadSignals = true;
#else
inline constexpr bool kNoCrossThreadSignals = false;
#endif

inline const char *event_name(unsigned event) {
    switch (event) {
    case SEL_READ: return "r";
    case SEL_WRITE: return "w";
    case SEL_EXCEPT: return "x";
    default: return "?";
    }
}

/* Logs "cb:<fd>:<r|w|x>" to the scripted host's log. */
inline int log_callback(int fd, unsigned event, void *, SelFdEntry *) {
    scripted::log("cb:" + std::to_string(fd) + ":" + event_name(event));
    return 0;
}

inline int log_timer(SelTimer *t) {
    scripted::log(std::string("timer:") + static_cast<const char *>(t->arg));
    return 0;
}

inline double seconds_since(const struct timespec &start) {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec - start.tv_sec) + (now.tv_nsec - start.tv_nsec) / 1e9;
}

inline struct timespec monotonic_now() {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now;
}

/* A pipe whose read end sits at a chosen descriptor number (when given). */
class Pipe {
public:
    explicit Pipe(int readAt = -1) {
        int fds[2];
        EXPECT_EQ(pipe(fds), 0);
        r = fds[0];
        w = fds[1];
        if (readAt >= 0 && readAt != r) {
            EXPECT_EQ(dup2(r, readAt), readAt);
            close(r);
            r = readAt;
        }
    }
    ~Pipe() {
        if (r >= 0) close(r);
        if (w >= 0) close(w);
    }
    Pipe(const Pipe &) = delete;
    Pipe &operator=(const Pipe &) = delete;
    void fill() { EXPECT_EQ(write(w, "x", 1), 1); }
    void drain() {
        char buf[64];
        EXPECT_GT(read(r, buf, sizeof buf), 0);
    }
    void close_writer() {
        close(w);
        w = -1;
    }
    int r = -1, w = -1;
};

class DispatchTest : public ::testing::Test {
protected:
    void SetUp() override {
        scripted::reset();
        ASSERT_EQ(SelInit(), 0);
        ctx = SelCurrentContext();
        ASSERT_NE(ctx, nullptr);
    }
    void TearDown() override { SelSetZG(nullptr); }

    /* Host hooks on, with the scripted host's context. */
    void use_host() { SelSetZG(&scripted::host().context); }
    const std::vector<std::string> &log() { return scripted::host().log; }
    void clear_log() { scripted::host().log.clear(); }
    std::vector<std::string> callbacks_logged() {
        std::vector<std::string> out;
        for (const auto &e : log())
            if (e.rfind("cb:", 0) == 0) out.push_back(e);
        return out;
    }
    /* The pass would wait for the reaper's timer otherwise; a short timer
     * bounds every wait that a fault could make unexpectedly long. */
    void arm_guard_timer(unsigned ms) {
        SelRemTimer(&guard);
        guard.callback = log_timer;
        guard.arg = const_cast<char *>("guard");
        ASSERT_EQ(SelSleep(&guard, ms), 0);
    }

    SelContext *ctx = nullptr;
    SelTimer guard{};
};

} // namespace dispatch_test

#endif
