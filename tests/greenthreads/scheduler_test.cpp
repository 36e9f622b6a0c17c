// The run queue, block and wakeup, record reuse, the run loop and stacks.
// The main context drives the threads one pass at a time and the queue is
// checked after each, so a fault in it fails an assertion instead of hanging.
#include <csignal>

#include "gt_test_support.h"

using namespace qorbu::test;

namespace {

std::string trace;
void *letter(char c) { return reinterpret_cast<void *>(static_cast<intptr_t>(c)); }
void log_twice(void *name) {
    for (int i = 0; i < 2; ++i)
        trace += static_cast<char>(reinterpret_cast<intptr_t>(name)), greenthread_yield();
}

/* Length of the run queue; -1 unless it is a list of runnable records that
 * ends at the tail (a cycle included). */
int queued() {
    int n = 0;
    const Greenthread *last = nullptr;
    for (const Greenthread *t = run_queue_head; t != nullptr; last = t, t = t->next)
        if (++n > 50 || t->runnable != kRunnable) return -1;
    return last == run_queue_tail ? n : -1;
}

TEST_F(GreenThreads, RunQueueIsFifoAndTheMainContextTakesOneTurnPerPass) {
    greenthread_create(log_twice, letter('A'));
    greenthread_create(log_twice, letter('B'));
    EXPECT_EQ(trace, "") << "a new thread waits for its creator to yield";
    EXPECT_EQ(queued(), 2);
    // Trace, queue length and live threads after each pass; in the last, yielding alone returns at once.
    const std::tuple<const char *, int, int> passes[] = {
        {"AB", 2, 2}, {"ABAB", 2, 2}, {"ABAB", 0, 0}, {"ABAB", 0, 0}};
    for (const auto &[expected, length, live] : passes) {
        greenthread_yield();
        EXPECT_EQ(trace, expected);
        EXPECT_EQ(queued(), length);
        EXPECT_EQ(live_threads, live);
    }
}

TEST_F(GreenThreads, WakeupQueuesOnlyABlockedThreadAndOnlyOnce) {
    static int wakeups;
    Greenthread *sleeper =
        greenthread_create([](void *) { greenthread_block(), ++wakeups, greenthread_block(); }, nullptr);
    greenthread_wakeup(sleeper);     // queued
    greenthread_wakeup(main_thread); // running
    EXPECT_EQ(queued(), 1);
    greenthread_yield();
    EXPECT_EQ(queued(), 0) << "a blocking thread was queued";
    greenthread_wakeup(sleeper);
    greenthread_wakeup(sleeper);
    EXPECT_EQ(queued(), 1);
    greenthread_yield();
    greenthread_yield(); // nothing to run: the sleeper stays blocked
    EXPECT_EQ(wakeups, 1);
    EXPECT_EQ(sleeper->runnable, kBlocked);
    greenthread_wakeup(sleeper);
    greenthread_yield();
    EXPECT_EQ(live_threads, 0);
    EXPECT_EQ(free_threads, sleeper);
    greenthread_wakeup(sleeper); // finished: nothing to queue
    EXPECT_EQ(queued(), 0);

    static int queued_meanwhile; // the main context never blocks: it stays queued
    greenthread_create([](void *) { queued_meanwhile = queued(), greenthread_wakeup(main_thread); }, nullptr);
    greenthread_block();
    EXPECT_EQ(queued_meanwhile, 1);
    EXPECT_EQ(live_threads, 0);
}

TEST_F(GreenThreads, FinishedRecordsAreReusedNewestFirstWithTheirStacks) {
    static intptr_t arg;
    static void *frame;
    auto note = [](void *a) { arg = reinterpret_cast<intptr_t>(a), frame = __builtin_frame_address(0); };
    Greenthread *first = greenthread_create(note, letter(1)), *second = greenthread_create(note, letter(2));
    greenthread_yield();
    ASSERT_EQ(free_threads, second);
    void *const top = frame;
    ASSERT_EQ(greenthread_create(note, letter(3)), second);
    greenthread_yield();
    EXPECT_EQ(arg, 3);
    EXPECT_EQ(frame, top) << "a reused record starts afresh on the same stack";
    ASSERT_EQ(greenthread_create(note, letter(4)), second);
    ASSERT_EQ(greenthread_create(note, letter(5)), first);
    Greenthread *fresh = greenthread_create(note, letter(6));
    EXPECT_TRUE(fresh != first && fresh != second);
    EXPECT_EQ(queued(), 3);
    greenthread_yield();
    EXPECT_EQ(arg, 6);
    EXPECT_EQ(live_threads, 0);
}

int count_pass(int, unsigned, void *passes, SelFdEntry *) { return ++*static_cast<int *>(passes), 0; }

TEST_F(GreenThreads, RunLoopWaitsInTheSelectorOnlyWhenEveryThreadIsBlocked) {
    Pipe ready;
    ready.fill();
    int passes = 0;
    ASSERT_EQ(SelAddFD(ready.r, SEL_READ, 0, count_pass, &passes), 0);
    greenthreads_run(); // no thread: no selector pass
    EXPECT_EQ(passes, 0);
    SelRemFD(ready.r);

    static SelTimer wake;
    wake.callback = [](SelTimer *timer) {
        return greenthread_wakeup(static_cast<Greenthread *>(timer->arg)), 0;
    };
    auto sleeper = [] {
        wake.arg = current_greenthread();
        SelMakeWhen(&wake.when, 0, 20'000'000);
        SelAddTimer(&wake);
        greenthread_block();
        trace += 'T';
    };
    spawn(&sleeper);
    greenthread_create(log_twice, letter('Y'));
    EXPECT_TRUE(run_for(10));
    EXPECT_EQ(trace, "YYT");
}

uintptr_t guard;
__attribute__((noinline)) int recurse(int depth) {
    volatile char frame[256];
    frame[0] = static_cast<char>(depth);
    return depth < 1 << 30 ? recurse(depth + 1) + frame[0] : 0;
}

[[noreturn]] void overflow(uintptr_t guard_page) {
    static char alt_stack[64 * 1024];
    const stack_t alt = {alt_stack, 0, sizeof alt_stack};
    struct sigaction on_segv = {};
    on_segv.sa_flags = SA_SIGINFO | SA_ONSTACK;
    on_segv.sa_sigaction = [](int, siginfo_t *info, void *) {
        const uintptr_t above_guard = reinterpret_cast<uintptr_t>(info->si_addr) - guard;
        _exit(above_guard < static_cast<uintptr_t>(page_size) ? 42 : 3);
    };
    guard = guard_page;
    sigaltstack(&alt, nullptr), sigaction(SIGSEGV, &on_segv, nullptr), greenthreads_run();
    _exit(0);
}

TEST_F(GreenThreads, StacksAreGuardedAndNotExecutableAndOverflowFaultsOnTheThreadsOwnGuardPage) {
    const Greenthread *thread = greenthread_create([](void *) { recurse(0); }, nullptr);
    greenthread_create([](void *) {}, nullptr); // a neighbouring stack below
    const auto base = reinterpret_cast<uintptr_t>(thread->context.uc_stack.ss_sp);
    const size_t size = thread->context.uc_stack.ss_size, page = static_cast<size_t>(page_size);
    EXPECT_EQ(size - page, std::max<size_t>(16384, page)) << "16 KiB in whole pages above the guard page";
    EXPECT_TRUE(mapping_at(base).inaccessible());
    EXPECT_EQ(mapping_at(base + page).perms, "rw-p");
    EXPECT_TRUE(mapping_at(base + page).starts_here);
    EXPECT_EQ(mapping_at(base + size - 1).perms, "rw-p");
    EXPECT_EXIT(overflow(base), ::testing::ExitedWithCode(42), "");
}

} // namespace
