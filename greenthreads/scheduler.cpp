/* The green-thread scheduler: one FIFO run queue for the process, cooperative
 * switches with swapcontext, and the run loop that falls back on the
 * selector when every green thread is blocked. */
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include "greenthreads/greenthread_private.h"
#include "selector/sel_private.h"

#ifdef QORBU_GT_ASAN
#include <sanitizer/common_interface_defs.h>
#endif
#ifdef QORBU_GT_TSAN
#include <sanitizer/tsan_interface.h>
#endif

namespace qorbu::gt {

Greenthread *run_queue_head;
Greenthread *run_queue_tail;
Greenthread *current_thread;
Greenthread *free_threads;
Greenthread *main_thread;
long page_size;
int live_threads;

namespace {

/* --- telling the sanitizers about stack switches ------------------------ */

#ifdef QORBU_GT_ASAN
/* The main context's stack is learnt when the first green thread starts:
 * AddressSanitizer reports the stack that was left. */
const void *main_stack_bottom;
size_t main_stack_size;
Greenthread *switched_from;

void asan_leave(void **fake_stack_save, Greenthread *to) {
    if (to == main_thread) {
        __sanitizer_start_switch_fiber(fake_stack_save, main_stack_bottom, main_stack_size);
        return;
    }
    const stack_t &stack = to->context.uc_stack;
    __sanitizer_start_switch_fiber(fake_stack_save, static_cast<char *>(stack.ss_sp) + page_size,
                                   stack.ss_size - static_cast<size_t>(page_size));
}

void asan_arrive(void *fake_stack_save) {
    const void *bottom = nullptr;
    size_t size = 0;
    __sanitizer_finish_switch_fiber(fake_stack_save, &bottom, &size);
    if (switched_from == main_thread && main_stack_size == 0) {
        main_stack_bottom = bottom;
        main_stack_size = size;
    }
}
#endif

/* Saves the caller in its record and resumes `to`. A finishing thread never
 * comes back, so its sanitizer bookkeeping is released on the way out. */
int switch_context(Greenthread *from, Greenthread *to, [[maybe_unused]] bool finishing) {
#ifdef QORBU_GT_TSAN
    __tsan_switch_to_fiber(to->tsan_fiber, 0);
#endif
#ifdef QORBU_GT_ASAN
    void *fake_stack = nullptr;
    switched_from = from;
    asan_leave(finishing ? nullptr : &fake_stack, to);
    const int result = swapcontext(&from->context, &to->context);
    asan_arrive(fake_stack);
    return result;
#else
    return swapcontext(&from->context, &to->context);
#endif
}

void announce_thread_start() {
#ifdef QORBU_GT_ASAN
    asan_arrive(nullptr);
#endif
}

void prepare_tsan_fiber([[maybe_unused]] Greenthread *thread, [[maybe_unused]] bool reused) {
#ifdef QORBU_GT_TSAN
    if (reused) __tsan_destroy_fiber(thread->tsan_fiber);
    thread->tsan_fiber = __tsan_create_fiber(0);
#endif
}

/* --- run queue ---------------------------------------------------------- */

Greenthread *run_queue_take() {
    Greenthread *head = run_queue_head;
    if (head == nullptr) return nullptr;
    run_queue_head = head->next;
    if (run_queue_tail == head) run_queue_tail = nullptr;
    return head;
}

void run_queue_push_front(Greenthread *thread) {
    thread->next = run_queue_head;
    run_queue_head = thread;
    if (run_queue_tail == nullptr) run_queue_tail = thread;
}

/* A failed switch leaves the caller running and runnable, and the record it
 * meant to resume back at the head of the queue. */
void undo_switch(Greenthread *self, Greenthread *next, Greenthread *tail_before, bool self_queued) {
    fprintf(stderr, "swapcontext() failed: %s\n", strerror(errno));
    if (self_queued) {
        run_queue_tail = tail_before;
        if (tail_before != nullptr)
            tail_before->next = nullptr;
        else
            run_queue_head = nullptr;
    }
    run_queue_push_front(next);
    self->runnable = kRunnable;
    current_thread = self;
}

/* Takes the head of the queue before queueing the caller: the same order as
 * queueing first, without switching to oneself when nothing else waits. */
void switch_to_next(bool finishing) {
    Greenthread *self = current_thread;
    Greenthread *next = run_queue_take();
    if (next == nullptr) {
        /* Only a runnable caller can be alone; a caller that tried to block
         * with nobody to switch to keeps running rather than hang. */
        self->runnable = kRunnable;
        return;
    }
    Greenthread *const tail_before = run_queue_tail;
    const bool self_queued = self->runnable == kRunnable;
    if (self_queued) run_queue_append(self);
    current_thread = next;
    if (switch_context(self, next, finishing) != 0) undo_switch(self, next, tail_before, self_queued);
}

/* Every green thread waits: in epoll mode the pass sleeps until a
 * descriptor or a signal wakes it even when no timer is armed, rather than
 * come straight back and spin. */
void wait_in_selector() {
    if (GetEpollFd() != 0)
        qorbu::sel::epoll_pass(true);
    else
        SelSelect();
}

/* Record allocation and stack mapping failures are fatal by design: a
 * process that catches or ignores the signal gets a null thread instead. */
void raise_out_of_memory() { kill(getpid(), SIGSEGV); }

/* Only the signal mask and the register layout are wanted from here:
 * makecontext always replaces where the context resumes, so the second
 * return of getcontext never happens and needs no setjmp-style care. */
__attribute__((noinline)) int capture_context(ucontext_t *context) { return getcontext(context); }

Greenthread *allocate_thread() {
    auto *thread = static_cast<Greenthread *>(calloc(1, sizeof(Greenthread)));
    if (thread == nullptr) {
        raise_out_of_memory();
        return nullptr;
    }
    void *stack = stack_map();
    if (stack == nullptr) {
        raise_out_of_memory();
        free(thread);
        return nullptr;
    }
    if (capture_context(&thread->context) != 0) {
        fprintf(stderr, "getcontext() failed: %s\n", strerror(errno));
        stack_unmap(stack);
        free(thread);
        return nullptr;
    }
    thread->context.uc_stack.ss_sp = stack;
    thread->context.uc_stack.ss_size = stack_mapping_length(page_size);
    thread->context.uc_link = nullptr;
    return thread;
}

Greenthread *take_free_thread() {
    Greenthread *thread = free_threads;
    if (thread != nullptr) free_threads = thread->next;
    return thread;
}

} // namespace

void run_queue_append(Greenthread *thread) {
    thread->next = nullptr;
    if (run_queue_tail != nullptr)
        run_queue_tail->next = thread;
    else
        run_queue_head = thread;
    run_queue_tail = thread;
}

void greenthread_start() {
    announce_thread_start();
    Greenthread *self = current_thread;
    self->entry(self->arg);
    self->next = free_threads;
    free_threads = self;
    --live_threads;
    /* Nothing wakes a finished record; the next greenthread_create restarts
     * its context from the top, so this frame is simply abandoned. Falling
     * off the end would end the whole process (the context has no link),
     * so a switch that failed is tried again. */
    for (;;) {
        self->runnable = kFinished;
        switch_to_next(true);
    }
}

void run_one_turn() {
    if (run_queue_head != nullptr)
        switch_to_next(false);
    else
        wait_in_selector();
}

} // namespace qorbu::gt

