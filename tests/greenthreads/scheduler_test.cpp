// The run queue, yield/block/wakeup, record reuse and the run loop. Every
// test case runs in a fresh process, so each starts with a fresh scheduler.
#include <sys/timerfd.h>

#include <chrono>
#include <thread>

#include "gt_test_support.h"

using namespace qorbu::gt;

namespace {

std::string trace;

int queue_length() {
    int n = 0;
    for (Greenthread *t = run_queue_head; t != nullptr; t = t->next) ++n;
    return n;
}

struct Yielder {
    char name;
    int turns;
};

void yield_in_loop(void *arg) {
    auto *self = static_cast<Yielder *>(arg);
    for (int i = 0; i < self->turns; ++i) {
        trace += self->name;
        greenthread_yield();
    }
}

void do_nothing(void *) {}

class Scheduler : public qorbu::test::GreenIo {
  protected:
    void SetUp() override {
        trace.clear();
        GreenIo::SetUp();
    }
};

TEST_F(Scheduler, QueueIsFifoAndTheMainContextTakesOneTurnPerPass) {
    Yielder a{'A', 3}, b{'B', 3};
    greenthread_create(yield_in_loop, &a);
    greenthread_create(yield_in_loop, &b);
    while (live_threads != 0) {
        trace += 'M';
        greenthread_yield();
    }
    EXPECT_EQ(trace, "MABMABMABM");

    trace.clear(); // threads that create threads
    greenthread_create(
        [](void *) {
            trace += '1';
            greenthread_create([](void *) { trace += '3'; }, nullptr);
            greenthread_yield();
            trace += '4';
        },
        nullptr);
    greenthread_create([](void *) { trace += '2'; }, nullptr);
    greenthreads_run();
    EXPECT_EQ(trace, "1234");
}

TEST_F(Scheduler, FinishedRecordsAreReusedNewestFirstWithTheirStacks) {
    static void *stackMark;
    auto markStack = [](void *arg) {
        stackMark = __builtin_frame_address(0);
        *static_cast<int *>(arg) += 1;
    };
    int first = 0, second = 0;
    Greenthread *t1 = greenthread_create(markStack, &first);
    EXPECT_EQ(first, 0) << "a new thread waits for its creator";
    EXPECT_EQ(live_threads, 1);
    EXPECT_EQ(queue_length(), 1);
    greenthreads_run();
    EXPECT_EQ(live_threads, 0);
    EXPECT_EQ(free_threads, t1);
    void *firstMark = stackMark;

    EXPECT_EQ(greenthread_create(markStack, &second), t1);
    EXPECT_EQ(free_threads, nullptr);
    greenthreads_run();
    EXPECT_EQ(first, 1);
    EXPECT_EQ(second, 1);
    EXPECT_EQ(stackMark, firstMark) << "a reused record restarts at the top of the same stack";
    char *base = static_cast<char *>(t1->context.uc_stack.ss_sp);
    EXPECT_GT(static_cast<char *>(stackMark), base + page_size);
    EXPECT_LT(static_cast<char *>(stackMark), base + t1->context.uc_stack.ss_size);

    Yielder quick{'A', 1}, slow{'B', 2};
    Greenthread *a = greenthread_create(yield_in_loop, &quick);
    Greenthread *b = greenthread_create(yield_in_loop, &slow);
    greenthreads_run();
    EXPECT_EQ(trace, "ABB");
    EXPECT_EQ(free_threads, b);
    EXPECT_EQ(greenthread_create(do_nothing, nullptr), b);
    EXPECT_EQ(greenthread_create(do_nothing, nullptr), a);
    Greenthread *fresh = greenthread_create(do_nothing, nullptr);
    EXPECT_NE(fresh, a);
    EXPECT_NE(fresh, b);
    EXPECT_EQ(live_threads, 3);
    greenthreads_run();
    EXPECT_EQ(live_threads, 0);
}

TEST_F(Scheduler, WakeupQueuesOnlyABlockedThreadAndOnlyOnce) {
    // Running, queued and main records are left as they are.
    static Greenthread *other;
    static int queuedAfterSelfWake, queuedAfterOtherWakes;
    auto waker = [](void *) {
        greenthread_wakeup(current_greenthread());
        queuedAfterSelfWake = queue_length();
        greenthread_wakeup(main_thread); // the main context is queued here
        greenthread_wakeup(other);       // and so is the other thread
        queuedAfterOtherWakes = queue_length();
    };
    Yielder y{'O', 1};
    greenthread_create(waker, nullptr);
    other = greenthread_create(yield_in_loop, &y);
    greenthread_wakeup(main_thread);
    EXPECT_EQ(queue_length(), 2);
    greenthreads_run();
    EXPECT_EQ(queuedAfterSelfWake, 2); // the other thread and the main context
    EXPECT_EQ(queuedAfterOtherWakes, 2);
    EXPECT_EQ(trace, "O");

    static int wakeups;
    Greenthread *sleeper = greenthread_create(
        [](void *) {
            greenthread_block();
            ++wakeups;
            greenthread_block();
            ++wakeups;
        },
        nullptr);
    greenthread_yield();
    EXPECT_EQ(sleeper->runnable, 0);
    EXPECT_EQ(queue_length(), 0);
    greenthread_wakeup(sleeper);
    greenthread_wakeup(sleeper);
    EXPECT_EQ(queue_length(), 1);
    greenthread_yield();
    EXPECT_EQ(wakeups, 1) << "a second queue entry would have run the thread again";
    EXPECT_EQ(sleeper->runnable, 0);
    greenthread_wakeup(sleeper);
    greenthreads_run();
    EXPECT_EQ(wakeups, 2);

    // A finished record waits on the free list: waking it, from the main
    // context or from a green thread, queues nothing.
    ASSERT_EQ(free_threads, sleeper);
    greenthread_wakeup(sleeper);
    ASSERT_EQ(queue_length(), 0);
    static Greenthread *quick;
    static int queuedAfterWake;
    quick = greenthread_create(do_nothing, nullptr);
    greenthread_create(
        [](void *) {
            greenthread_yield(); // quick finishes meanwhile
            ASSERT_EQ(free_threads, quick);
            greenthread_wakeup(quick);
            queuedAfterWake = queue_length();
        },
        nullptr);
    greenthreads_run();
    EXPECT_EQ(queuedAfterWake, 1) << "only the main context";
    EXPECT_EQ(live_threads, 0);
}

int count_pass(int, unsigned, void *arg, SelFdEntry *) {
    ++*static_cast<int *>(arg);
    return 0;
}

TEST_F(Scheduler, TheMainContextNeverBlocksAndRunWithoutThreadsSkipsTheSelector) {
    greenthread_yield(); // nothing queued: returns at once
    EXPECT_EQ(current_greenthread(), main_thread);
    EXPECT_EQ(run_queue_head, nullptr);
    EXPECT_EQ(run_queue_tail, nullptr);

    Yielder a{'A', 2};
    greenthread_create(yield_in_loop, &a);
    greenthread_block(); // only takes a turn
    EXPECT_EQ(main_thread->runnable, 1);
    EXPECT_EQ(trace, "A");
    greenthread_block(); // nothing else runnable after the thread finishes
    greenthread_block();
    EXPECT_EQ(live_threads, 0);
    EXPECT_EQ(current_greenthread(), main_thread);

    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    ASSERT_EQ(write(fds[1], "x", 1), 1);
    int dispatched = 0;
    ASSERT_EQ(SelAddFD(fds[0], SEL_READ, 0, count_pass, &dispatched), 0);
    greenthreads_run();
    EXPECT_EQ(dispatched, 0);
    SelRemFD(fds[0]);
    close(fds[0]);
    close(fds[1]);
}

struct TimerWake {
    SelTimer timer;
    Greenthread *thread;
};

void block_until_timer(void *arg) {
    auto *wake = static_cast<TimerWake *>(arg);
    wake->timer.callback = [](SelTimer *timer) {
        greenthread_wakeup(static_cast<TimerWake *>(timer->arg)->thread);
        return 0;
    };
    wake->timer.arg = wake;
    SelMakeWhen(&wake->timer.when, 0, 20 * 1000 * 1000);
    SelAddTimer(&wake->timer);
    greenthread_block();
    trace += 'T';
}

/* Every thread blocks: the run loop waits in the selector until the timer
 * (the only one armed) wakes the last one, and returns once that one ends.
 * A descriptor readable after 10 s ends a wait that overlooked the timer. */
TEST_F(Scheduler, AllBlockedFallsBackOnTheSelectorOrEpollUntilTheLastThreadEnds) {
    for (const bool epoll : {false, true}) {
        SCOPED_TRACE(epoll ? "epoll mode" : "select mode");
        if (epoll) {
            ASSERT_EQ(SelUseEpoll(), 0);
            ASSERT_NE(GetEpollFd(), 0);
        }
        SelRemoveAllTimers(); // the reaper's, when this thread owns it
        const int guard = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC);
        const itimerspec tenSeconds{{0, 0}, {10, 0}};
        ASSERT_EQ(timerfd_settime(guard, 0, &tenSeconds, nullptr), 0);
        int guardEvents = 0;
        ASSERT_EQ(SelAddFD(guard, SEL_READ, 0, count_pass, &guardEvents), 0);
        trace.clear();
        TimerWake wake{};
        wake.thread = greenthread_create(block_until_timer, &wake);
        Yielder other{'Y', 3};
        greenthread_create(yield_in_loop, &other);
        greenthreads_run();
        EXPECT_EQ(trace, "YYYT");
        EXPECT_EQ(live_threads, 0);
        EXPECT_EQ(wake.timer.heapIndex, 0u);
        EXPECT_EQ(wake.thread->runnable, kFinished);
        EXPECT_EQ(free_threads, wake.thread) << "the timer's thread finished last";
        EXPECT_EQ(guardEvents, 0) << "the wait ignored the armed timer";
        SelRemFD(guard);
        close(guard);
    }
    DeInitEpoll();
}

/* Every green thread waits on a descriptor and no timer is armed: the run
 * loop sleeps in the kernel until the descriptor wakes it, in either mode. */
TEST_F(Scheduler, AllWaitingWithoutATimerSleepsInTheKernel) {
    for (const bool epoll : {false, true}) {
        SCOPED_TRACE(epoll ? "epoll mode" : "select mode");
        if (epoll) {
            ASSERT_EQ(SelUseEpoll(), 0);
        }
        SelRemoveAllTimers(); // the reaper's, when this thread owns it
        static qorbu::test::SocketPair pair;
        static char byte;
        greenthread_create([](void *) { EXPECT_EQ(nb_read(pair.fd[0], &byte, 1), 1); }, nullptr);
        std::thread writer([] {
            std::this_thread::sleep_for(std::chrono::milliseconds(1000));
            EXPECT_EQ(write(pair.fd[1], "x", 1), 1);
        });
        timespec cpuBefore, cpuAfter;
        clock_gettime(CLOCK_THREAD_CPUTIME_ID, &cpuBefore);
        const double start = qorbu::test::seconds_now();
        greenthreads_run();
        const double waited = qorbu::test::seconds_now() - start;
        clock_gettime(CLOCK_THREAD_CPUTIME_ID, &cpuAfter);
        writer.join();
        const double cpu = static_cast<double>(cpuAfter.tv_sec - cpuBefore.tv_sec) +
                           static_cast<double>(cpuAfter.tv_nsec - cpuBefore.tv_nsec) / 1e9;
        EXPECT_GE(waited, 0.9);
        EXPECT_LT(cpu, 0.4 * waited) << "the run loop spun for " << cpu << " s of " << waited << " s";
    }
    DeInitEpoll();
}

TEST(SchedulerUninitialised, CallsBeforeInitDoNothingHarmful) {
    EXPECT_EQ(current_greenthread(), nullptr);
    EXPECT_EQ(greenthread_create(do_nothing, nullptr), nullptr);
    greenthread_yield();
    greenthread_block();
    greenthreads_run();
    EXPECT_EQ(live_threads, 0);
}

} // namespace