using namespace qorbu::gt;

extern "C" {

void greenthreads_init(void) {
    if (main_thread != nullptr) return;
    page_size = sysconf(_SC_PAGESIZE);
    auto *self = static_cast<Greenthread *>(calloc(1, sizeof(Greenthread)));
    if (self == nullptr) return;
    self->runnable = kRunnable;
#ifdef QORBU_GT_TSAN
    self->tsan_fiber = __tsan_get_current_fiber();
#endif
    main_thread = self;
    current_thread = self;
}

Greenthread *greenthread_create(GreenthreadEntry entry, void *arg) {
    if (current_thread == nullptr) {
        errno = EINVAL;
        return nullptr;
    }
    Greenthread *thread = take_free_thread();
    const bool reused = thread != nullptr;
    if (!reused && (thread = allocate_thread()) == nullptr) return nullptr;
    prepare_tsan_fiber(thread, reused);
    thread->entry = entry;
    thread->arg = arg;
    makecontext(&thread->context, greenthread_start, 0);
    thread->runnable = kRunnable;
    run_queue_append(thread);
    ++live_threads;
    return thread;
}

void greenthread_yield(void) {
    if (current_thread != nullptr) switch_to_next(false);
}

void greenthread_block(void) {
    Greenthread *self = current_thread;
    if (self == nullptr) return;
    /* The main context never blocks: it is the one that waits in the
     * selector, so for it blocking is just taking a turn. */
    if (self != main_thread) self->runnable = kBlocked;
    switch_to_next(false);
}

void greenthread_wakeup(Greenthread *thread) {
    /* Null is what a selector callback holds when it was armed before
     * greenthreads_init: there is no thread to wake. Only a blocked thread
     * is queued; a finished one stays on the free list. */
    if (thread == nullptr || thread->runnable != kBlocked) return;
    thread->runnable = kRunnable;
    run_queue_append(thread);
}

Greenthread *current_greenthread(void) { return current_thread; }

void greenthreads_run(void) {
    while (live_threads != 0) run_one_turn();
}

} // extern "C"
